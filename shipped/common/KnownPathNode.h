// KnownPathNode: a shipped plug-in's node. The library sets a node's path when it
// registers it, on its own thread; the polling thread reads the path to
// address alerts. It keeps its own copy of the path under a lock, so that
// the two threads meet on that lock instead of racing on the base's field.
#pragma once

#include <IC/Node.h>

#include <mutex>
#include <string>

namespace shipped {

class KnownPathNode : public IC::Node {
public:
    using IC::Node::Node;

    IC::Error setPath(std::string const& path) override
    {
        {
            std::lock_guard<std::mutex> g(pathLock_);
            knownPath_ = path;
        }
        return IC::Node::setPath(path);
    }

    // The path the library gave; "" while the node is not registered.
    std::string knownPath() const
    {
        std::lock_guard<std::mutex> g(pathLock_);
        return knownPath_;
    }

private:
    mutable std::mutex pathLock_;
    std::string knownPath_;
};

} // namespace shipped
