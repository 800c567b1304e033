#include <IC/NodeStore.h>
#include <IC/SensorTypeNames.h>

#include <HGLog/HGLogger.h>

#include "../frame/HexText.h"

#include <algorithm>
#include <iterator>
#include <stdexcept>
#include <utility>

namespace IC {
namespace NODESTORE {

// Private to the library: the logger of this module and the display name of
// every sensor type, indexed by its value.
std::string loggerNodeStore = "Helmgard.IC.InstrumentationControl.NodeStore";

std::string NSTS[75] = {IC_SENSOR_TYPE_NAMES};

} // namespace NODESTORE

#define NS_LOG(level, ...) HGLOG_EVENT("NodeStore", NODESTORE::loggerNodeStore, level, __VA_ARGS__)

namespace {

unsigned int const kAllPairs = Node::invalid;

using Guard = std::lock_guard<std::recursive_mutex>;

Error status(unsigned char s)
{
    return Error(s, Number(Number::Generic), std::string());
}

// The two results of look-ups, built once: a copy costs far less than a
// construction, and look-ups are the store's hottest path.
Error const& found()
{
    static Error const e = status(0);
    return e;
}
Error const& notFound()
{
    static Error const e = status(1);
    return e;
}

// The nodes of a getMap list, without the holes removals left.
void appendListed(std::vector<Node*> const& listed, std::vector<Node*>& nodes)
{
    std::copy_if(listed.begin(), listed.end(), std::back_inserter(nodes),
                 [](Node* n) { return n != nullptr; });
}

} // namespace

NodeStore::NodeStore() = default;

NodeStore::~NodeStore()
{
    clear();
}

// ------------------------------------------------------------ index helpers

Node* NodeStore::registeredNode(unsigned int id) const
{
    auto it = idMap.find(id);
    return it == idMap.end() ? nullptr : it->second.node;
}

std::string const* NodeStore::cachedPath(unsigned int id) const
{
    auto it = idMap.find(id);
    return it == idMap.end() || it->second.path.empty() ? nullptr : &it->second.path;
}

void NodeStore::unlist(Node* node)
{
    auto type = sensorMap.find(static_cast<Node::SensorType>(*node));
    if (type == sensorMap.end())
        return;
    TypeList& listed = type->second;
    // The node's first place in order of addition goes.
    auto range = listed.positions.equal_range(node);
    if (range.first == range.second)
        return;
    auto first = range.first;
    for (auto it = range.first; it != range.second; ++it)
        if (it->second < first->second)
            first = it;
    listed.nodes[first->second] = nullptr;
    listed.positions.erase(first);
    std::size_t const live = listed.positions.size();
    if (live == 0) {
        sensorMap.erase(type);
        return;
    }
    // Closing the holes once they outnumber the nodes keeps each removal
    // constant on average and getMap proportional to what it lists.
    std::size_t const holes = listed.nodes.size() - live;
    if (holes <= live || holes < 64)
        return;
    std::vector<std::size_t> moved(listed.nodes.size());
    std::size_t next = 0;
    for (std::size_t i = 0; i < listed.nodes.size(); ++i) {
        moved[i] = next;
        if (listed.nodes[i])
            listed.nodes[next++] = listed.nodes[i];
    }
    listed.nodes.resize(next);
    for (auto& place : listed.positions)
        place.second = moved[place.second];
}

void NodeStore::list(Node* node)
{
    TypeList& listed = sensorMap[static_cast<Node::SensorType>(*node)];
    listed.positions.emplace(node, listed.nodes.size());
    listed.nodes.push_back(node);
}

// ---------------------------------------------------------------- registry

Error NodeStore::addNode(Node* const& node)
{
    bool isNew = false;
    return addNodeIfNew(node, isNew);
}

Error NodeStore::addNode(std::vector<Node*> const& nodes)
{
    // The outcome of each node is deliberately not reported: callers of the
    // vector form must look the nodes up.
    for (Node* node : nodes) {
        bool isNew = false;
        addNodeIfNew(node, isNew);
    }
    return status(0);
}

Error NodeStore::addNodeIfNew(Node* const& node, bool& isNew)
{
    isNew = false;
    if (!node)
        return status(1);
    Guard guard(storeLock);
    // The path is computed once: registering caches what this walk found,
    // exactly as computing it again would.
    std::vector<PendingPath> pending;
    std::string const path = walkPath(node, &pending);
    if (nodePathMap.count(path) != 0)
        return status(0);
    // Listed before the id is entered, and kept even if the id is taken.
    list(node);
    Error result = add2NodeMapWalked(node, path, pending);
    isNew = result.getStatus() == 0;
    return result;
}

Error NodeStore::addMINode(std::vector<Node*> const& nodes)
{
    Guard guard(storeLock);
    Error result = status(0);
    std::vector<PendingPath> pending;
    for (Node* node : nodes) {
        if (!node) {
            result = status(1);
            continue;
        }
        pending.clear();
        std::string const path = walkPath(node, &pending);
        if (nodePathMap.count(path) == 0)
            result = add2NodeMapWalked(node, path, pending);
        else
            result = status(6);
    }
    return result;
}

Error NodeStore::add2NodeMap(Node* const& node)
{
    std::vector<PendingPath> pending;
    std::string const path = walkPath(node, &pending);
    return add2NodeMapWalked(node, path, pending);
}

Error NodeStore::add2NodeMapWalked(Node* node, std::string const& path,
                                   std::vector<PendingPath> const& pending)
{
    unsigned int const id = node->getNodeId();
    IdEntry& entry = idMap[id];
    bool const inserted = entry.node == nullptr;
    if (inserted)
        entry.node = node;

    cachePaths(pending);
    node->setPath(path);

    // A node without a parent (ROOT, OsHw, OsSw and IPMI are the expected
    // ones) simply gets an empty linked path.
    std::string linkedPath;
    unsigned int const lid = node->getLinkedId();
    Node* parent = nullptr;
    if (lid != 0 && nodeId2Node(lid, &parent).getStatus() == 0)
        linkedPath = calcNodePath(parent);
    node->setLinkedPath(linkedPath);

    if (inserted)
        return status(0);
    // Reported as add2NodeMap's own, which this is the second half of.
    HGLog::logEvent("add2NodeMap", "NodeStore", __LINE__, NODESTORE::loggerNodeStore, 6000,
                    "add2NodeMap: Node ", id, " found twice during NodeId to Node Map");
    return Error("NodeStore Duplicated Node Pointer", 1);
}

Error NodeStore::add2NodeMap(std::vector<Node*> const& nodes)
{
    for (Node* node : nodes) {
        Error result = add2NodeMap(node);
        if (result.getStatus() != 0)
            return result;
    }
    return status(0);
}

Error NodeStore::delNode(Node* const& node)
{
    Guard guard(storeLock);
    delOneNode(node);
    return status(0);
}

void NodeStore::delOneNode(Node* const& node)
{
    auto byId = idMap.find(node->getNodeId());
    if (byId != idMap.end()) {
        byId->second.node = nullptr;
        if (byId->second.path.empty())
            idMap.erase(byId);
    }
    byId = idMap.find(node->getNodeId());
    if (byId != idMap.end()) {
        byId->second.path.clear();
        if (!byId->second.node)
            idMap.erase(byId);
    }
    // Of the paths that lead to this node, the smallest goes.
    auto range = pathsOfNode.equal_range(node);
    if (range.first != range.second) {
        auto smallest = range.first;
        for (auto it = range.first; it != range.second; ++it)
            if (*it->second < *smallest->second)
                smallest = it;
        nodePathMap.erase(nodePathMap.find(*smallest->second));
        pathsOfNode.erase(smallest);
    }
    unlist(node);
}

void NodeStore::erase(std::string path)
{
    Guard guard(storeLock);
    Node* node = nullptr;
    if (nodePath2Node(std::move(path), &node).getStatus() == 0)
        delOneNode(node);
}

void NodeStore::delNodeFromGetMap(std::string const& path)
{
    Guard guard(storeLock);
    Node* node = nullptr;
    if (nodePath2Node(path, &node).getStatus() == 0)
        unlist(node);
}

void NodeStore::clear()
{
    // Callers need not hold the lock; taking it costs nothing when they do
    // and keeps a first open safe against a client still querying.
    Guard guard(storeLock);
    pathsOfNode.clear();
    nodePathMap.clear();
    idMap.clear();
    sensorMap.clear();
}

Error NodeStore::getNode(unsigned int id, Node** node) const
{
    // Looked up here rather than through nodeId2Node: an exported member is
    // called through the procedure linkage table, which this path avoids.
    Guard guard(storeLock);
    auto it = idMap.find(id);
    if (it == idMap.end() || !it->second.node)
        return notFound();
    *node = it->second.node;
    return found();
}

Error NodeStore::getNode(std::string path, Node** node) const
{
    Guard guard(storeLock);
    auto it = nodePathMap.find(path);
    if (it == nodePathMap.end())
        return notFound();
    *node = it->second;
    return found();
}

Error NodeStore::nodeId2Node(unsigned int id, Node** node) const
{
    Node* const registered = registeredNode(id);
    if (!registered)
        return notFound();
    *node = registered;
    return found();
}

Error NodeStore::nodePath2Node(std::string path, Node** node) const
{
    auto it = nodePathMap.find(path);
    if (it == nodePathMap.end())
        return notFound();
    *node = it->second;
    return found();
}

Error NodeStore::getMap(std::vector<Node*>& nodes) const
{
    Guard guard(storeLock);
    nodes.clear();
    for (auto const& type : sensorMap)
        appendListed(type.second.nodes, nodes);
    return found();
}

Error NodeStore::getMap(std::vector<Node*>& nodes, unsigned int sensor) const
{
    Guard guard(storeLock);
    nodes.clear();
    auto type = sensorMap.find(static_cast<Node::SensorType>(sensor));
    if (type != sensorMap.end())
        appendListed(type->second.nodes, nodes);
    return found();
}

Error NodeStore::getAllNodes(std::vector<Node*>& nodes) const
{
    std::vector<std::pair<unsigned int, Node*> > byId;
    {
        Guard guard(storeLock);
        byId.reserve(idMap.size());
        for (auto const& entry : idMap)
            if (entry.second.node)
                byId.emplace_back(entry.first, entry.second.node);
    }
    std::sort(byId.begin(), byId.end(),
              [](auto const& a, auto const& b) { return a.first < b.first; });
    nodes.clear();
    nodes.reserve(byId.size());
    for (auto const& entry : byId)
        nodes.push_back(entry.second);
    return status(0);
}

// ------------------------------------------------------ paths and hierarchy

std::string NodeStore::calcNodePath(Node* node)
{
    std::vector<PendingPath> pending;
    std::string path = walkPath(node, &pending);
    cachePaths(pending);
    return path;
}

std::string NodeStore::calcPathFromLinkedId(Node* node) const
{
    return walkPath(node, nullptr);
}

void NodeStore::cachePaths(std::vector<PendingPath> const& pending)
{
    // Neither index is overwritten: a cached path stays, and the first node
    // to claim a path keeps it.
    for (PendingPath const& p : pending) {
        std::string& cached = idMap[p.node->getNodeId()].path;
        if (cached.empty())
            cached = p.path;
        auto const added = nodePathMap.emplace(p.path, p.node);
        if (added.second)
            pathsOfNode.emplace(p.node, &added.first->first);
    }
}

std::string NodeStore::walkPath(Node* node, std::vector<PendingPath>* pending) const
{
    if (std::string const* cached = cachedPath(node->getNodeId()))
        return *cached;

    // Up: from the node to its nearest ancestor with a cached path, or to
    // the topmost registered one, which then counts as a root.
    std::vector<Node*> chain{node};
    Node* current = node;
    std::string base;
    for (;;) {
        unsigned int const lid = current->getLinkedId();
        if (lid == 0 || lid == current->getNodeId())
            break;
        if (std::string const* parentPath = cachedPath(lid)) {
            base = *parentPath;
            break;
        }
        Node* parent = nullptr;
        if (getNode(lid, &parent).getStatus() != 0)
            break;
        // Registered nodes always have a cached path, so the walk cannot
        // loop; this bound only guards against a store corrupted by a
        // plug-in that changed ids of registered nodes.
        if (chain.size() > idMap.size())
            break;
        current = parent;
        chain.push_back(current);
    }

    // Down: each node's own pair in front of its parent's pairs.
    TopoVec topovec;
    while (!chain.empty()) {
        Node* n = chain.back();
        topovec.clear();
        topovec.emplace_back(n->getSensor(), n->getInstance());
        if (!base.empty())
            uniqueid2topovec(base, kAllPairs, topovec);
        base = nodecode(topovec);
        if (pending)
            pending->push_back(PendingPath{n, base});
        chain.pop_back();
    }
    return base;
}

std::string NodeStore::getNodePath(Node* node)
{
    if (!node)
        return std::string();
    Guard guard(storeLock);
    return calcNodePath(node);
}

std::string NodeStore::getNodeHierarchy(Node* node, Node::SensorType stop)
{
    std::string result;
    if (!node)
        return result;
    TopoVec topovec;
    uniqueid2topovec(getNodePath(node), stop, topovec);
    NS_LOG(3000, "topovec.size = ", topovec.size());
    while (!topovec.empty()) {
        unsigned int type = topovec.back().first;
        if (type > Node::invalid) {
            NS_LOG(6000, " getNodeHierarchy: parent sensor value invalid: ", type);
            type = Node::invalid;
        }
        result += NODESTORE::NSTS[type];
        result += ':';
        result += int2hex(topovec.back().second);
        topovec.pop_back();
        if (!topovec.empty())
            result += "->";
    }
    NS_LOG(3000, " Hierarchy = ", result);
    return result;
}

std::string NodeStore::getNodeHierarchy(Node* node)
{
    return getNodeHierarchy(node, Node::invalid);
}

Node::SensorType NodeStore::nodePathToSensor(std::string path) const
{
    Guard guard(storeLock);
    Node* node = nullptr;
    if (nodePath2Node(std::move(path), &node).getStatus() == 0)
        return node->getSensor();
    return Node::invalid;
}

// --------------------------------------------------------------- path codes

std::string NodeStore::int2hex(unsigned int n) const
{
    static char const digits[] = "0123456789abcdef";
    std::string out(8, '0');
    for (int i = 7; i >= 0 && n != 0; --i, n >>= 4)
        out[static_cast<std::size_t>(i)] = digits[n & 15];
    return out;
}

std::string NodeStore::int2chr(unsigned int n) const
{
    if (n == 0)
        return "b";
    unsigned int const original = n;
    char digits[16];
    std::size_t pos = sizeof digits;
    while (n != 0) {
        unsigned int const r = n % 12;
        n /= 12;
        if (r > 11) { // cannot happen; kept as a guard against a damaged number
            NS_LOG(6000, "int2chr: Damaged number ='", original, "' remainder='", r, "'");
            throw std::invalid_argument("Damaged number");
        }
        digits[--pos] = static_cast<char>('b' + r);
    }
    return std::string(digits + pos, sizeof digits - pos);
}

std::string NodeStore::b12String(std::string s) const
{
    std::string out;
    out.reserve(s.size() * 2);
    for (unsigned char c : s) {
        out += static_cast<char>('A' + (c >> 4));
        out += static_cast<char>('A' + (c & 15));
    }
    return out;
}

std::string NodeStore::hexstring(std::string const& s) const
{
    return detail::hexText(s);
}

namespace {

// Value of each hexadecimal digit; 0xFF for any other character.
struct HexDigits {
    unsigned char value[256];
    constexpr HexDigits() : value()
    {
        for (int c = 0; c < 256; ++c)
            value[c] = 0xFF;
        for (int c = '0'; c <= '9'; ++c)
            value[c] = static_cast<unsigned char>(c - '0');
        for (int c = 'a'; c <= 'f'; ++c)
            value[c] = static_cast<unsigned char>(c - 'a' + 10);
        for (int c = 'A'; c <= 'F'; ++c)
            value[c] = static_cast<unsigned char>(c - 'A' + 10);
    }
};
constexpr HexDigits kHexDigits;

} // namespace

std::string NodeStore::stringhex(std::string const& s) const
{
    // The text is read as if one padding digit "0" followed it: an odd
    // length ends with a low nibble of 0, an even one with an ignored half
    // byte. Errors are reported for the first bad character or byte.
    enum class Fault { None, Digit, NullByte } fault = Fault::None;
    auto const* const text = reinterpret_cast<unsigned char const*>(s.data());
    std::size_t const pairs = s.size() / 2;
    std::string result((s.size() + 1) / 2, '\0');
    for (std::size_t k = 0; k < pairs && fault == Fault::None; ++k) {
        unsigned int const high = kHexDigits.value[text[2 * k]];
        unsigned int const low = kHexDigits.value[text[2 * k + 1]];
        unsigned int const byte = high << 4 | low;
        if ((high | low) > 15)
            fault = Fault::Digit;
        else if (byte == 0)
            fault = Fault::NullByte;
        else
            result[k] = static_cast<char>(byte);
    }
    if (fault == Fault::None && s.size() % 2 != 0) {
        unsigned int const high = kHexDigits.value[text[s.size() - 1]];
        if (high > 15)
            fault = Fault::Digit;
        else if (high == 0)
            fault = Fault::NullByte;
        else
            result[pairs] = static_cast<char>(high << 4);
    }
    if (fault == Fault::Digit) {
        NS_LOG(3000, "stringHex: Invalid hexadecimal digit ", hexstring(s));
        throw std::invalid_argument("Invalid hexadecimal digit");
    }
    if (fault == Fault::NullByte) {
        NS_LOG(3000, "stringHex: Invalid null byte ", s);
        throw std::invalid_argument("Invalid null byte");
    }
    return result;
}

void NodeStore::uniqueid2topovec(std::string uid, unsigned int stop, TopoVec& topovec) const
{
    // Reads the nibbles directly: 0 ends a pair, 1..12 are base-12 digits,
    // 13 and 14 are skipped, 15 separates the instance from the type. A
    // path whose last nibble does not end a pair is ended as if it did.
    if (uid.empty())
        return;
    unsigned int first = 0;
    unsigned int second = 0;
    unsigned int* target = &second;
    auto const take = [&](unsigned int nibble) {
        if (nibble == 0) {
            topovec.emplace_back(first, second);
            if (first == stop)
                return false;
            first = 0;
            second = 0;
            target = &second;
        } else if (nibble == 15) {
            target = &first;
        } else if (nibble < 13) {
            *target = *target * 12 + (nibble - 1);
        }
        return true;
    };
    for (unsigned char c : uid)
        if (!take(c >> 4u) || !take(c & 15u))
            return;
    if ((static_cast<unsigned char>(uid.back()) & 15u) != 0)
        take(0);
}

std::string NodeStore::nodecode(TopoVec topovec) const
{
    // Only an empty list can be damaged: every pair gives valid letters.
    if (topovec.empty()) {
        NS_LOG(6000, "nodecode: Damaged node string ='", "", "'");
        throw std::invalid_argument("Damaged node string");
    }
    // The letters go straight to nibbles (a=0 .. p=15), packed two to a
    // byte; a final odd nibble, always the closing "a", is dropped.
    std::string out;
    out.reserve(topovec.size() * 3);
    int high = -1;
    auto const put = [&out, &high](unsigned int nibble) {
        if (high < 0) {
            high = static_cast<int>(nibble);
            return;
        }
        if (char const byte = static_cast<char>(high << 4 | static_cast<int>(nibble)))
            out += byte;
        high = -1;
    };
    auto const putNumber = [&put](unsigned int n) {
        unsigned char digits[12];
        std::size_t count = 0;
        do {
            digits[count++] = static_cast<unsigned char>(1 + n % 12);
            n /= 12;
        } while (n != 0);
        while (count != 0)
            put(digits[--count]);
    };
    for (auto const& pair : topovec) {
        putNumber(pair.second);
        put(15);
        putNumber(pair.first);
        put(0);
    }
    return out;
}

} // namespace IC
