// IC::NodeStore: the registry of the nodes reported by plug-ins.
//
// It finds a node by id, by path or by sensor type, and computes and caches
// each node's path: the packed code of the chain of (sensor type, instance)
// pairs from the node up to its topmost registered ancestor. The store never
// owns a node. Every public operation may be called from any thread; the
// store's lock is re-entrant for its owner.
//
// Indexes are hash tables; the orders that callers see are kept: getMap
// lists by ascending sensor type and order of addition, and removing a node
// drops the smallest of the paths under which it is registered. Every
// per-node operation, removal included, costs the same whatever the size of
// the store.
//
// Path code: each pair is written as its instance in base 12 (letters b..m,
// most significant first), "p", its sensor type in base 12, "a"; the letter
// string is packed two letters (nibbles a=0..p=15) to a byte, first letter in
// the high nibble. The printable form is lower-case hexadecimal.
#pragma once

#include <IC/Error.h>
#include <IC/Export.h>
#include <IC/Node.h>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

namespace IC {

class IC_API NodeStore {
public:
    // (sensor type, instance) pairs, the node's own first, the root's last.
    using TopoVec = std::vector<std::pair<unsigned int, unsigned int> >;

    NodeStore();
    ~NodeStore();
    NodeStore(NodeStore const&) = delete;
    NodeStore& operator=(NodeStore const&) = delete;

    // ---- registry ----
    // Registers the node unless its path is taken (success either way).
    Error addNode(Node* const& node);
    // addNodeIfNew for each node; the result is always success.
    Error addNode(std::vector<Node*> const& nodes);
    // Registers the node, also for getMap, unless a node holds its path
    // (then success with isNew false). Status 1 for a null node.
    Error addNodeIfNew(Node* const& node, bool& isNew);
    // Registers nodes of management interfaces (not listed by getMap); the
    // result is that of the last node, status 6 when its path was taken.
    Error addMINode(std::vector<Node*> const& nodes);
    // Caller holds the lock. Enters the node by id, computes its path and
    // hands it its own and its parent's path. Status 1 for an id already held.
    Error add2NodeMap(Node* const& node);
    // add2NodeMap for each node, up to the first failure.
    Error add2NodeMap(std::vector<Node*> const& nodes);
    // Removes the node from every index; always success.
    Error delNode(Node* const& node);
    // Caller holds the lock.
    void delOneNode(Node* const& node);
    // Removes the node registered under path, if any.
    void erase(std::string path);
    // Removes the node registered under path from getMap only.
    void delNodeFromGetMap(std::string const& path);
    // Empties every index.
    void clear();

    Error getNode(unsigned int id, Node** node) const;
    Error getNode(std::string path, Node** node) const;
    // Caller holds the lock. Status 1 and *node untouched when not found.
    Error nodeId2Node(unsigned int id, Node** node) const;
    Error nodePath2Node(std::string path, Node** node) const;
    // nodes := every node added through addNode/addNodeIfNew, by ascending
    // sensor type, in order of addition within a type.
    Error getMap(std::vector<Node*>& nodes) const;
    // nodes := those of one sensor type, in order of addition.
    Error getMap(std::vector<Node*>& nodes, unsigned int sensor) const;
    // nodes := every registered node, management interfaces' included, by
    // ascending node id.
    Error getAllNodes(std::vector<Node*>& nodes) const;

    // ---- paths and hierarchy ----
    // Caller holds the lock. The node's path; caches it and the paths of
    // its uncached ancestors.
    std::string calcNodePath(Node* node);
    // Caller holds the lock. The path the node has or would have; caches
    // nothing.
    std::string calcPathFromLinkedId(Node* node) const;
    std::string getNodePath(Node* node);
    // "ROOT:00000000->Chassis:00000000->CPU:00000001", from the nearest
    // ancestor-or-self of type stop (or the root) down to the node.
    std::string getNodeHierarchy(Node* node, Node::SensorType stop);
    std::string getNodeHierarchy(Node* node);
    // Sensor type of the node registered under path; 74 when none is.
    Node::SensorType nodePathToSensor(std::string path) const;

    // ---- path codes ----
    // Eight lower-case hexadecimal digits.
    std::string int2hex(unsigned int n) const;
    // n in base 12 with the digits b..m; 0 gives "b".
    std::string int2chr(unsigned int n) const;
    // Two letters A..P per byte.
    std::string b12String(std::string s) const;
    // Two lower-case hexadecimal digits per byte.
    std::string hexstring(std::string const& s) const;
    // The bytes written by hexadecimal text (either case; an odd length is
    // padded with a final 0). Throws std::invalid_argument for a character
    // that is not a hexadecimal digit ("Invalid hexadecimal digit") or a zero
    // byte ("Invalid null byte").
    std::string stringhex(std::string const& s) const;
    // Appends the pairs of path uid to topovec, stopping after the first pair
    // whose sensor type is stop (74: all pairs).
    void uniqueid2topovec(std::string uid, unsigned int stop, TopoVec& topovec) const;
    // The path of a pair list. Throws std::invalid_argument
    // ("Damaged node string") for an empty list.
    std::string nodecode(TopoVec topovec) const;

private:
    // A path computed for a node of the walk, not yet cached.
    struct PendingPath {
        Node* node;
        std::string path;
    };
    // The indexes, defined with the store's code.
    struct Indexes;

    // The path of node, computed as calcNodePath does; the paths it would
    // cache go to pending (topmost first) when pending is not null.
    std::string walkPath(Node* node, std::vector<PendingPath>* pending) const;
    // Caches what a walk computed, as calcNodePath does.
    void cachePaths(std::vector<PendingPath> const& pending);
    // add2NodeMap for a node whose walk was just made under the same lock.
    Error add2NodeMapWalked(Node* node, std::string const& path,
                            std::vector<PendingPath> const& pending);
    Node* registeredNode(unsigned int id) const;
    std::string const* cachedPath(unsigned int id) const;
    // Enters the node last in the getMap list of its type.
    void list(Node* node);
    // Removes the node's first entry from the getMap list of its type.
    void unlist(Node* node);

    std::unique_ptr<Indexes> const index;
    // Re-entrant: path computations look nodes up under the lock they hold.
    mutable std::recursive_mutex storeLock;
};

} // namespace IC
