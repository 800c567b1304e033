#include <IC/NodeStore.h>
#include <IC/SensorTypeNames.h>

#include <HGLog/HGLogger.h>

#include "../frame/HexText.h"
#include "FlatIndex.h"

#include <algorithm>
#include <iterator>
#include <map>
#include <unordered_map>
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

// Writes a path's nibbles (a=0 .. p=15) packed two to a byte. A zero byte
// is never written, and a final odd nibble, always a pair's closing 0, is
// left out.
class PathPacker {
public:
    explicit PathPacker(std::string& out) : out_(out) {}

    void put(unsigned int nibble)
    {
        if (high_ < 0) {
            high_ = static_cast<int>(nibble);
            return;
        }
        if (char const byte = static_cast<char>(high_ << 4 | static_cast<int>(nibble)))
            out_ += byte;
        high_ = -1;
    }
    // A pair: the instance's base-12 digits, 15, the type's digits, 0.
    void putPair(unsigned int type, unsigned int instance)
    {
        putNumber(instance);
        put(15);
        putNumber(type);
        put(0);
    }
    // True when what follows starts a byte of its own.
    bool aligned() const { return high_ < 0; }

private:
    void putNumber(unsigned int n)
    {
        unsigned char digits[12];
        std::size_t count = 0;
        do {
            digits[count++] = static_cast<unsigned char>(1 + n % 12);
            n /= 12;
        } while (n != 0);
        while (count != 0)
            put(digits[--count]);
    }

    std::string& out_;
    int high_ = -1;
};

// The path of a node below a parent whose path is known: the node's own
// pair in front of the parent's pairs as uniqueid2topovec reads them (up
// to and including the first invalid one). These are the bytes nodecode
// gives, without decoding the parent's path and encoding it again.
std::string extendPath(std::string const& parent, unsigned int type, unsigned int instance)
{
    // The parent's nibbles: its bytes', and the closing 0 its packing
    // dropped when its last nibble is a digit. Only its first pair counts
    // when that pair is invalid (the parent's own type); a cached path has
    // no other invalid pair but its last.
    std::size_t const whole = 2 * parent.size() + (!parent.empty() && (parent.back() & 15) != 0);
    auto const nibble = [&parent](std::size_t i) -> unsigned int {
        return i / 2 < parent.size() ? (static_cast<unsigned char>(parent[i / 2]) >> (i % 2 ? 0 : 4)) & 15u : 0u;
    };
    std::size_t count = whole;
    unsigned int firstType = 0;
    bool inType = false;
    for (std::size_t i = 0; i < whole; ++i) {
        unsigned int const v = nibble(i);
        if (v == 0) {
            if (firstType == Node::invalid)
                count = i + 1;
            break;
        }
        if (v == 15)
            inType = true;
        else if (inType && v < 13)
            firstType = firstType * 12 + (v - 1);
    }

    std::string out;
    out.reserve(12 + parent.size());
    PathPacker packer(out);
    packer.putPair(type, instance);
    if (count == whole && packer.aligned())
        return out += parent; // in step: the parent's bytes as they are
    for (std::size_t i = 0; i < count; ++i)
        packer.put(nibble(i));
    return out;
}

// The nodes of a getMap list, without the holes removals left.
void appendListed(std::vector<Node*> const& listed, std::vector<Node*>& nodes)
{
    std::copy_if(listed.begin(), listed.end(), std::back_inserter(nodes),
                 [](Node* n) { return n != nullptr; });
}

// Hashes a path a byte at a time (FNV-1a), then spreads the result into the
// upper bits the index takes its home slots from. A look-up's path is a copy
// its caller has just written (getNode takes it by value); reading those
// bytes in wider words than they were written in cannot be served from the
// pending writes, which holds each look-up back until the previous one has
// finished its memory accesses.
std::uint32_t pathHash(std::string const& path)
{
    std::uint64_t h = 14695981039346656037ull;
    for (char c : path)
        h = (h ^ static_cast<unsigned char>(c)) * 1099511628211ull;
    return static_cast<std::uint32_t>((h * 0x9E3779B97F4A7C15ull) >> 32);
}

std::uint32_t idHash(unsigned int id)
{
    return static_cast<std::uint32_t>((id * 0x9E3779B97F4A7C15ull) >> 32);
}

std::uint32_t const kNoPath = 0xFFFFFFFF;

} // namespace

// Every path the store knows is held once, as a record: the path index
// finds it by its text, and the cached path of a node id names it.
// A record lives while a node is registered under it or an id caches it.
struct NodeStore::Indexes {
    struct PathRecord {
        std::string text;
        Node* owner = nullptr;     // registered under this path, if any
        std::uint32_t caches = 0;  // node ids whose cached path this is
    };

    // Records in blocks that never move, numbered so that index slots stay
    // small; freed numbers are used again.
    class Records {
    public:
        PathRecord& operator[](std::uint32_t r) { return blocks[r >> kBits][r & (kBlock - 1)]; }
        PathRecord const& operator[](std::uint32_t r) const
        {
            return blocks[r >> kBits][r & (kBlock - 1)];
        }
        std::uint32_t add(std::string const& text)
        {
            std::uint32_t r = 0;
            if (!freed.empty()) {
                r = freed.back();
                freed.pop_back();
            } else {
                if (used % kBlock == 0)
                    blocks.push_back(std::make_unique<PathRecord[]>(kBlock));
                r = used++;
            }
            (*this)[r].text = text;
            return r;
        }
        void free(std::uint32_t r)
        {
            (*this)[r] = PathRecord();
            freed.push_back(r);
        }
        void clear()
        {
            blocks.clear();
            freed.clear();
            used = 0;
        }

    private:
        static constexpr unsigned int kBits = 10;
        static constexpr std::uint32_t kBlock = 1u << kBits;
        std::vector<std::unique_ptr<PathRecord[]> > blocks;
        std::vector<std::uint32_t> freed;
        std::uint32_t used = 0;
    };

    // What the store knows under one node id: the registered node (the id
    // index) and the cached path (the path cache); at least one of them.
    struct IdSlot {
        unsigned int id = 0;
        std::uint32_t path = kNoPath;
        Node* node = nullptr;
        bool empty() const { return node == nullptr && path == kNoPath; }
        std::uint32_t hash() const { return idHash(id); }
    };
    struct PathSlot {
        std::uint32_t h = 0;
        std::uint32_t record = kNoPath;
        bool empty() const { return record == kNoPath; }
        std::uint32_t hash() const { return h; }
    };

    // The nodes of one sensor type in order of addition. A removed node
    // leaves a hole until holes outnumber nodes; positions finds a node's
    // places without a search.
    struct TypeList {
        std::vector<Node*> nodes;
        std::unordered_multimap<Node*, std::size_t> positions;
    };

    IdSlot* id(unsigned int key)
    {
        return ids.find(idHash(key), [key](IdSlot const& s) { return s.id == key; });
    }
    IdSlot const* id(unsigned int key) const
    {
        return ids.find(idHash(key), [key](IdSlot const& s) { return s.id == key; });
    }

    PathSlot const* path(std::string const& text, std::uint32_t h) const
    {
        return paths.find(h, [this, &text, h](PathSlot const& s) {
            return s.h == h && records[s.record].text == text;
        });
    }
    // The node registered under text, or null.
    Node* owner(std::string const& text) const
    {
        PathSlot const* s = path(text, pathHash(text));
        return s ? records[s->record].owner : nullptr;
    }
    // The record of text, made if there is none.
    std::uint32_t record(std::string const& text)
    {
        std::uint32_t const h = pathHash(text);
        if (PathSlot const* s = path(text, h))
            return s->record;
        std::uint32_t const r = records.add(text);
        paths.insert(PathSlot{h, r});
        return r;
    }
    // Frees the record once nothing holds it.
    void release(std::uint32_t r)
    {
        PathRecord const& rec = records[r];
        if (rec.owner || rec.caches != 0)
            return;
        std::uint32_t const h = pathHash(rec.text);
        paths.erase(paths.find(h, [r](PathSlot const& s) { return s.record == r; }));
        records.free(r);
    }

    // By sensor type (ascending): what getMap lists.
    std::map<Node::SensorType, TypeList> sensorMap;
    detail::FlatIndex<IdSlot> ids;
    detail::FlatIndex<PathSlot> paths;
    Records records;
    // The records each node is registered under, so that removing a node
    // needs no walk of the path index.
    std::unordered_multimap<Node*, std::uint32_t> pathsOfNode;
};

NodeStore::NodeStore() : index(std::make_unique<Indexes>()) {}

NodeStore::~NodeStore()
{
    clear();
}

// ------------------------------------------------------------ index helpers

Node* NodeStore::registeredNode(unsigned int id) const
{
    Indexes::IdSlot const* s = index->id(id);
    return s ? s->node : nullptr;
}

std::string const* NodeStore::cachedPath(unsigned int id) const
{
    Indexes::IdSlot const* s = index->id(id);
    return s && s->path != kNoPath ? &index->records[s->path].text : nullptr;
}

void NodeStore::unlist(Node* node)
{
    auto& sensorMap = index->sensorMap;
    auto type = sensorMap.find(static_cast<Node::SensorType>(*node));
    if (type == sensorMap.end())
        return;
    Indexes::TypeList& listed = type->second;
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
    Indexes::TypeList& listed = index->sensorMap[static_cast<Node::SensorType>(*node)];
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
    if (index->owner(path))
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
        if (!index->owner(path))
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
    Indexes::IdSlot* const entry = index->id(id);
    bool const inserted = !entry || !entry->node;
    if (!entry)
        index->ids.insert(Indexes::IdSlot{id, kNoPath, node});
    else if (inserted)
        entry->node = node;

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
    Indexes& ix = *index;
    if (Indexes::IdSlot* byId = ix.id(node->getNodeId())) {
        byId->node = nullptr;
        if (byId->path == kNoPath)
            ix.ids.erase(byId);
    }
    if (Indexes::IdSlot* byId = ix.id(node->getNodeId())) {
        std::uint32_t const cached = byId->path;
        byId->path = kNoPath;
        if (!byId->node)
            ix.ids.erase(byId);
        if (cached != kNoPath) {
            --ix.records[cached].caches;
            ix.release(cached);
        }
    }
    // Of the paths that lead to this node, the smallest goes.
    auto range = ix.pathsOfNode.equal_range(node);
    if (range.first != range.second) {
        auto smallest = range.first;
        for (auto it = range.first; it != range.second; ++it)
            if (ix.records[it->second].text < ix.records[smallest->second].text)
                smallest = it;
        std::uint32_t const r = smallest->second;
        ix.pathsOfNode.erase(smallest);
        ix.records[r].owner = nullptr;
        ix.release(r);
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
    index->pathsOfNode.clear();
    index->paths.clear();
    index->records.clear();
    index->ids.clear();
    index->sensorMap.clear();
}

Error NodeStore::getNode(unsigned int id, Node** node) const
{
    // Looked up here rather than through nodeId2Node: an exported member is
    // called through the procedure linkage table, which this path avoids.
    Guard guard(storeLock);
    Indexes::IdSlot const* const s = index->id(id);
    if (!s || !s->node)
        return notFound();
    *node = s->node;
    return found();
}

Error NodeStore::getNode(std::string path, Node** node) const
{
    Guard guard(storeLock);
    Node* const owner = index->owner(path);
    if (!owner)
        return notFound();
    *node = owner;
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
    Node* const owner = index->owner(path);
    if (!owner)
        return notFound();
    *node = owner;
    return found();
}

Error NodeStore::getMap(std::vector<Node*>& nodes) const
{
    Guard guard(storeLock);
    nodes.clear();
    for (auto const& type : index->sensorMap)
        appendListed(type.second.nodes, nodes);
    return found();
}

Error NodeStore::getMap(std::vector<Node*>& nodes, unsigned int sensor) const
{
    Guard guard(storeLock);
    nodes.clear();
    auto const& sensorMap = index->sensorMap;
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
        byId.reserve(index->ids.size());
        index->ids.forEach([&byId](Indexes::IdSlot const& s) {
            if (s.node)
                byId.emplace_back(s.id, s.node);
        });
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
    Indexes& ix = *index;
    for (PendingPath const& p : pending) {
        std::uint32_t const r = ix.record(p.path);
        unsigned int const id = p.node->getNodeId();
        Indexes::IdSlot* const cached = ix.id(id);
        if (!cached || cached->path == kNoPath) {
            if (cached)
                cached->path = r;
            else
                ix.ids.insert(Indexes::IdSlot{id, r, nullptr});
            ++ix.records[r].caches;
        }
        Indexes::PathRecord& claimed = ix.records[r];
        if (!claimed.owner) {
            claimed.owner = p.node;
            ix.pathsOfNode.emplace(p.node, r);
        }
    }
}

std::string NodeStore::walkPath(Node* node, std::vector<PendingPath>* pending) const
{
    if (std::string const* cached = cachedPath(node->getNodeId()))
        return *cached;

    // Most nodes arrive below a registered parent, whose path is cached.
    unsigned int const linked = node->getLinkedId();
    if (linked != 0 && linked != node->getNodeId())
        if (std::string const* parentPath = cachedPath(linked)) {
            std::string path = extendPath(*parentPath, node->getSensor(), node->getInstance());
            if (pending)
                pending->push_back(PendingPath{node, path});
            return path;
        }

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
        if (chain.size() > index->ids.size())
            break;
        current = parent;
        chain.push_back(current);
    }

    // Down: each node's own pair in front of its parent's pairs.
    while (!chain.empty()) {
        Node* n = chain.back();
        base = extendPath(base, n->getSensor(), n->getInstance());
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
    std::string out;
    out.reserve(topovec.size() * 3);
    PathPacker packer(out);
    for (auto const& pair : topovec)
        packer.putPair(pair.first, pair.second);
    return out;
}

} // namespace IC
