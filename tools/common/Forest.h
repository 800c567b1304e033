// The hardware tree as the nodes' parent links draw it, and its JSON
// document written node by node, so that a very large tree never has to be
// held as one document in memory.
#pragma once

#include <IC/InstrumentationControl.h>
#include <IC/Node.h>

#include <functional>
#include <string>
#include <unordered_map>
#include <vector>

namespace ictools {

class Forest {
public:
    // Siblings by sensor type, then instance; nodes caught in a loop of
    // parent links are shown at the top rather than lost.
    explicit Forest(std::vector<IC::Node*> const& nodes);

    std::vector<IC::Node*> const& roots() const { return roots_; }
    std::vector<IC::Node*> const& children(IC::Node const* node) const;

    // {"count": N, "nodes": [node with "children"...]}, one piece per node
    // handed to write.
    void writeJson(IC::InstrumentationControl& ic,
                   std::function<void(std::string const&)> const& write) const;

private:
    void writeNode(IC::InstrumentationControl& ic, IC::Node* node,
                   std::function<void(std::string const&)> const& write,
                   std::unordered_map<IC::Node const*, bool>& done) const;

    std::size_t count_ = 0;
    std::vector<IC::Node*> roots_;
    std::unordered_map<IC::Node const*, std::vector<IC::Node*>> children_;
};

} // namespace ictools
