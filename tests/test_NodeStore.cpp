// Tests of IC::NodeStore: path codes, the registry, path calculation,
// hierarchy text.
#include <IC/NodeStore.h>

#include "StoreSupport.h"

#include <algorithm>
#include <cstdint>
#include <random>

namespace {

using IC::Node;
using IC::NodeStore;
using namespace ictest;
using TopoVec = NodeStore::TopoVec;
using Nodes = std::vector<Node*>;
using Strings = std::vector<std::string>;
using ST = Node::SensorType;

ictest::Source const kNS{"Helmgard.IC.InstrumentationControl.NodeStore", "NodeStore"};

// The path of a pair list, written independently of the library: instance,
// "p", type, "a" per pair in base 12 (b..m), packed two letters to a byte.
std::string base12(std::uint32_t n)
{
    std::string s = n == 0 ? "b" : "";
    for (; n != 0; n /= 12)
        s.insert(s.begin(), static_cast<char>('b' + n % 12));
    return s;
}
std::string refPath(TopoVec const& v)
{
    std::string letters, out;
    for (auto const& p : v)
        letters += base12(p.second) + "p" + base12(p.first) + "a";
    for (std::size_t i = 0; i + 1 < letters.size(); i += 2) // an odd last letter is dropped
        out.push_back(static_cast<char>((letters[i] - 'a') * 16 + (letters[i + 1] - 'a')));
    return out;
}
std::string refHex(TopoVec const& v) { return hex(refPath(v)); }

// The nodes registered under each key (an id or a path); null where none is.
template <class Key>
Node* lookup(NodeStore const& store, Key const& key)
{
    Node* n = nullptr;
    return store.getNode(key, &n).getStatus() == 0 ? n : nullptr;
}
template <class... Keys>
Nodes found(NodeStore const& store, Keys const&... keys)
{
    return Nodes{lookup(store, keys)...};
}

// getMap, of one type when given; the vector is replaced, not appended to.
Nodes listed(NodeStore const& store, long type = -1)
{
    Nodes v{nullptr};
    expectError(type < 0 ? store.getMap(v) : store.getMap(v, static_cast<unsigned>(type)), 0);
    return v;
}

template <class F>
std::string invalidArgument(F&& f)
{
    try {
        f();
    } catch (std::invalid_argument const& e) {
        return e.what();
    }
    return "<no exception>";
}

// A node's path and its parent's, in hexadecimal.
std::string paths(Node const& n) { return hex(n.getPath()) + "|" + hex(n.getLinkedPath()); }

TEST(NodeStoreCodes, WorkedExamplesAndGeneratedPairListsRoundTripAndDecodeUpToTheStopType)
{
    NodeStore store;
    // ROOT 0 <- Chassis 0 <- CPU 1 <- Temperature Sensor 13; a letter string
    // of odd length loses its last letter.
    std::tuple<TopoVec, char const*> const examples[] = {
        {{{59, 0}}, "1f5c BPFM"},
        {{{1, 0}, {59, 0}}, "1f201f5c BPCABPFM"},
        {{{22, 13}, {4, 1}, {1, 0}, {59, 0}}, "22f2b02f501f201f5c CCPCLACPFABPCABPFM"},
        {{{42, 0xFFFFFFFFu}, {4, 0x80000000u}, {59, 0}},
         "acb5726a4f4705cc3419b9f501f5c0 KMLFHCGKEPEHAFMMDEBJLJPFABPFMA"}};
    for (auto const& [topo, printed] : examples)
        EXPECT_EQ(store.hexstring(store.nodecode(topo)) + " " + store.b12String(store.nodecode(topo)), printed);
    std::mt19937 rng(20240611u);
    unsigned int const edge[] = {0u, 1u, 11u, 12u, 143u, 144u, 0x80000000u, 0xFFFFFFFFu};
    for (int round = 0; round < 300; ++round) {
        TopoVec v;
        for (std::size_t k = 0, len = 1 + rng() % 6; k < len; ++k)
            v.emplace_back(rng() % 75, rng() % 2 ? edge[rng() % 8] : static_cast<unsigned int>(rng()));
        std::string const path = store.nodecode(v);
        ASSERT_EQ(path, refPath(v)) << "round " << round;
        ASSERT_EQ(store.hexstring(path), hex(path));
        ASSERT_EQ(store.stringhex(store.hexstring(path)), path);
        // Appended to what the vector holds, up to the first pair of the stop type.
        unsigned int const stop = round % 4 == 0 ? 1000 : v[rng() % v.size()].first;
        TopoVec back{{7, 7}}, want{{7, 7}};
        for (auto const& p : v)
            if (want.size() == 1 || want.back().first != stop)
                want.push_back(p);
        store.uniqueid2topovec(path, stop, back);
        ASSERT_EQ(back, want) << "round " << round << " stop " << stop;
    }
}

TEST(NodeStoreCodes, HexTextIsReadInEitherCaseAndBadTextThrowsWithOneEvent)
{
    NodeStore store;
    EXPECT_EQ(store.stringhex("AbCdEf") + store.stringhex("1") + store.stringhex("01") + store.stringhex(""),
              "\xab\xcd\xef\x10\x01");
    // A bad digit is shown in hexadecimal; a final odd "0" makes a zero byte.
    std::tuple<std::string, char const*, char const*> const bad[] = {
        {"1g", "Invalid hexadecimal digit", "3167"}, {"x1", "Invalid hexadecimal digit", "7831"},
        {"\xff", "Invalid hexadecimal digit", "ff"}, {"0", "Invalid null byte", "0"},
        {"1f00", "Invalid null byte", "1f00"},       {"1f0", "Invalid null byte", "1f0"}};
    for (auto const& [text, what, shown] : bad)
        EXPECT_EQ(invalidArgument([&] { (void)store.stringhex(text); }), what) << text << shown;
    ictest::LogCapture cap;
    EXPECT_EQ(invalidArgument([&] { (void)store.nodecode(TopoVec{}); }), "Damaged node string");
    ictest::expectEvent(cap, kNS, "nodecode: Damaged node string =''", 6000, "nodecode");
}

class NodeStoreTest : public testing::Test {
protected:
    NodeStore store;
    Node root{ST::ROOT, 0, 1, 0, "root"};
    Node chassis{ST::Chassis, 0, 2, 1, "chassis"};
};

TEST_F(NodeStoreTest, GetMapListsByTypeThenAdditionAndGetAllNodesAllById)
{
    Node cpuC(ST::CPU, 5, 30, 1, "c"), cpuA(ST::CPU, 1, 10, 1, "a"), cpuB(ST::CPU, 3, 20, 1, "b");
    Node mi(ST::Fan, 0, 15, 1, "management interface's");
    for (Node* n : {&cpuC, &root, &chassis, &cpuA, &cpuB}) // cpuC before its parent
        EXPECT_TRUE(addNew(store, *n));
    expectError(store.addMINode(Nodes{&mi}), 0);
    EXPECT_EQ(listed(store), (Nodes{&chassis, &cpuC, &cpuA, &cpuB, &root}));
    EXPECT_EQ(listed(store, ST::CPU), (Nodes{&cpuC, &cpuA, &cpuB}));
    Nodes all{&root};
    expectError(store.getAllNodes(all), 0);
    EXPECT_EQ(all, (Nodes{&root, &chassis, &cpuA, &mi, &cpuB, &cpuC}));
}

TEST_F(NodeStoreTest, NewNodesGetTheirPathsATakenPathOrIdIsNotNewAndManagementNodesAreNotListed)
{
    Node cpu(ST::CPU, 1, 3, 2, "cpu"), psu(ST::PowerSupply, 1, 8, 1, "psu"), fan(ST::Fan, 1, 9, 1, "fan");
    ictest::LogCapture cap;
    ASSERT_TRUE(addNew(store, root) && addNew(store, chassis) && addNew(store, cpu));
    expectError(store.addMINode(Nodes{&psu}), 0);
    EXPECT_EQ((Strings{paths(root), paths(cpu), paths(psu)}),
              (Strings{"1f5c|", "2f501f201f5c|1f201f5c", refHex({{25, 1}, {59, 0}}) + "|1f5c"}));
    EXPECT_EQ(found(store, 1u, 3u, 8u, root.getPath(), cpu.getPath(), psu.getPath(), std::string("\x2f\x50")),
              (Nodes{&root, &cpu, &psu, &root, &cpu, &psu, nullptr}));
    Node samePath(ST::ROOT, 0, 4, 0, "same path"), sameId(ST::Fan, 3, 3, 1, "same id");
    for (Node* n : {&samePath, &sameId, &psu}) {
        bool isNew = true;
        expectError(store.addNodeIfNew(n, isNew), 0);
        EXPECT_FALSE(isNew) << n->getDescription();
    }
    // addNode's vector form always succeeds; addMINode answers for its last node.
    expectError(store.addNode(Nodes{&samePath, &sameId}), 0);
    EXPECT_EQ((std::vector<int>{store.addMINode(Nodes{&samePath}).getStatus(),
                                store.addMINode(Nodes{&samePath, nullptr}).getStatus(),
                                store.addMINode(Nodes{&samePath, &fan}).getStatus()}),
              (std::vector<int>{6, 1, 0}));
    EXPECT_EQ(found(store, 4u, 9u, refPath({{20, 3}, {59, 0}})), (Nodes{nullptr, &fan, nullptr}));
    EXPECT_EQ(listed(store), (Nodes{&chassis, &cpu, &root}));
    // Misses answer 1 and leave the out pointer alone.
    Node* out = &cpu;
    for (IC::Error const& e : {store.getNode(7u, &out), store.getNode("\x2f\x50", &out)})
        expectError(e, 1);
    EXPECT_TRUE(out == &cpu && cap.records().empty());
    bool isNew = true;
    expectError(store.addNodeIfNew(nullptr, isNew), 1);
    EXPECT_FALSE(isNew);
}

TEST_F(NodeStoreTest, Add2NodeMapRegistersUnlistedAndRefusesATakenId)
{
    Node cpu(ST::CPU, 2, 4000000000u, 1, "cpu"), dup(ST::Fan, 2, 4000000000u, 1, "same id");
    Node twin(ST::ROOT, 0, 2, 0, "same path, other id"), later(ST::ROOT, 2, 3, 0, "later");
    expectError(store.add2NodeMap(Nodes{&root, &cpu, &twin}), 0);
    EXPECT_EQ(paths(cpu), "3f501f5c|1f5c");
    EXPECT_TRUE(listed(store).empty());
    EXPECT_EQ(found(store, 2u, root.getPath()), (Nodes{&twin, &root})) << "a taken path stays with its node";
    ictest::LogCapture cap;
    expectError(store.add2NodeMap(Nodes{&dup, &later}), 1, IC::Number(IC::Number::Generic),
                "NodeStore Duplicated Node Pointer");
    ictest::expectEvent(cap, kNS, "add2NodeMap: Node 4000000000 found twice during NodeId to Node Map", 6000,
                        "add2NodeMap");
    EXPECT_EQ(paths(dup), paths(cpu)) << "handed the path cached for the id";
    EXPECT_EQ(found(store, 4000000000u, 3u), (Nodes{&cpu, nullptr})) << "the vector form stops at a failure";
}

TEST_F(NodeStoreTest, RemovalsDropFromTheIndexesTheyNameAndForgetCachedPaths)
{
    Node cpuA(ST::CPU, 1, 3, 1, "a"), cpuB(ST::CPU, 2, 4, 1, "b"), mi(ST::Fan, 1, 5, 1, "fan");
    ASSERT_TRUE(addNew(store, root) && addNew(store, chassis) && addNew(store, cpuA) && addNew(store, cpuB));
    expectError(store.addMINode(Nodes{&mi}), 0);
    std::string const pathA = cpuA.getPath(), pathB = cpuB.getPath();
    store.delNodeFromGetMap(pathB); // unlisted only
    EXPECT_EQ(listed(store), (Nodes{&chassis, &cpuA, &root}));
    EXPECT_EQ(found(store, pathB, 4u), (Nodes{&cpuB, &cpuB}));
    store.erase(pathA);
    for (Node* p : {&cpuB, &mi, &mi}) // twice: no failure
        expectError(store.delNode(p), 0);
    EXPECT_EQ(found(store, 3u, 4u, 5u, pathA, pathB, mi.getPath()), Nodes(6, nullptr));
    EXPECT_EQ(store.nodePathToSensor(pathA), ST::invalid);
    EXPECT_EQ(listed(store), (Nodes{&chassis, &root}));
    cpuA.setInstance(9);
    ASSERT_TRUE(addNew(store, cpuA));
    EXPECT_EQ(hex(cpuA.getPath()), refHex({{4, 9}, {59, 0}})) << "a fresh path";
    store.clear();
    EXPECT_TRUE(listed(store).empty());
    EXPECT_EQ(found(store, 1u, root.getPath()), Nodes(2, nullptr));
    ASSERT_TRUE(addNew(store, cpuA));
    EXPECT_EQ(hex(cpuA.getPath()), refHex({{4, 9}})) << "its parent is gone";
}

TEST_F(NodeStoreTest, PathsOnceComputedStayAndWalksEndAtTheTopmostKnownOrAnInvalidNode)
{
    // A node naming itself as parent is a root, and its own parent.
    Node self(ST::ROOT, 0, 5, 5, "its own parent"), selfCpu(ST::CPU, 3, 8, 8, "self-linked cpu");
    EXPECT_TRUE(addNew(store, self));
    EXPECT_EQ(paths(self) + " " + hex(store.getNodePath(&selfCpu)), "1f5c|1f5c " + refHex({{4, 3}}));
    NodeStore late;
    Node early(ST::CPU, 1, 3, 2, "cpu before its chassis"), sibling(ST::CPU, 2, 31, 2, "cpu after it");
    ASSERT_TRUE(addNew(late, early) && addNew(late, chassis));
    chassis.setInstance(8);
    ASSERT_TRUE(addNew(late, sibling) && addNew(late, root));
    EXPECT_EQ(paths(early) + " " + paths(sibling) + " " + hex(late.getNodePath(&early)),
              "2f50| " + refHex({{4, 2}, {1, 0}}) + "|1f20 2f50");
    // Inherited pairs end at an invalid ancestor.
    Node bad(ST::invalid, 3, 40, 1, "invalid"), cpu(ST::CPU, 1, 41, 40, "cpu"), core(ST::CPUCore, 4, 42, 41, "core");
    ASSERT_TRUE(addNew(late, bad) && addNew(late, cpu) && addNew(late, core));
    EXPECT_EQ(paths(cpu), refHex({{4, 1}, {74, 3}}) + "|" + refHex({{74, 3}, {59, 0}}));
    EXPECT_EQ(hex(core.getPath()), refHex({{42, 4}, {4, 1}, {74, 3}}));
    // calcPathFromLinkedId caches nothing; getNodePath and calcNodePath cache
    // the path and claim it: the node is found by it (not by id, not listed).
    Node loose(ST::Fan, 2, 9, 1, "loose"), dimm(ST::DIMM, 4, 10, 1, "dimm"), twin(ST::Fan, 3, 11, 1, "same path");
    std::string const would = late.calcPathFromLinkedId(&loose);
    loose.setInstance(3);
    std::string const loosePath = late.getNodePath(&loose), dimmPath = late.calcNodePath(&dimm);
    loose.setInstance(4);
    EXPECT_EQ((Strings{hex(would), hex(late.getNodePath(&loose)), hex(dimmPath)}),
              (Strings{refHex({{20, 2}, {59, 0}}), refHex({{20, 3}, {59, 0}}), refHex({{19, 4}, {59, 0}})}));
    EXPECT_EQ(found(late, would, loosePath, dimmPath, 9u), (Nodes{nullptr, &loose, &dimm, nullptr}));
    EXPECT_TRUE(listed(late, ST::Fan).empty() && !addNew(late, loose));
    expectError(late.addMINode(Nodes{&twin}), 6);
}

TEST_F(NodeStoreTest, HierarchyRunsFromTheStopTypeOrTheRootDownWithProgressEventsAndTypeNames)
{
    Node cpu(ST::CPU, 1, 3, 2, "cpu"), dimm(ST::DIMM, 0xABCDEF01u, 4, 3, "dimm"), last(ST::invalid, 1, 10, 1, "74");
    Node beyond(static_cast<ST>(75), 7, 11, 1, "75"), temp(ST::TemperatureSensor, 5, 12, 11, "temperature");
    for (Node* n : {&root, &chassis, &cpu, &dimm, &last, &beyond, &temp})
        ASSERT_TRUE(addNew(store, *n));
    std::string const whole = "ROOT:00000000->Chassis:00000000->CPU:00000001";
    EXPECT_EQ((Strings{store.getNodeHierarchy(&cpu, ST::CPU), store.getNodeHierarchy(&cpu, ST::ROOT),
                       store.getNodeHierarchy(&cpu, ST::Fan), store.getNodeHierarchy(&dimm)}),
              (Strings{"CPU:00000001", whole, whole, whole + "->DIMM:abcdef01"}));
    // The default stop type is 74, whose node shows alone, without complaint;
    // one beyond the name table shows as invalid, with one.
    std::string const text = "ROOT:00000000->invalid:00000007->Temperature Sensor:00000005";
    ictest::LogCapture cap;
    EXPECT_EQ((Strings{store.getNodeHierarchy(&cpu, ST::Chassis), store.getNodeHierarchy(&last),
                       store.getNodeHierarchy(&temp)}),
              (Strings{"Chassis:00000000->CPU:00000001", "invalid:00000001", text}));
    ictest::expectEvent(cap, kNS, " getNodeHierarchy: parent sensor value invalid: 75", 6000, "getNodeHierarchy");
    cap.clear();
    EXPECT_EQ(store.getNodeHierarchy(nullptr) + store.getNodeHierarchy(nullptr, ST::Chassis), "");
    EXPECT_TRUE(cap.records().empty());
}

// A node under two paths: each removal takes the smaller of those left,
// whichever was computed first.
TEST_F(NodeStoreTest, AFurtherRemovalTakesTheNextPathOfTheNode)
{
    ASSERT_TRUE(addNew(store, root));
    for (bool smallerFirst : {false, true}) {
        Node twice(ST::Fan, smallerFirst ? 1 : 2, smallerFirst ? 20 : 9, 1, "twice");
        std::string const first = store.getNodePath(&twice);
        twice.setNodeId(twice.getNodeId() + 1);
        twice.setInstance(smallerFirst ? 2 : 1);
        std::string const second = store.getNodePath(&twice);
        std::string const& smaller = smallerFirst ? first : second;
        std::string const& larger = smallerFirst ? second : first;
        expectError(store.delNode(&twice), 0);
        EXPECT_EQ(found(store, smaller, larger), (Nodes{nullptr, &twice})) << smallerFirst;
        expectError(store.delNode(&twice), 0);
        EXPECT_EQ(found(store, larger), Nodes{nullptr}) << smallerFirst;
    }
}

// About half of the nodes removed, from many small stores and two larger
// ones (ids from several plug-ins): exactly the others are still found, by id
// and by path.
TEST(NodeStoreIndexes, RemovalsLeaveExactlyTheOthersFindable)
{
    for (unsigned int round = 0; round < 300; ++round) {
        std::mt19937 rng(round);
        NodeStore store;
        std::vector<std::unique_ptr<Node>> nodes;
        for (unsigned int i = 0, count = round < 2 ? 8191 : 1 + round % 9; i < count; ++i) {
            nodes.push_back(std::make_unique<Node>(ST::Fan, round * 16 + i, rng() % 8 << 16 | i, 0, "fan"));
            ASSERT_TRUE(addNew(store, *nodes.back()));
        }
        Nodes kept;
        for (auto const& n : nodes)
            kept.push_back(rng() % 2 ? n.get() : (store.erase(n->getPath()), nullptr));
        for (std::size_t k = 0; k < nodes.size(); ++k)
            ASSERT_TRUE(lookup(store, nodes[k]->getNodeId()) == kept[k] &&
                        lookup(store, nodes[k]->getPath()) == kept[k]) << round << " " << k;
    }
}

} // namespace
