// Tests of IC::NodeStore: path codes, the registry, path calculation,
// hierarchy text, sensor type names and concurrent use.
#include <IC/NodeStore.h>
#include <IC/SensorTypeNames.h>

#include "StoreSupport.h"

#include <cstdint>
#include <random>

namespace {

using IC::Node;
using IC::NodeStore;
using ictest::addNew;
using ictest::expectError;
using TopoVec = NodeStore::TopoVec;
using Nodes = std::vector<Node*>;
using ST = Node::SensorType;

ictest::Source const kNS{"Helmgard.IC.InstrumentationControl.NodeStore", "NodeStore"};
constexpr unsigned int kNoStop = 1000; // a stop type no pair ever has

// ---- independent reference encoders ----

// Bytes of a hexadecimal text (test data only, always well formed).
std::string fromHex(std::string const& hex)
{
    std::string out;
    for (std::size_t i = 0; i + 1 < hex.size(); i += 2)
        out.push_back(static_cast<char>(std::stoul(hex.substr(i, 2), nullptr, 16)));
    return out;
}

std::string refBase12(std::uint32_t n)
{
    std::string s = n == 0 ? "b" : "";
    for (; n != 0; n /= 12)
        s.insert(s.begin(), static_cast<char>('b' + n % 12));
    return s;
}

// Packs letters a..p two to a byte; an odd final letter is dropped.
std::string pack(std::string const& letters)
{
    std::string out;
    for (std::size_t i = 0; i + 1 < letters.size(); i += 2)
        out.push_back(static_cast<char>((letters[i] - 'a') * 16 + (letters[i + 1] - 'a')));
    return out;
}

std::string refPath(TopoVec const& v)
{
    std::string s;
    for (auto const& p : v)
        s += refBase12(p.second) + "p" + refBase12(p.first) + "a";
    return pack(s);
}

std::string hex8(unsigned int n)
{
    char buf[16];
    std::snprintf(buf, sizeof buf, "%08x", n);
    return buf;
}

// The what() of the std::invalid_argument thrown by f.
template <class F>
std::string invalidArgument(F&& f)
{
    try {
        f();
    } catch (std::invalid_argument const& e) {
        return e.what();
    } catch (...) {
        return "<other exception>";
    }
    return "<no exception>";
}

// The node registered under an id or a path; null when none is.
template <class Key>
Node* lookup(NodeStore const& store, Key const& key)
{
    Node* n = nullptr;
    return store.getNode(key, &n).getStatus() == 0 ? n : nullptr;
}

// The nodes registered under each key (an id or a path); null where none is.
template <class... Keys>
Nodes found(NodeStore const& store, Keys const&... keys)
{
    return Nodes{lookup(store, keys)...};
}

// getMap (of one type when given), which must succeed.
Nodes listed(NodeStore const& store, long type = -1)
{
    Node stray(ST::CPU, 1, 99, 0, "stray");
    Nodes v{&stray}; // replaced, not appended to
    expectError(type < 0 ? store.getMap(v) : store.getMap(v, static_cast<unsigned>(type)), 0);
    return v;
}

IC::Error addMI(NodeStore& store, Node& node) { return store.addMINode(Nodes{&node}); }

// The worked examples: ROOT 0 <- Chassis 0 <- CPU 1 <- Temperature Sensor 13.
struct Example {
    TopoVec topo;
    char const* hex;
    char const* b12;
};
std::vector<Example> const kExamples = {
    {{{59, 0}}, "1f5c", "BPFM"},
    {{{1, 0}, {59, 0}}, "1f201f5c", "BPCABPFM"},
    {{{4, 1}, {1, 0}, {59, 0}}, "2f501f201f5c", "CPFABPCABPFM"},
    {{{22, 13}, {4, 1}, {1, 0}, {59, 0}}, "22f2b02f501f201f5c", "CCPCLACPFABPCABPFM"},
};

// =====================================================================
// Path codes
// =====================================================================

class NodeStoreCodes : public testing::Test {
protected:
    NodeStore store;
};

TEST_F(NodeStoreCodes, Int2hexAndInt2chrOfBoundaryValues)
{
    std::pair<unsigned int, char const*> const cases[] = {
        {0, "b"},   {1, "c"},     {11, "m"},    {12, "cb"},  {13, "cc"}, {16, "cf"},
        {22, "cl"}, {59, "fm"},   {74, "hd"},   {143, "mm"}, {144, "cbb"}, {200, "cfj"},
        {0x12345678u, "jhefmihb"}, {0xABCDEF01u, "hjgejihjc"}, {0x80000000u, "fmmdebjlj"},
        {4294967295u, "kmlfhcgke"}};
    for (auto const& c : cases) {
        EXPECT_EQ(store.int2chr(c.first), c.second) << c.first;
        EXPECT_EQ(refBase12(c.first), c.second) << c.first;
        EXPECT_EQ(store.int2hex(c.first), hex8(c.first)) << c.first;
    }
    EXPECT_EQ(store.int2hex(0xABCDEF01u) + store.int2hex(16), "abcdef0100000010");
}

TEST_F(NodeStoreCodes, WorkedExamplesEncodeDecodeAndPrint)
{
    for (auto const& ex : kExamples) {
        std::string const path = store.nodecode(ex.topo);
        EXPECT_EQ(path, fromHex(ex.hex)) << ex.hex;
        EXPECT_EQ(store.hexstring(path), ex.hex);
        EXPECT_EQ(store.b12String(path), ex.b12);
        TopoVec v;
        store.uniqueid2topovec(path, 74, v);
        EXPECT_EQ(v, ex.topo) << ex.hex;
    }
    EXPECT_EQ(store.b12String(""), "");
    EXPECT_EQ(store.b12String(std::string("\xff\x80\x01", 3)), "PPIAAB");
    // (0, 0) is "bpba": four letters, two full bytes, no final letter lost.
    EXPECT_EQ(store.nodecode(TopoVec{{0, 0}}), fromHex("1f10"));
}

TEST_F(NodeStoreCodes, Uniqueid2topovecStopsAppendsAndSkips)
{
    struct Case {
        std::string uid;
        unsigned int stop;
        TopoVec before, after;
    } const cases[] = {
        {fromHex("2f501f201f5c"), 1, {}, {{4, 1}, {1, 0}}},
        {fromHex("2f501f201f5c"), 4, {}, {{4, 1}}},
        // A stop type that appears in no pair yields the whole vector.
        {fromHex("22f2b02f501f201f5c"), 20, {}, kExamples[3].topo},
        // Appended, not cleared; an empty uid adds nothing.
        {fromHex("1f201f5c"), 74, {{7, 7}, {8, 8}}, {{7, 7}, {8, 8}, {1, 0}, {59, 0}}},
        {"", 74, {{3, 9}}, {{3, 9}}},
        {fromHex("1f10"), kNoStop, {}, {{0, 0}}},
        // "bnpoca": n and o are skipped, giving (1, 0).
        {pack("bnpoca"), 74, {}, {{1, 0}}},
        // 12^10 wraps at 32 bits.
        {pack("cbbbbbbbbbbpca"), 74, {}, {{1, static_cast<unsigned int>(61917364224ULL)}}},
    };
    for (auto const& c : cases) {
        TopoVec v = c.before;
        store.uniqueid2topovec(c.uid, c.stop, v);
        EXPECT_EQ(v, c.after) << store.hexstring(c.uid) << " stop " << c.stop;
    }
}

TEST_F(NodeStoreCodes, HexTextBothWays)
{
    std::pair<std::string, std::string> const bytesToHex[] = {
        {"", ""}, {fromHex("1f5c"), "1f5c"}, {std::string("\xab\xc0", 2), "abc0"},
        {std::string("\xff\x80\x01\x7f", 4), "ff80017f"}, {std::string("\0\x0a", 2), "000a"}};
    for (auto const& c : bytesToHex)
        EXPECT_EQ(store.hexstring(c.first), c.second);
    std::pair<std::string, std::string> const hexToBytes[] = {
        {"", ""}, {"abc", std::string("\xab\xc0", 2)}, {"1F5C", fromHex("1f5c")},
        {"AbCdEf", std::string("\xab\xcd\xef", 3)}, {"ff80", std::string("\xff\x80", 2)},
        {"1", std::string("\x10", 1)}, {"01", std::string("\x01", 1)},
        {"22f2b02f501f201f5c", fromHex("22f2b02f501f201f5c")}};
    for (auto const& c : hexToBytes)
        EXPECT_EQ(store.stringhex(c.first), c.second) << c.first;
}

TEST_F(NodeStoreCodes, BadTextIsRefusedWithOneEvent)
{
    std::pair<std::string, char const*> const cases[] = {
        {"1g", "Invalid hexadecimal digit 3167"}, {"x1", "Invalid hexadecimal digit 7831"},
        {"\xff", "Invalid hexadecimal digit ff"}, {"0", "Invalid null byte 0"}, // padded to "00"
        {"00ff", "Invalid null byte 00ff"},       {"1f00", "Invalid null byte 1f00"},
        {"1f0", "Invalid null byte 1f0"}}; // a final zero byte
    for (auto const& c : cases) {
        SCOPED_TRACE(c.first);
        ictest::LogCapture cap;
        std::string const what = c.second;
        EXPECT_EQ(invalidArgument([&] { (void)store.stringhex(c.first); }), what.substr(0, what.rfind(' ')));
        ictest::expectEvent(cap, kNS, "stringHex: " + what, 3000, "stringhex");
        EXPECT_EQ(cap.logs().size(), 1u);
    }
    ictest::LogCapture cap;
    EXPECT_EQ(invalidArgument([&] { (void)store.nodecode(TopoVec{}); }), "Damaged node string");
    ictest::expectEvent(cap, kNS, "nodecode: Damaged node string =''", 6000, "nodecode");
    EXPECT_EQ(cap.logs().size(), 1u);
}

TEST_F(NodeStoreCodes, RoundTripsOverGeneratedPairLists)
{
    TopoVec const large{{42, 0xFFFFFFFFu}, {4, 0x80000000u}, {59, 0}};
    EXPECT_EQ(store.hexstring(store.nodecode(large)), "acb5726a4f4705cc3419b9f501f5c0");
    std::mt19937 rng(20240611u);
    unsigned int const edge[] = {0u, 1u, 11u, 12u, 143u, 144u, 0x7FFFFFFFu, 0x80000000u, 0xFFFFFFFFu};
    for (int round = 0; round < 400; ++round) {
        TopoVec v = round == 0 ? large : TopoVec{};
        for (std::size_t k = 0, len = 1 + rng() % 6; round != 0 && k < len; ++k)
            v.emplace_back(rng() % 75, rng() % 2 == 0 ? edge[rng() % 9] : rng());
        std::string const path = store.nodecode(v);
        ASSERT_EQ(path, refPath(v)) << "round " << round;
        // With stop 74 the list ends after the first pair of type 74.
        TopoVec back, back74, expected74;
        for (auto const& p : v)
            if (expected74.empty() || expected74.back().first != 74)
                expected74.push_back(p);
        store.uniqueid2topovec(path, kNoStop, back);
        store.uniqueid2topovec(path, 74, back74);
        ASSERT_EQ(back, v) << "round " << round;
        ASSERT_EQ(back74, expected74) << "round " << round;
        ASSERT_EQ(store.hexstring(path), ictest::hex(path));
        ASSERT_EQ(store.stringhex(store.hexstring(path)), path);
    }
}

// =====================================================================
// Registry
// =====================================================================

class NodeStoreRegistry : public testing::Test {
protected:
    NodeStore store;
    Node root{ST::ROOT, 0, 1, 0, "root"};
};

TEST_F(NodeStoreRegistry, GetMapOrdersByTypeThenInsertion)
{
    EXPECT_TRUE(listed(store).empty());
    EXPECT_TRUE(listed(store, ST::CPU).empty());
    Node cpuC(ST::CPU, 5, 30, 1, "cpu c"), chassis(ST::Chassis, 0, 2, 1, "chassis");
    Node cpuA(ST::CPU, 1, 10, 1, "cpu a"), cpuB(ST::CPU, 3, 20, 1, "cpu b");
    for (Node* n : {&cpuC, &root, &chassis, &cpuA, &cpuB}) // cpuC before its parent
        EXPECT_TRUE(addNew(store, *n));
    EXPECT_EQ(listed(store), (Nodes{&chassis, &cpuC, &cpuA, &cpuB, &root}));
    EXPECT_EQ(listed(store, ST::CPU), (Nodes{&cpuC, &cpuA, &cpuB}));
    EXPECT_EQ(listed(store, ST::ROOT), Nodes{&root});
    EXPECT_TRUE(listed(store, ST::Fan).empty());
    EXPECT_TRUE(listed(store, 1000).empty());
}

TEST_F(NodeStoreRegistry, GetAllNodesListsEveryRegisteredNodeById)
{
    Node mroot(ST::ROOT, 0, 0x10001, 0, "root"), fan(ST::Fan, 2, 0x10003, 0x10001, "fan");
    Node group(ST::Group, 0, 0x20001, 0x10001, "group");
    expectError(addMI(store, group), 0); // listed later by id all the same
    expectError(addMI(store, mroot), 0);
    expectError(store.addMINode({&fan, nullptr}), 1);
    Nodes v{&root};
    expectError(store.getAllNodes(v), 0);
    EXPECT_EQ(v, (Nodes{&mroot, &fan, &group}));
    store.erase(fan.getPath());
    store.getAllNodes(v);
    EXPECT_EQ(v, (Nodes{&mroot, &group}));
    bool isNew = true;
    expectError(store.addNodeIfNew(nullptr, isNew), 1);
    EXPECT_FALSE(isNew);
    EXPECT_TRUE(listed(store).empty());
}

TEST_F(NodeStoreRegistry, AddNodeIfNewRegistersAndHandsPaths)
{
    Node chassis(ST::Chassis, 0, 2, 1, "chassis"), cpu(ST::CPU, 1, 3, 2, "cpu");
    ictest::LogCapture cap;
    for (Node* n : {&root, &chassis, &cpu})
        EXPECT_TRUE(addNew(store, *n));
    EXPECT_TRUE(cap.records().empty());
    EXPECT_EQ(root.getPath() + "|" + root.getLinkedPath(), fromHex("1f5c") + "|");
    EXPECT_EQ(chassis.getPath() + "|" + chassis.getLinkedPath(), fromHex("1f201f5c") + "|" + root.getPath());
    EXPECT_EQ(cpu.getPath() + "|" + cpu.getLinkedPath(), fromHex("2f501f201f5c") + "|" + chassis.getPath());
    for (Node* n : {&root, &chassis, &cpu}) {
        EXPECT_EQ(found(store, n->getNodeId(), n->getPath()), (Nodes{n, n}));
        EXPECT_EQ(store.getNodePath(n), n->getPath());
        EXPECT_EQ(store.nodePathToSensor(n->getPath()), n->getSensor());
    }
    EXPECT_EQ(store.nodePathToSensor(fromHex("2f50")), ST::invalid);
    EXPECT_EQ(store.nodePathToSensor(""), ST::invalid);
    // Misses leave the out pointer alone, silently.
    Node* out = &chassis;
    for (IC::Error const& e : {store.getNode(9u, &out), store.getNode(fromHex("1f101f5c"), &out),
                               store.getNode(std::string(), &out), store.nodeId2Node(9u, &out),
                               store.nodePath2Node("nothing", &out)})
        expectError(e, 1);
    EXPECT_EQ(out, &chassis);
    EXPECT_TRUE(cap.records().empty());
    expectError(store.nodeId2Node(1u, &out), 0);
    EXPECT_EQ(out, &root);
    // The single form answers success either way.
    Node twin(ST::ROOT, 0, 9, 0, "twin");
    Node* p = &twin;
    expectError(store.addNode(p), 0);
    EXPECT_EQ(found(store, 9u), Nodes{nullptr});
}

TEST_F(NodeStoreRegistry, ManagementInterfaceNodeIsFoundButNotListed)
{
    Node psu(ST::PowerSupply, 1, 2, 1, "psu");
    expectError(addMI(store, root), 0);
    expectError(addMI(store, psu), 0);
    EXPECT_EQ(psu.getPath() + "|" + psu.getLinkedPath(), refPath(TopoVec{{25, 1}, {59, 0}}) + "|" + root.getPath());
    EXPECT_EQ(found(store, 1u, 2u, psu.getPath()), (Nodes{&root, &psu, &psu}));
    EXPECT_EQ(store.nodePathToSensor(psu.getPath()), ST::PowerSupply);
    EXPECT_TRUE(listed(store).empty() && listed(store, ST::PowerSupply).empty());
    // Offered again through addNodeIfNew it finds its own path taken;
    // unlisting it is harmless.
    EXPECT_FALSE(addNew(store, psu));
    EXPECT_TRUE(listed(store).empty());
    store.delNodeFromGetMap(psu.getPath());
    EXPECT_EQ(lookup(store, psu.getPath()), &psu);
}

TEST_F(NodeStoreRegistry, DuplicatePathOrIdIsKnownNotNew)
{
    Node cpu(ST::CPU, 1, 7, 1, "cpu");
    ASSERT_TRUE(addNew(store, root));
    ASSERT_TRUE(addNew(store, cpu));
    Node samePath(ST::ROOT, 0, 2, 0, "same path, other id"), samePathMI(ST::ROOT, 0, 3, 0, "same, MI");
    Node sameId(ST::Fan, 3, 7, 1, "same id, other type");
    ictest::LogCapture cap;
    for (Node* n : {&samePath, &sameId}) {
        bool isNew = true;
        expectError(store.addNodeIfNew(n, isNew), 0);
        EXPECT_FALSE(isNew) << n->getDescription();
    }
    expectError(addMI(store, samePathMI), 6);
    expectError(addMI(store, sameId), 6);
    EXPECT_TRUE(cap.records().empty());
    EXPECT_EQ(found(store, 2u, 3u, 7u, root.getPath(), refPath(TopoVec{{20, 3}, {59, 0}})),
              (Nodes{nullptr, nullptr, &cpu, &root, nullptr}));
    EXPECT_EQ(samePath.getPath() + samePathMI.getPath(), "");
    EXPECT_EQ(listed(store), (Nodes{&cpu, &root}));
}

TEST_F(NodeStoreRegistry, Add2NodeMapRegistersWithoutListingAndRefusesATakenId)
{
    Node cpu(ST::CPU, 2, 4000000000u, 1, "cpu"), dup(ST::Fan, 2, 4000000000u, 1, "same id");
    Node twin(ST::ROOT, 0, 2, 0, "same path, other id");
    for (Node* p : {&root, &cpu})
        expectError(store.add2NodeMap(p), 0);
    EXPECT_EQ(cpu.getPath() + "|" + cpu.getLinkedPath(), fromHex("3f501f5c") + "|" + root.getPath());
    EXPECT_TRUE(listed(store).empty());
    // A path already held stays with its first node; the id is entered.
    Node* p = &twin;
    expectError(store.add2NodeMap(p), 0);
    EXPECT_EQ(twin.getPath(), root.getPath());
    EXPECT_EQ(found(store, 2u, root.getPath(), cpu.getPath()), (Nodes{&twin, &root, &cpu}));

    ictest::LogCapture cap;
    p = &dup;
    expectError(store.add2NodeMap(p), 1, IC::Number(IC::Number::Generic), "NodeStore Duplicated Node Pointer");
    ictest::expectEvent(cap, kNS, "add2NodeMap: Node 4000000000 found twice during NodeId to Node Map", 6000,
                        "add2NodeMap");
    EXPECT_EQ(cap.logs().size(), 1u);
    // The second node is handed the path cached for the id, and its parent's.
    EXPECT_EQ(dup.getPath() + "|" + dup.getLinkedPath(), cpu.getPath() + "|" + root.getPath());
    EXPECT_EQ(found(store, 4000000000u), Nodes{&cpu});
}

TEST_F(NodeStoreRegistry, VectorFormsAnswerForAllForTheLastOrUpToAFailure)
{
    Node twin(ST::ROOT, 0, 2, 0, "same path"), dupId(ST::Fan, 0, 1, 0, "same id");
    Node cpu(ST::CPU, 1, 3, 1, "cpu"), fan(ST::Fan, 1, 4, 1, "fan");
    expectError(store.addNode(Nodes{&root, &twin, &dupId, &cpu}), 0);
    EXPECT_EQ(listed(store), (Nodes{&cpu, &root}));
    EXPECT_EQ(found(store, 2u), Nodes{nullptr});
    EXPECT_EQ(cpu.getLinkedPath(), root.getPath());
    expectError(store.addNode(Nodes{&twin, &dupId}), 0);
    expectError(store.addNode(Nodes{}), 0);

    NodeStore mi;
    expectError(mi.addMINode(Nodes{&root, &twin}), 6);
    expectError(mi.addMINode(Nodes{&twin, &cpu}), 0);
    expectError(mi.addMINode(Nodes{&cpu, &fan, &twin}), 6);
    EXPECT_EQ(found(mi, 4u, 2u), (Nodes{&fan, nullptr}));
    expectError(mi.addMINode(Nodes{}), 0);
    EXPECT_TRUE(listed(mi).empty());

    NodeStore direct;
    Node a(ST::ROOT, 0, 1, 0, "a"), again(ST::ROOT, 1, 1, 0, "same id as a");
    Node c(ST::ROOT, 2, 3, 0, "c"), d(ST::Chassis, 0, 4, 3, "d");
    expectError(direct.add2NodeMap(Nodes{}), 0);
    EXPECT_EQ(direct.add2NodeMap(Nodes{&a, &again, &c}).getStatus(), 1);
    EXPECT_EQ(found(direct, 1u, 3u), (Nodes{&a, nullptr})) << "stops at the failure";
    EXPECT_EQ(c.getPath(), "");
    expectError(direct.add2NodeMap(Nodes{&c, &d}), 0);
    EXPECT_EQ(d.getPath(), refPath(TopoVec{{1, 0}, {59, 2}}));
}


TEST_F(NodeStoreRegistry, DelNodeFromGetMapOnlyUnlists)
{
    Node cpuA(ST::CPU, 1, 2, 1, "a"), cpuB(ST::CPU, 2, 3, 1, "b"), cpuC(ST::CPU, 3, 4, 1, "c");
    for (Node* n : {&root, &cpuA, &cpuB, &cpuC})
        ASSERT_TRUE(addNew(store, *n));
    store.delNodeFromGetMap(cpuB.getPath());
    EXPECT_EQ(listed(store), (Nodes{&cpuA, &cpuC, &root}));
    EXPECT_EQ(found(store, cpuB.getPath(), 3u), (Nodes{&cpuB, &cpuB}));
    EXPECT_EQ(store.nodePathToSensor(cpuB.getPath()), ST::CPU);
    store.delNodeFromGetMap(cpuB.getPath()); // already unlisted
    store.delNodeFromGetMap(fromHex("ffff")); // unknown path
    EXPECT_EQ(listed(store), (Nodes{&cpuA, &cpuC, &root}));
    store.delNodeFromGetMap(cpuA.getPath());
    EXPECT_EQ(listed(store, ST::CPU), Nodes{&cpuC});
}

TEST_F(NodeStoreRegistry, EraseAndDelNodeRemoveFromEveryIndexAndForgetThePath)
{
    Node cpuA(ST::CPU, 1, 2, 1, "a"), cpuB(ST::CPU, 2, 3, 1, "b"), mi(ST::Fan, 1, 4, 1, "fan");
    for (Node* n : {&root, &cpuA, &cpuB})
        ASSERT_TRUE(addNew(store, *n));
    expectError(addMI(store, mi), 0);
    std::string const pathA = cpuA.getPath(), pathB = cpuB.getPath();
    ictest::LogCapture cap;
    store.erase(fromHex("2f601f5c")); // unknown
    store.erase("");
    EXPECT_TRUE(cap.records().empty());
    EXPECT_EQ(listed(store), (Nodes{&cpuA, &cpuB, &root}));

    store.erase(pathA);
    Node stranger(ST::Fan, 9, 99, 0, "stranger");
    for (Node* p : {&cpuB, &mi, &mi, &stranger}) // again, and never added: no failure
        expectError(store.delNode(p), 0);
    EXPECT_EQ(found(store, 1u, 2u, 3u, 4u, pathA, pathB, mi.getPath()),
              (Nodes{&root, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr}));
    for (std::string const& path : {pathA, pathB, mi.getPath()})
        EXPECT_EQ(store.nodePathToSensor(path), ST::invalid);
    EXPECT_EQ(listed(store), Nodes{&root});
    // Their cached paths went too: offered again with other instances they
    // get freshly computed paths.
    cpuA.setInstance(9);
    cpuB.setInstance(5);
    EXPECT_TRUE(addNew(store, cpuA) && addNew(store, cpuB));
    EXPECT_EQ(cpuA.getPath() + cpuB.getPath(), refPath(TopoVec{{4, 9}, {59, 0}}) + refPath(TopoVec{{4, 5}, {59, 0}}));
    EXPECT_EQ(found(store, pathA), Nodes{nullptr});
    // clear() empties every index and cache.
    std::string const rootPath = root.getPath();
    store.clear();
    EXPECT_TRUE(listed(store).empty());
    EXPECT_EQ(found(store, 1u, 2u, rootPath), Nodes(3, nullptr));
    EXPECT_EQ(store.nodePathToSensor(rootPath), ST::invalid);
    cpuA.setInstance(6);
    ASSERT_TRUE(addNew(store, cpuA));
    EXPECT_EQ(cpuA.getPath(), refPath(TopoVec{{4, 6}})) << "its parent is gone";
}


// =====================================================================
// Paths
// =====================================================================

class NodeStorePaths : public testing::Test {
protected:
    NodeStore store;
    Node root{ST::ROOT, 0, 1, 0, "root"};
    Node chassis{ST::Chassis, 0, 2, 1, "chassis"};
};

TEST_F(NodeStorePaths, ChainReproducesWorkedExamplesAndRootsHaveOwnPairOnly)
{
    Node cpu(ST::CPU, 1, 3, 2, "cpu"), temp(ST::TemperatureSensor, 13, 4, 3, "temperature");
    Node* chain[] = {&root, &chassis, &cpu, &temp};
    for (std::size_t i = 0; i < 4; ++i) {
        ASSERT_TRUE(addNew(store, *chain[i]));
        EXPECT_EQ(chain[i]->getPath(), fromHex(kExamples[i].hex)) << kExamples[i].hex;
        EXPECT_EQ(store.hexstring(store.getNodePath(chain[i])), kExamples[i].hex);
    }
    // A node naming itself as parent is a root, and its own parent.
    NodeStore other;
    Node self(ST::ROOT, 0, 5, 5, "names itself as parent"), selfCpu(ST::CPU, 3, 8, 8, "self-linked cpu");
    EXPECT_TRUE(addNew(other, self));
    EXPECT_EQ(self.getPath(), root.getPath());
    EXPECT_EQ(self.getLinkedPath(), self.getPath());
    EXPECT_EQ(other.getNodePath(&selfCpu), refPath(TopoVec{{4, 3}}));
}

TEST_F(NodeStorePaths, MissingAncestorsEndTheWalkForGood)
{
    Node cpu(ST::CPU, 1, 3, 2, "cpu whose chassis is not known yet");
    ASSERT_TRUE(addNew(store, cpu));
    EXPECT_EQ(cpu.getPath() + "|" + cpu.getLinkedPath(), fromHex("2f50") + "|");
    ASSERT_TRUE(addNew(store, chassis)); // its root is not known either
    EXPECT_EQ(store.getNodePath(&cpu), fromHex("2f50"));
    EXPECT_EQ(found(store, fromHex("2f50")), Nodes{&cpu});
    EXPECT_EQ(store.getNodeHierarchy(&cpu), "CPU:00000001");
    // A sibling that arrives now gets the path through the chassis.
    Node sibling(ST::CPU, 2, 31, 2, "second cpu");
    ASSERT_TRUE(addNew(store, sibling));
    EXPECT_EQ(sibling.getPath(), refPath(TopoVec{{4, 2}, {1, 0}}));
    EXPECT_EQ(sibling.getLinkedPath(), chassis.getPath());
    EXPECT_EQ(store.getNodeHierarchy(&sibling), "Chassis:00000000->CPU:00000002");
}

TEST_F(NodeStorePaths, CachedPathsSurviveInstanceChangesAndAnInvalidAncestorCutsInheritedPairs)
{
    chassis.setInstance(2);
    ASSERT_TRUE(addNew(store, root) && addNew(store, chassis));
    std::string const first = store.getNodePath(&chassis);
    chassis.setInstance(8); // too late: its path is cached
    EXPECT_EQ(store.getNodePath(&chassis) + store.calcPathFromLinkedId(&chassis), first + first);
    Node cpu(ST::CPU, 1, 3, 2, "cpu"), bad(ST::invalid, 3, 4, 1, "invalid"), cpu2(ST::CPU, 1, 5, 4, "cpu");
    Node core(ST::CPUCore, 4, 6, 5, "core");
    for (Node* n : {&cpu, &bad, &cpu2, &core})
        ASSERT_TRUE(addNew(store, *n));
    EXPECT_EQ(cpu.getPath() + "|" + cpu.getLinkedPath(), refPath(TopoVec{{4, 1}, {1, 2}, {59, 0}}) + "|" + first);
    EXPECT_EQ(bad.getPath(), refPath(TopoVec{{74, 3}, {59, 0}}));
    EXPECT_EQ(cpu2.getPath() + "|" + cpu2.getLinkedPath(), refPath(TopoVec{{4, 1}, {74, 3}}) + "|" + bad.getPath());
    EXPECT_EQ(core.getPath(), refPath(TopoVec{{42, 4}, {4, 1}, {74, 3}}));
    EXPECT_EQ(store.getNodeHierarchy(&core), "invalid:00000003->CPU:00000001->CPU Core:00000004");
}

TEST_F(NodeStorePaths, ComputingThePathOfAnUnregisteredNodeCachesAndClaimsIt)
{
    ASSERT_TRUE(addNew(store, root) && addNew(store, chassis));
    // calcPathFromLinkedId caches nothing.
    Node cpu(ST::CPU, 1, 3, 2, "cpu");
    std::string const path = store.calcPathFromLinkedId(&cpu);
    EXPECT_EQ(path, fromHex("2f501f201f5c"));
    EXPECT_EQ(found(store, path), Nodes{nullptr});
    cpu.setInstance(2);
    EXPECT_EQ(store.calcPathFromLinkedId(&cpu), refPath(TopoVec{{4, 2}, {1, 0}, {59, 0}}));
    EXPECT_TRUE(addNew(store, cpu));
    EXPECT_EQ(cpu.getPath(), refPath(TopoVec{{4, 2}, {1, 0}, {59, 0}}));

    // getNodePath and calcNodePath do: the node is then found by its path
    // (not by id, not listed), which is taken for it and for anybody else.
    Node loose(ST::Fan, 2, 9, 1, "not added"), dimm(ST::DIMM, 4, 10, 1, "not added");
    std::string const loosePath = store.getNodePath(&loose), dimmPath = store.calcNodePath(&dimm);
    EXPECT_EQ(loosePath, refPath(TopoVec{{20, 2}, {59, 0}}));
    EXPECT_EQ(dimmPath, refPath(TopoVec{{19, 4}, {59, 0}}));
    loose.setInstance(4);
    EXPECT_EQ(store.getNodePath(&loose), loosePath);
    EXPECT_EQ(found(store, loosePath, dimmPath, 9u), (Nodes{&loose, &dimm, nullptr}));
    EXPECT_EQ(store.nodePathToSensor(loosePath), ST::Fan);
    EXPECT_TRUE(listed(store, ST::Fan).empty());
    EXPECT_FALSE(addNew(store, loose));
    Node twin(ST::Fan, 2, 11, 1, "same path");
    expectError(addMI(store, twin), 6);
    EXPECT_EQ(found(store, 11u), Nodes{nullptr});
}

// =====================================================================
// Hierarchy text
// =====================================================================

TEST_F(NodeStorePaths, HierarchyRunsFromTheStopTypeOrTheRootDownWithTwoProgressEvents)
{
    Node cpu(ST::CPU, 1, 3, 2, "cpu"), dimm(ST::DIMM, 0xABCDEF01u, 4, 3, "dimm");
    for (Node* n : {&root, &chassis, &cpu, &dimm})
        ASSERT_TRUE(addNew(store, *n));
    std::string const whole = "ROOT:00000000->Chassis:00000000->CPU:00000001";
    {
        ictest::LogCapture cap;
        EXPECT_EQ(store.getNodeHierarchy(&cpu, ST::Chassis), "Chassis:00000000->CPU:00000001");
        EXPECT_EQ(cap.messages(), (std::vector<std::string>{"topovec.size = 2",
                                                            " Hierarchy = Chassis:00000000->CPU:00000001"}));
        ictest::expectEvent(cap, kNS, "topovec.size = 2", 3000, "getNodeHierarchy");
        ictest::expectEvent(cap, kNS, " Hierarchy = Chassis:00000000->CPU:00000001", 3000, "getNodeHierarchy");
    }
    std::pair<ST, std::string> const stops[] = {
        {ST::CPU, "CPU:00000001"}, {ST::ROOT, whole}, {ST::Fan, whole}, {ST::invalid, whole}};
    for (auto const& s : stops)
        EXPECT_EQ(store.getNodeHierarchy(&cpu, s.first), s.second) << s.first;
    EXPECT_EQ(store.getNodeHierarchy(&cpu), whole);
    EXPECT_EQ(store.getNodeHierarchy(&chassis), "ROOT:00000000->Chassis:00000000");
    EXPECT_EQ(store.getNodeHierarchy(&dimm), whole + "->DIMM:abcdef01");
    // An unregistered node has its path computed on the way.
    Node fan(ST::Fan, 2, 50, 2, "not added");
    EXPECT_EQ(store.getNodeHierarchy(&fan), "ROOT:00000000->Chassis:00000000->Fan:00000002");
    EXPECT_EQ(lookup(store, refPath(TopoVec{{20, 2}, {1, 0}, {59, 0}})), &fan);

    ictest::LogCapture cap;
    EXPECT_EQ(store.getNodeHierarchy(nullptr) + store.getNodeHierarchy(nullptr, ST::Chassis), "");
    EXPECT_TRUE(cap.records().empty()) << "a null node gives empty text silently";
}

TEST_F(NodeStorePaths, HierarchyShowsATypeAboveTheNameTableAsInvalidWithAnError)
{
    Node odd(static_cast<ST>(200), 7, 4, 2, "type out of range"), child(ST::CPU, 5, 5, 4, "child");
    Node last(ST::invalid, 1, 10, 0, "type 74"), beyond(static_cast<ST>(75), 2, 11, 0, "type 75");
    for (Node* n : {&root, &chassis, &odd, &child, &last, &beyond})
        ASSERT_TRUE(addNew(store, *n));
    EXPECT_EQ(child.getPath(), refPath(TopoVec{{4, 5}, {200, 7}, {1, 0}, {59, 0}}));
    std::string const text = "ROOT:00000000->Chassis:00000000->invalid:00000007->CPU:00000005";
    ictest::LogCapture cap;
    EXPECT_EQ(store.getNodeHierarchy(&child), text);
    EXPECT_EQ(cap.messages(), (std::vector<std::string>{"topovec.size = 4",
                                                        " getNodeHierarchy: parent sensor value invalid: 200",
                                                        " Hierarchy = " + text}));
    ictest::expectEvent(cap, kNS, " getNodeHierarchy: parent sensor value invalid: 200", 6000, "getNodeHierarchy");
    cap.clear();
    EXPECT_EQ(store.getNodeHierarchy(&last), "invalid:00000001");
    EXPECT_EQ(cap.logs().size(), 2u) << "no complaint about 74 itself";
    cap.clear();
    EXPECT_EQ(store.getNodeHierarchy(&beyond), "invalid:00000002");
    ictest::expectEvent(cap, kNS, " getNodeHierarchy: parent sensor value invalid: 75", 6000, "getNodeHierarchy");
}

TEST(NodeStoreSensorNames, EveryTypeHasItsNameInTheHierarchy)
{
    // A few names by value, from both ends and the irregular middle: a name
    // lost or added shifts every one after it.
    std::pair<unsigned int, char const*> const spots[] = {
        {0, "Unknown"}, {1, "Chassis"}, {22, "Temperature Sensor"}, {36, "Tallowmere"},
        {52, "Kelmar Alert Config"}, {59, "ROOT"}, {67, "Chassis MidPlane Card"},
        {73, "LAN End Point"}, {74, "invalid"}};
    for (auto const& [type, name] : spots)
        EXPECT_STREQ(IC::sensorTypeName(type), name) << type;
    EXPECT_STREQ(IC::sensorTypeName(75), "invalid");
    auto const& names = IC::sensorTypeNames;
    NodeStore store;
    Node root(ST::ROOT, 0, 1, 0, "root");
    ASSERT_TRUE(addNew(store, root));
    std::vector<std::unique_ptr<Node>> nodes;
    ictest::LogCapture cap;
    for (unsigned int type = 0; type < 75; ++type) {
        unsigned int const instance = type * 0x01010101u;
        nodes.push_back(std::make_unique<Node>(static_cast<ST>(type), instance, 2 + type, 1, "n"));
        ASSERT_TRUE(addNew(store, *nodes.back()));
        std::string const own = std::string(names[type]) + ":" + hex8(instance);
        // The default stop type is 74: a node of that type shows alone.
        EXPECT_EQ(store.getNodeHierarchy(nodes.back().get()), type == 74 ? own : "ROOT:00000000->" + own);
        EXPECT_EQ(store.getNodeHierarchy(nodes.back().get(), static_cast<ST>(type)), own);
    }
    for (auto const& r : cap.logs())
        EXPECT_NE(r.level, 6000) << r.message;
}

// =====================================================================
// Concurrency
// =====================================================================

TEST(NodeStoreConcurrency, ParallelAddsAndQueries)
{
    constexpr unsigned int kWriters = 4, kPerWriter = 120, kContested = 16, kReaders = 3;
    NodeStore store;
    Node sharedRoot(ST::ROOT, 0, 1, 0, "shared root");
    ASSERT_TRUE(addNew(store, sharedRoot));
    // Each writer owns a tree under a root of its own instance, built parent
    // first, plus its own copy of every contested node (same path for all
    // writers, distinct ids).
    struct Planned {
        std::unique_ptr<Node> node;
        std::string path, parentPath;
    };
    ST const types[] = {ST::Chassis, ST::CPU, ST::DIMM, ST::CPUCore, ST::VoltageSensor, ST::PowerSupply,
                        ST::TemperatureSensor};
    std::vector<std::vector<Planned>> trees(kWriters);
    std::vector<std::vector<std::unique_ptr<Node>>> contested(kWriters);
    for (unsigned int w = 0; w < kWriters; ++w) {
        unsigned int const base = (w + 1) << 16;
        std::vector<TopoVec> topo;
        for (unsigned int i = 0; i < kPerWriter; ++i) {
            unsigned int const parent = i == 0 ? 0 : (i - 1) / 3, instance = i == 0 ? 100 + w : i;
            ST const type = i == 0 ? ST::ROOT : types[i % 7];
            topo.push_back(TopoVec{{type, instance}});
            if (i != 0)
                topo.back().insert(topo.back().end(), topo[parent].begin(), topo[parent].end());
            trees[w].push_back(Planned{
                std::make_unique<Node>(type, instance, base | (i + 1), i == 0 ? 0 : base | (parent + 1), "n"),
                refPath(topo.back()), i == 0 ? "" : trees[w][parent].path});
        }
        for (unsigned int j = 0; j < kContested; ++j)
            contested[w].push_back(std::make_unique<Node>(ST::Fan, j, base | 0x8000u | j, 1u, "fan"));
    }

    std::atomic<bool> go{false};
    std::atomic<int> failures{0};
    std::vector<std::vector<int>> wonBy(kWriters, std::vector<int>(kContested, 0));
    std::vector<std::thread> threads;
    for (unsigned int w = 0; w < kWriters; ++w)
        threads.emplace_back([&, w] {
            while (!go.load())
                std::this_thread::yield();
            for (unsigned int i = 0; i < kPerWriter; ++i) {
                Node* n = trees[w][i].node.get();
                bool isNew = false;
                if (w % 2 == 1)
                    failures += store.addMINode(Nodes{n}).getStatus() != 0;
                else
                    failures += store.addNodeIfNew(n, isNew).getStatus() != 0 || !isNew;
                if (i < kContested) {
                    unsigned int const j = (i + w * 5) % kContested;
                    failures += store.addNodeIfNew(contested[w][j].get(), isNew).getStatus() != 0;
                    wonBy[w][j] = isNew;
                }
            }
        });
    for (unsigned int r = 0; r < kReaders; ++r)
        threads.emplace_back([&, r] {
            while (!go.load())
                std::this_thread::yield();
            std::mt19937 rng(77u + r);
            std::size_t lastSize = 0;
            Nodes v;
            for (int round = 0; round < 150; ++round) {
                Planned const& p = trees[rng() % kWriters][rng() % kPerWriter];
                Node* found = nullptr;
                failures += store.getNode(p.node->getNodeId(), &found).getStatus() == 0 && found != p.node.get();
                failures += store.getNode(p.path, &found).getStatus() == 0 && found != p.node.get();
                ST const s = store.nodePathToSensor(p.path);
                failures += s != ST::invalid && s != p.node->getSensor();
                failures += store.getMap(v).getStatus() != 0 || v.size() < lastSize;
                lastSize = v.size();
                if (!v.empty())
                    failures += store.getNodeHierarchy(v[rng() % v.size()]).compare(0, 5, "ROOT:") != 0;
                failures += store.getMap(v, ST::Fan).getStatus() != 0 || v.size() > kContested;
            }
        });
    go = true;
    for (auto& t : threads)
        t.join();
    EXPECT_EQ(failures.load(), 0);

    std::size_t listedCount = 1 + kContested; // the shared root and the contested fans
    for (unsigned int w = 0; w < kWriters; ++w) {
        for (Planned const& p : trees[w]) {
            EXPECT_EQ(lookup(store, p.node->getNodeId()), p.node.get());
            EXPECT_EQ(lookup(store, p.path), p.node.get());
            EXPECT_EQ(p.node->getPath() + "|" + p.node->getLinkedPath(), p.path + "|" + p.parentPath);
            EXPECT_EQ(store.nodePathToSensor(p.path), p.node->getSensor());
        }
        listedCount += w % 2 == 0 ? kPerWriter : 0;
    }
    // Each contested path went to exactly one writer's node.
    for (unsigned int j = 0; j < kContested; ++j) {
        int owners = 0;
        for (unsigned int w = 0; w < kWriters; ++w)
            if (wonBy[w][j] != 0) {
                ++owners;
                EXPECT_EQ(lookup(store, refPath(TopoVec{{20, j}, {59, 0}})), contested[w][j].get());
            }
        EXPECT_EQ(owners, 1) << "contested " << j;
    }
    EXPECT_EQ(listed(store).size(), listedCount);
    EXPECT_EQ(listed(store, ST::Fan).size(), std::size_t{kContested});
    EXPECT_EQ(store.getNodeHierarchy(trees[0][1].node.get()), "ROOT:00000064->CPU:00000001");
}

} // namespace
