#include <IC/NodeStore.h>

#include <HGLog/HGLogger.h>

#include "../frame/HexText.h"

#include <stdexcept>
#include <utility>

namespace IC {
namespace NODESTORE {

// Private to the library: the logger of this module and the display name of
// every sensor type, indexed by its value.
std::string loggerNodeStore = "Helmgard.IC.InstrumentationControl.NodeStore";

std::string NSTS[75] = {
    "Unknown", "Chassis", "BIOS", "Firmware", "CPU", "USB Controller", "USB Port",
    "Serial Port", "Parallel Port", "Video", "Floppy Drive", "Hard Drive", "Network Port",
    "BMC", "KVR", "SMBIOS", "VPD", "OS", "RAM", "DIMM", "Fan", "Voltage Sensor",
    "Temperature Sensor", "Intrusion", "PFA", "Power Supply", "Blue Light", "Front Panel",
    "Back Panel", "Network IP Configuration", "System", "Cache", "Memory Array",
    "Memory Device", "IPMI", "Log", "Tallowmere", "Service Processor", "OsHw", "OsSw",
    "Computer", "Planar", "CPU Core", "Application", "Driver", "Partition", "User",
    "LogEntry", "PFASensor", "Network Controller", "Disk Controller", "Group",
    "Kelmar Alert Config", "Diagnostics", "SMBIOS Data", "SMBIOS Table", "Network Teaming",
    "ScalablePartition", "ScalableSystem", "ROOT", "ModularChassis", "SlotGroup", "Slot",
    "CMM", "IO Module", "CoolingDomain", "PowerDomain", "Chassis MidPlane Card",
    "ModularGroup", "AlertIndication", "Connector", "BMCUser", "Drive Slot Sensor",
    "LAN End Point", "invalid"};

} // namespace NODESTORE

#define NS_LOG(level, ...) HGLOG_EVENT("NodeStore", NODESTORE::loggerNodeStore, level, __VA_ARGS__)

namespace {

unsigned int const kAllPairs = Node::invalid;

Error status(unsigned char s)
{
    return Error(s, Number(Number::Generic), std::string());
}

bool isPathLetter(char c)
{
    return c >= 'a' && c <= 'p';
}

} // namespace

NodeStore::NodeStore() = default;

NodeStore::~NodeStore()
{
    clear();
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
    SD::MutexGuard guard(storeLock);
    Node* existing = nullptr;
    Error result = nodePath2Node(calcPathFromLinkedId(node), &existing);
    if (result.getStatus() == 1) {
        // Made before add2NodeMap and kept even if the id turns out taken.
        sensorMap.emplace(static_cast<Node::SensorType>(*node), node);
        result = add2NodeMap(node);
        isNew = result.getStatus() == 0;
    } else {
        isNew = false;
        result = status(0);
    }
    return result;
}

Error NodeStore::addMINode(std::vector<Node*> const& nodes)
{
    SD::MutexGuard guard(storeLock);
    Error result = status(0);
    for (Node* node : nodes) {
        Node* existing = nullptr;
        if (!node)
            result = status(1);
        else if (nodePath2Node(calcPathFromLinkedId(node), &existing).getStatus() != 0)
            result = add2NodeMap(node);
        else
            result = status(6);
    }
    return result;
}

Error NodeStore::add2NodeMap(Node* const& node)
{
    unsigned int const id = node->getNodeId();
    bool const inserted = nodeIdMap.emplace(id, node).second;

    node->setPath(calcNodePath(node));

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
    NS_LOG(6000, "add2NodeMap: Node ", id, " found twice during NodeId to Node Map");
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
    SD::MutexGuard guard(storeLock);
    delOneNode(node);
    return status(0);
}

void NodeStore::delOneNode(Node* const& node)
{
    nodeIdMap.erase(node->getNodeId());
    nodeIdPathMap.erase(node->getNodeId());
    for (auto it = nodePathMap.begin(); it != nodePathMap.end(); ++it) {
        if (it->second == node) {
            nodePathMap.erase(it);
            break;
        }
    }
    auto range = sensorMap.equal_range(static_cast<Node::SensorType>(*node));
    for (auto it = range.first; it != range.second; ++it) {
        if (it->second == node) {
            sensorMap.erase(it);
            break;
        }
    }
}

void NodeStore::erase(std::string path)
{
    SD::MutexGuard guard(storeLock);
    Node* node = nullptr;
    if (nodePath2Node(std::move(path), &node).getStatus() == 0)
        delOneNode(node);
}

void NodeStore::delNodeFromGetMap(std::string const& path)
{
    SD::MutexGuard guard(storeLock);
    Node* node = nullptr;
    if (nodePath2Node(path, &node).getStatus() != 0)
        return;
    auto range = sensorMap.equal_range(static_cast<Node::SensorType>(*node));
    for (auto it = range.first; it != range.second; ++it) {
        if (it->second == node) {
            sensorMap.erase(it);
            break;
        }
    }
}

void NodeStore::clear()
{
    // Callers need not hold the lock; taking it costs nothing when they do
    // and keeps a first open safe against a client still querying.
    SD::MutexGuard guard(storeLock);
    nodePathMap.clear();
    nodeIdPathMap.clear();
    nodeIdMap.clear();
    sensorMap.clear();
}

Error NodeStore::getNode(unsigned int id, Node** node) const
{
    SD::MutexGuard guard(storeLock);
    return nodeId2Node(id, node);
}

Error NodeStore::getNode(std::string path, Node** node) const
{
    SD::MutexGuard guard(storeLock);
    return nodePath2Node(std::move(path), node);
}

Error NodeStore::nodeId2Node(unsigned int id, Node** node) const
{
    auto it = nodeIdMap.find(id);
    if (it == nodeIdMap.end())
        return status(1);
    *node = it->second;
    return status(0);
}

Error NodeStore::nodePath2Node(std::string path, Node** node) const
{
    auto it = nodePathMap.find(path);
    if (it == nodePathMap.end())
        return status(1);
    *node = it->second;
    return status(0);
}

Error NodeStore::getMap(std::vector<Node*>& nodes) const
{
    SD::MutexGuard guard(storeLock);
    nodes.clear();
    nodes.reserve(sensorMap.size());
    for (auto const& entry : sensorMap)
        nodes.push_back(entry.second);
    return status(0);
}

Error NodeStore::getMap(std::vector<Node*>& nodes, unsigned int sensor) const
{
    SD::MutexGuard guard(storeLock);
    nodes.clear();
    auto range = sensorMap.equal_range(static_cast<Node::SensorType>(sensor));
    for (auto it = range.first; it != range.second; ++it)
        nodes.push_back(it->second);
    return status(0);
}

Error NodeStore::getAllNodes(std::vector<Node*>& nodes) const
{
    SD::MutexGuard guard(storeLock);
    nodes.clear();
    nodes.reserve(nodeIdMap.size());
    for (auto const& entry : nodeIdMap)
        nodes.push_back(entry.second);
    return status(0);
}

// ------------------------------------------------------ paths and hierarchy

std::string NodeStore::calcNodePath(Node* node)
{
    return walkPath(node, &nodeIdPathMap, &nodePathMap);
}

std::string NodeStore::calcPathFromLinkedId(Node* node) const
{
    return walkPath(node, nullptr, nullptr);
}

std::string NodeStore::walkPath(Node* node, std::map<unsigned int, std::string>* idPaths,
                                std::map<std::string, Node*>* paths) const
{
    auto cached = nodeIdPathMap.find(node->getNodeId());
    if (cached != nodeIdPathMap.end())
        return cached->second;

    // Up: from the node to its nearest ancestor with a cached path, or to
    // the topmost registered one, which then counts as a root.
    std::vector<Node*> chain{node};
    Node* current = node;
    std::string base;
    for (;;) {
        unsigned int const lid = current->getLinkedId();
        if (lid == 0 || lid == current->getNodeId())
            break;
        auto parentPath = nodeIdPathMap.find(lid);
        if (parentPath != nodeIdPathMap.end()) {
            base = parentPath->second;
            break;
        }
        Node* parent = nullptr;
        if (getNode(lid, &parent).getStatus() != 0)
            break;
        // Registered nodes always have a cached path, so the walk cannot
        // loop; this bound only guards against a store corrupted by a
        // plug-in that changed ids of registered nodes.
        if (chain.size() > nodeIdMap.size())
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
        if (idPaths) {
            idPaths->emplace(n->getNodeId(), base);
            paths->emplace(base, n);
        }
        chain.pop_back();
    }
    return base;
}

std::string NodeStore::getNodePath(Node* node)
{
    if (!node)
        return std::string();
    SD::MutexGuard guard(storeLock);
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
    SD::MutexGuard guard(storeLock);
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

std::string NodeStore::stringhex(std::string const& s) const
{
    // A padding digit: an odd-length text ends with a low nibble of 0, an
    // even-length one with an ignored half byte.
    std::string const t = s + "0";
    std::string result;
    result.reserve(t.size() / 2);
    unsigned char acc = 0;
    bool high = true;
    for (std::size_t i = 0; i < t.size(); ++i) {
        char const c = t[i];
        unsigned int value;
        if (c >= '0' && c <= '9') {
            value = static_cast<unsigned int>(c - '0');
        } else if (c >= 'a' && c <= 'f') {
            value = static_cast<unsigned int>(c - 'a' + 10);
        } else if (c >= 'A' && c <= 'F') {
            value = static_cast<unsigned int>(c - 'A' + 10);
        } else {
            NS_LOG(3000, "stringHex: Invalid hexadecimal digit ", hexstring(s));
            throw std::invalid_argument("Invalid hexadecimal digit");
        }
        if (high) {
            acc = static_cast<unsigned char>((acc + value) * 16);
        } else {
            acc = static_cast<unsigned char>(acc + value);
            if (acc == 0) {
                NS_LOG(3000, "stringHex: Invalid null byte ", s);
                throw std::invalid_argument("Invalid null byte");
            }
            result += static_cast<char>(acc);
            acc = 0;
        }
        high = !high;
    }
    return result;
}

void NodeStore::uniqueid2topovec(std::string uid, unsigned int stop, TopoVec& topovec) const
{
    std::string s = b12String(std::move(uid));
    if (s.empty())
        return;
    if (s.back() != 'A')
        s += 'A';
    unsigned int first = 0;
    unsigned int second = 0;
    unsigned int* target = &second;
    for (char c : s) {
        switch (c) {
        case 'N':
        case 'O':
            break;
        case 'A':
            topovec.emplace_back(first, second);
            if (first == stop)
                return;
            first = 0;
            second = 0;
            target = &second;
            break;
        case 'P':
            target = &first;
            break;
        default:
            *target = *target * 12 + static_cast<unsigned int>(c - 'B');
            break;
        }
    }
}

std::string NodeStore::nodecode(TopoVec topovec) const
{
    std::string letters;
    for (auto const& pair : topovec) {
        letters += int2chr(pair.second);
        letters += 'p';
        letters += int2chr(pair.first);
        letters += 'a';
    }
    std::size_t const length = letters.size();
    if (length == 1)
        return std::string();
    std::string out;
    out.reserve(length / 2);
    for (std::size_t i = 0;;) {
        char const hi = i < length ? letters[i] : '\0';
        char const lo = i + 1 < length ? letters[i + 1] : '\0';
        if (!isPathLetter(hi) || !isPathLetter(lo)) {
            NS_LOG(6000, "nodecode: Damaged node string ='", letters, "'");
            throw std::invalid_argument("Damaged node string");
        }
        char const byte = static_cast<char>((hi - 'a') * 16 + (lo - 'a'));
        if (byte != 0)
            out += byte;
        i += 2;
        if (length - 1 <= i)
            break;
    }
    return out;
}

} // namespace IC
