#include "Forest.h"

#include "Output.h"

#include <algorithm>
#include <unordered_set>

namespace ictools {

Forest::Forest(std::vector<IC::Node*> const& nodes) : count_(nodes.size())
{
    std::unordered_map<unsigned int, IC::Node*> byId;
    std::unordered_map<std::string, IC::Node*> byPath;
    byId.reserve(nodes.size());
    byPath.reserve(nodes.size());
    for (IC::Node* n : nodes) {
        byId.emplace(n->getNodeId(), n);
        if (!n->getPath().empty())
            byPath.emplace(n->getPath(), n);
    }
    for (IC::Node* n : nodes) {
        IC::Node* parent = nullptr;
        unsigned int const linked = n->getLinkedId();
        if (linked != 0 && linked != n->getNodeId()) {
            auto it = byId.find(linked);
            if (it != byId.end())
                parent = it->second;
        }
        if (!parent && !n->getLinkedPath().empty()) {
            auto it = byPath.find(n->getLinkedPath());
            if (it != byPath.end() && it->second != n)
                parent = it->second;
        }
        if (parent)
            children_[parent].push_back(n);
        else
            roots_.push_back(n);
    }
    // Siblings by kind, then instance: discovery order means nothing to a
    // reader.
    auto byKind = [](IC::Node const* a, IC::Node const* b) {
        if (a->getSensor() != b->getSensor())
            return a->getSensor() < b->getSensor();
        return a->getInstance() < b->getInstance();
    };
    std::stable_sort(roots_.begin(), roots_.end(), byKind);
    for (auto& entry : children_)
        std::stable_sort(entry.second.begin(), entry.second.end(), byKind);
    // Nodes caught in a loop of parent links are reachable from no root.
    std::unordered_set<IC::Node const*> seen;
    std::vector<IC::Node const*> stack;
    auto reach = [&](IC::Node const* from) {
        stack.push_back(from);
        while (!stack.empty()) {
            IC::Node const* n = stack.back();
            stack.pop_back();
            if (!seen.insert(n).second)
                continue;
            for (IC::Node* c : children(n))
                stack.push_back(c);
        }
    };
    for (IC::Node* r : std::vector<IC::Node*>(roots_))
        reach(r);
    for (IC::Node* n : nodes)
        if (seen.count(n) == 0) {
            roots_.push_back(n);
            reach(n);
        }
}

std::vector<IC::Node*> const& Forest::children(IC::Node const* node) const
{
    static std::vector<IC::Node*> const none;
    auto it = children_.find(node);
    return it == children_.end() ? none : it->second;
}

void Forest::writeJson(IC::InstrumentationControl& ic,
                       std::function<void(std::string const&)> const& write) const
{
    write("{\"count\": " + std::to_string(count_) + ", \"nodes\": [");
    std::unordered_map<IC::Node const*, bool> done;
    bool first = true;
    for (IC::Node* r : roots_) {
        if (done.count(r) != 0)
            continue;
        write(first ? "\n" : ",\n");
        first = false;
        writeNode(ic, r, write, done);
    }
    write("\n]}\n");
}

void Forest::writeNode(IC::InstrumentationControl& ic, IC::Node* node,
                       std::function<void(std::string const&)> const& write,
                       std::unordered_map<IC::Node const*, bool>& done) const
{
    done.emplace(node, true);
    // The node's own members, then its children written in turn.
    std::string text = jsonLine(nodeJson(ic, *node));
    text.pop_back(); // the closing brace
    text += ",\"children\":[";
    write(text);
    bool first = true;
    for (IC::Node* c : children(node)) {
        if (done.count(c) != 0)
            continue;
        write(first ? "\n" : ",\n");
        first = false;
        writeNode(ic, c, write, done);
    }
    write("]}");
}

} // namespace ictools
