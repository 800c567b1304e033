// Tests of IC::NodeStore: path codes, the registry, path calculation,
// hierarchy text, sensor type names and concurrent use.
#include <IC/NodeStore.h>

#include <HGLog/HGLogger.h>
#include <IC/Error.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <LogCapture.h>

#include <gtest/gtest.h>

#include <atomic>
#include <cstdint>
#include <cstdio>
#include <memory>
#include <random>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace {

using IC::Node;
using IC::NodeStore;
using TopoVec = NodeStore::TopoVec;
using ST = Node::SensorType;

std::string const kLogger = "Helmgard.IC.InstrumentationControl.NodeStore";
std::string const kSource = "NodeStore";
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
    if (n == 0)
        return "b";
    std::string s;
    while (n != 0) {
        s.insert(s.begin(), static_cast<char>('b' + n % 12));
        n /= 12;
    }
    return s;
}

std::string refLetters(TopoVec const& v)
{
    std::string s;
    for (auto const& p : v)
        s += refBase12(p.second) + "p" + refBase12(p.first) + "a";
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

std::string refPath(TopoVec const& v) { return pack(refLetters(v)); }

std::string hex8(unsigned int n)
{
    char buf[16];
    std::snprintf(buf, sizeof buf, "%08x", n);
    return buf;
}

// ---- result and log helpers ----

void expectDone(IC::Error const& e, unsigned char status)
{
    EXPECT_EQ(e.getStatus(), status);
    EXPECT_EQ(e.getText(), "");
    EXPECT_TRUE(e.getCode() == IC::Number(IC::Number::Generic));
}

// The what() of the std::invalid_argument thrown by f; fails if none is.
template <class F>
std::string invalidArgument(F&& f)
{
    try {
        f();
    } catch (std::invalid_argument const& e) {
        return e.what();
    } catch (...) {
        ADD_FAILURE() << "an exception other than std::invalid_argument";
        return "<other exception>";
    }
    ADD_FAILURE() << "no exception";
    return "<no exception>";
}

// Exactly one event with this message on each channel, with identical fields.
void expectEvent(ictest::LogCapture const& cap, std::string const& message, int level,
                 std::string const& function)
{
    std::vector<HGLog::Record> logs, traces;
    for (auto const& r : cap.records())
        if (r.message == message)
            (r.channel == HGLog::Channel::Log ? logs : traces).push_back(r);
    ASSERT_EQ(logs.size(), 1u) << "log channel: '" << message << "'";
    ASSERT_EQ(traces.size(), 1u) << "trace channel: '" << message << "'";
    HGLog::Record const& l = logs[0];
    HGLog::Record const& t = traces[0];
    EXPECT_EQ(l.level, level) << message;
    EXPECT_EQ(l.function, function) << message;
    EXPECT_EQ(l.file, kSource) << message;
    EXPECT_EQ(l.logger, kLogger) << message;
    EXPECT_GT(l.line, 0) << message;
    EXPECT_EQ(t.level, l.level);
    EXPECT_EQ(t.function, l.function);
    EXPECT_EQ(t.file, l.file);
    EXPECT_EQ(t.logger, l.logger);
    EXPECT_EQ(t.line, l.line);
}

Node* lookup(NodeStore const& store, unsigned int id)
{
    Node* n = nullptr;
    return store.getNode(id, &n).getStatus() == 0 ? n : nullptr;
}

Node* lookup(NodeStore const& store, std::string const& path)
{
    Node* n = nullptr;
    return store.getNode(path, &n).getStatus() == 0 ? n : nullptr;
}

std::vector<Node*> allOf(NodeStore const& store)
{
    std::vector<Node*> v;
    expectDone(store.getMap(v), 0);
    return v;
}

std::vector<Node*> allOf(NodeStore const& store, unsigned int type)
{
    std::vector<Node*> v;
    expectDone(store.getMap(v, type), 0);
    return v;
}

bool addNew(NodeStore& store, Node& node)
{
    Node* p = &node;
    bool isNew = false;
    expectDone(store.addNodeIfNew(p, isNew), 0);
    return isNew;
}

IC::Error addMI(NodeStore& store, Node& node)
{
    return store.addMINode(std::vector<Node*>{&node});
}

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

} // namespace

// =====================================================================
// Path codes
// =====================================================================

class NodeStoreCodes : public ::testing::Test {
protected:
    NodeStore store;
};

TEST_F(NodeStoreCodes, Int2hexIsEightLowerCaseDigits)
{
    EXPECT_EQ(store.int2hex(0), "00000000");
    EXPECT_EQ(store.int2hex(1), "00000001");
    EXPECT_EQ(store.int2hex(16), "00000010");
    EXPECT_EQ(store.int2hex(0x12345678u), "12345678");
    EXPECT_EQ(store.int2hex(0xABCDEF01u), "abcdef01");
    EXPECT_EQ(store.int2hex(0x80000000u), "80000000");
    EXPECT_EQ(store.int2hex(4294967295u), "ffffffff");
}

TEST_F(NodeStoreCodes, Int2chrWritesBase12Letters)
{
    EXPECT_EQ(store.int2chr(0), "b");
    EXPECT_EQ(store.int2chr(1), "c");
    EXPECT_EQ(store.int2chr(11), "m");
    EXPECT_EQ(store.int2chr(12), "cb");
    EXPECT_EQ(store.int2chr(13), "cc");
    EXPECT_EQ(store.int2chr(22), "cl");
    EXPECT_EQ(store.int2chr(59), "fm");
    EXPECT_EQ(store.int2chr(74), "hd");
    EXPECT_EQ(store.int2chr(143), "mm");
    EXPECT_EQ(store.int2chr(144), "cbb");
    EXPECT_EQ(store.int2chr(200), "cfj");
    EXPECT_EQ(store.int2chr(0x80000000u), "fmmdebjlj");
    EXPECT_EQ(store.int2chr(4294967295u), "kmlfhcgke");
}

TEST_F(NodeStoreCodes, NodecodeMatchesWorkedExamples)
{
    for (auto const& ex : kExamples) {
        std::string const path = store.nodecode(ex.topo);
        EXPECT_EQ(path, fromHex(ex.hex)) << ex.hex;
        EXPECT_EQ(store.hexstring(path), ex.hex);
    }
}

TEST_F(NodeStoreCodes, B12StringOfWorkedExamples)
{
    for (auto const& ex : kExamples)
        EXPECT_EQ(store.b12String(fromHex(ex.hex)), ex.b12) << ex.hex;
    EXPECT_EQ(store.b12String(""), "");
    EXPECT_EQ(store.b12String(std::string("\xff\x80\x01", 3)), "PPIAAB");
}

TEST_F(NodeStoreCodes, Uniqueid2topovecDecodesWorkedExamples)
{
    for (auto const& ex : kExamples) {
        TopoVec v;
        store.uniqueid2topovec(fromHex(ex.hex), 74, v);
        EXPECT_EQ(v, ex.topo) << ex.hex;
    }
}

TEST_F(NodeStoreCodes, Uniqueid2topovecStopsAfterStopType)
{
    TopoVec v;
    store.uniqueid2topovec(fromHex("2f501f201f5c"), 1, v);
    EXPECT_EQ(v, (TopoVec{{4, 1}, {1, 0}}));

    TopoVec own;
    store.uniqueid2topovec(fromHex("2f501f201f5c"), 4, own);
    EXPECT_EQ(own, (TopoVec{{4, 1}}));

    // A stop type that appears in no pair yields the whole vector.
    TopoVec all;
    store.uniqueid2topovec(fromHex("22f2b02f501f201f5c"), 20, all);
    EXPECT_EQ(all, kExamples[3].topo);
}

TEST_F(NodeStoreCodes, Uniqueid2topovecAppendsWithoutClearing)
{
    TopoVec v{{7, 7}, {8, 8}};
    store.uniqueid2topovec(fromHex("1f201f5c"), 74, v);
    EXPECT_EQ(v, (TopoVec{{7, 7}, {8, 8}, {1, 0}, {59, 0}}));
}

TEST_F(NodeStoreCodes, Uniqueid2topovecOfEmptyUidLeavesVectorAlone)
{
    TopoVec empty;
    store.uniqueid2topovec("", 74, empty);
    EXPECT_TRUE(empty.empty());

    TopoVec v{{3, 9}};
    store.uniqueid2topovec("", 74, v);
    EXPECT_EQ(v, (TopoVec{{3, 9}}));
}

TEST_F(NodeStoreCodes, EvenLengthLetterStringKeepsItsFinalA)
{
    // (0, 0) is "bpba": four letters, two full bytes, no final letter lost.
    std::string const path = store.nodecode(TopoVec{{0, 0}});
    EXPECT_EQ(path, fromHex("1f10"));
    EXPECT_EQ(store.b12String(path), "BPBA");
    TopoVec v;
    store.uniqueid2topovec(path, kNoStop, v);
    EXPECT_EQ(v, (TopoVec{{0, 0}}));
}

TEST_F(NodeStoreCodes, Uniqueid2topovecSkipsUnusedLettersAndWraps)
{
    // "bnpoca": n and o are skipped, giving (1, 0).
    TopoVec skipped;
    store.uniqueid2topovec(pack("bnpoca"), 74, skipped);
    EXPECT_EQ(skipped, (TopoVec{{1, 0}}));

    // Instance digits c b b b b b b b b b b are 12^10, which wraps at 32 bits.
    TopoVec wrapped;
    store.uniqueid2topovec(pack("cbbbbbbbbbbpca"), 74, wrapped);
    std::uint64_t const big = 61917364224ULL; // 12^10
    EXPECT_EQ(wrapped, (TopoVec{{1, static_cast<unsigned int>(big & 0xFFFFFFFFULL)}}));
}

TEST_F(NodeStoreCodes, NodecodeOfEmptyVectorIsDamaged)
{
    ictest::LogCapture cap;
    EXPECT_EQ(invalidArgument([&] { (void)store.nodecode(TopoVec{}); }), "Damaged node string");
    expectEvent(cap, "nodecode: Damaged node string =''", 6000, "nodecode");
    EXPECT_EQ(cap.logs().size(), 1u);
}

TEST_F(NodeStoreCodes, HexstringIsLowerCaseTwoDigitsPerByte)
{
    EXPECT_EQ(store.hexstring(""), "");
    EXPECT_EQ(store.hexstring(fromHex("1f5c")), "1f5c");
    EXPECT_EQ(store.hexstring(std::string("\xab\xc0", 2)), "abc0");
    EXPECT_EQ(store.hexstring(std::string("\xff\x80\x01\x7f", 4)), "ff80017f");
    EXPECT_EQ(store.hexstring(std::string("\0\x0a", 2)), "000a");
}

TEST_F(NodeStoreCodes, StringhexDecodesEitherCase)
{
    EXPECT_EQ(store.stringhex(""), "");
    EXPECT_EQ(store.stringhex("abc"), std::string("\xab\xc0", 2));
    EXPECT_EQ(store.stringhex("1f5c"), fromHex("1f5c"));
    EXPECT_EQ(store.stringhex("1F5C"), store.stringhex("1f5c"));
    EXPECT_EQ(store.stringhex("AbCdEf"), std::string("\xab\xcd\xef", 3));
    EXPECT_EQ(store.stringhex("ff80"), std::string("\xff\x80", 2));
    EXPECT_EQ(store.stringhex("1"), std::string("\x10", 1));
    EXPECT_EQ(store.stringhex("01"), std::string("\x01", 1));
    EXPECT_EQ(store.stringhex("22f2b02f501f201f5c"), fromHex("22f2b02f501f201f5c"));
}

TEST_F(NodeStoreCodes, StringhexRejectsInvalidDigit)
{
    ictest::LogCapture cap;
    EXPECT_EQ(invalidArgument([&] { (void)store.stringhex("1g"); }), "Invalid hexadecimal digit");
    expectEvent(cap, "stringHex: Invalid hexadecimal digit 3167", 3000, "stringhex");
    EXPECT_EQ(cap.logs().size(), 1u);

    cap.clear();
    EXPECT_EQ(invalidArgument([&] { (void)store.stringhex("x1"); }), "Invalid hexadecimal digit");
    expectEvent(cap, "stringHex: Invalid hexadecimal digit 7831", 3000, "stringhex");

    cap.clear();
    EXPECT_EQ(invalidArgument([&] { (void)store.stringhex("\xff"); }),
              "Invalid hexadecimal digit");
    expectEvent(cap, "stringHex: Invalid hexadecimal digit ff", 3000, "stringhex");
}

TEST_F(NodeStoreCodes, StringhexRejectsNullByte)
{
    ictest::LogCapture cap;
    // "0" is padded to "00".
    EXPECT_EQ(invalidArgument([&] { (void)store.stringhex("0"); }), "Invalid null byte");
    expectEvent(cap, "stringHex: Invalid null byte 0", 3000, "stringhex");
    EXPECT_EQ(cap.logs().size(), 1u);

    cap.clear();
    EXPECT_EQ(invalidArgument([&] { (void)store.stringhex("00ff"); }), "Invalid null byte");
    expectEvent(cap, "stringHex: Invalid null byte 00ff", 3000, "stringhex");

    // An odd length ending in 0 pads to a final zero byte.
    cap.clear();
    EXPECT_EQ(invalidArgument([&] { (void)store.stringhex("1f0"); }), "Invalid null byte");
    expectEvent(cap, "stringHex: Invalid null byte 1f0", 3000, "stringhex");
}

TEST_F(NodeStoreCodes, RoundTripsOverGeneratedPairLists)
{
    std::mt19937 rng(20240611u);
    unsigned int const special[] = {0u, 1u, 11u, 12u, 143u, 144u, 0x7FFFFFFFu, 0x80000000u,
                                    0xFFFFFFFFu};
    for (int round = 0; round < 400; ++round) {
        TopoVec v;
        std::size_t const len = 1 + rng() % 6;
        for (std::size_t k = 0; k < len; ++k) {
            unsigned int const type = rng() % 75;
            unsigned int const inst =
                (rng() % 2 == 0) ? special[rng() % (sizeof special / sizeof special[0])] : rng();
            v.emplace_back(type, inst);
        }
        std::string const path = store.nodecode(v);
        ASSERT_EQ(path, refPath(v)) << "round " << round;

        TopoVec back;
        store.uniqueid2topovec(path, kNoStop, back);
        ASSERT_EQ(back, v) << "round " << round;

        // With stop 74 the list ends after the first pair of type 74.
        TopoVec expected74;
        for (auto const& p : v) {
            expected74.push_back(p);
            if (p.first == 74)
                break;
        }
        TopoVec back74;
        store.uniqueid2topovec(path, 74, back74);
        ASSERT_EQ(back74, expected74) << "round " << round;

        std::string const hex = store.hexstring(path);
        ASSERT_EQ(hex.size(), 2 * path.size());
        ASSERT_EQ(hex.find_first_not_of("0123456789abcdef"), std::string::npos);
        ASSERT_EQ(store.stringhex(hex), path) << hex;
    }
}

TEST_F(NodeStoreCodes, LargeInstanceSurvivesRoundTrip)
{
    TopoVec const v{{42, 0xFFFFFFFFu}, {4, 0x80000000u}, {59, 0}};
    std::string const path = store.nodecode(v);
    EXPECT_EQ(store.hexstring(path), "acb5726a4f4705cc3419b9f501f5c0");
    EXPECT_EQ(path, pack("kmlfhcgkepeha" "fmmdebjljpfa" "bpfma"));
    TopoVec back;
    store.uniqueid2topovec(path, 74, back);
    EXPECT_EQ(back, v);
}

// =====================================================================
// Registry
// =====================================================================

class NodeStoreRegistry : public ::testing::Test {
protected:
    NodeStore store;
};

TEST_F(NodeStoreRegistry, GetMapOfEmptyStoreClearsOutVector)
{
    Node stray(ST::CPU, 1, 99, 0, "stray");
    std::vector<Node*> v{&stray, &stray};
    expectDone(store.getMap(v), 0);
    EXPECT_TRUE(v.empty());

    v = {&stray};
    expectDone(store.getMap(v, ST::CPU), 0);
    EXPECT_TRUE(v.empty());
}

TEST_F(NodeStoreRegistry, GetMapOrdersByTypeThenInsertion)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node cpuC(ST::CPU, 5, 30, 1, "cpu c");
    Node chassis(ST::Chassis, 0, 2, 1, "chassis");
    Node cpuA(ST::CPU, 1, 10, 1, "cpu a");
    Node cpuB(ST::CPU, 3, 20, 1, "cpu b");

    EXPECT_TRUE(addNew(store, cpuC)); // its parent is not there yet: own pair only
    EXPECT_TRUE(addNew(store, root));
    EXPECT_TRUE(addNew(store, chassis));
    EXPECT_TRUE(addNew(store, cpuA));
    EXPECT_TRUE(addNew(store, cpuB));

    std::vector<Node*> v{&root};
    expectDone(store.getMap(v), 0);
    EXPECT_EQ(v, (std::vector<Node*>{&chassis, &cpuC, &cpuA, &cpuB, &root}));

    v = {&root};
    expectDone(store.getMap(v, ST::CPU), 0);
    EXPECT_EQ(v, (std::vector<Node*>{&cpuC, &cpuA, &cpuB}));
    EXPECT_EQ(allOf(store, ST::ROOT), std::vector<Node*>{&root});
}

TEST_F(NodeStoreRegistry, GetAllNodesListsManagementInterfaceNodesToo)
{
    Node root(ST::ROOT, 0, 0x10001, 0, "root");
    Node fan(ST::Fan, 2, 0x10003, 0x10001, "fan");
    Node fpNode(ST::Group, 0, 0x20001, 0x10001, "group");
    ASSERT_EQ(store.addMINode({&root}).getStatus(), 0);
    ASSERT_EQ(store.addMINode({&fan}).getStatus(), 0);
    EXPECT_TRUE(addNew(store, fpNode));
    Node stray(ST::CPU, 1, 99, 0, "stray");
    std::vector<Node*> v{&stray};
    expectDone(store.getAllNodes(v), 0);
    EXPECT_EQ(v, (std::vector<Node*>{&root, &fan, &fpNode}));
    expectDone(store.getMap(v), 0);
    EXPECT_EQ(v, std::vector<Node*>{&fpNode});

    // A removed node leaves the listing with its indexes.
    store.erase(fan.getPath());
    expectDone(store.getAllNodes(v), 0);
    EXPECT_EQ(v, (std::vector<Node*>{&root, &fpNode}));
}

TEST_F(NodeStoreRegistry, NullNodesAreRefused)
{
    bool isNew = true;
    EXPECT_EQ(store.addNodeIfNew(nullptr, isNew).getStatus(), 1);
    EXPECT_FALSE(isNew);
    EXPECT_EQ(store.addMINode({nullptr}).getStatus(), 1);
    std::vector<Node*> v;
    store.getAllNodes(v);
    EXPECT_TRUE(v.empty());
}

TEST_F(NodeStoreRegistry, GetMapOfUnknownTypeIsEmpty)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    ASSERT_TRUE(addNew(store, root));
    Node stray(ST::CPU, 1, 99, 0, "stray");
    std::vector<Node*> v{&stray};
    expectDone(store.getMap(v, ST::Fan), 0);
    EXPECT_TRUE(v.empty());
    v = {&stray};
    expectDone(store.getMap(v, 1000), 0);
    EXPECT_TRUE(v.empty());
}

TEST_F(NodeStoreRegistry, AddNodeIfNewRegistersAndHandsPaths)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node chassis(ST::Chassis, 0, 2, 1, "chassis");
    Node cpu(ST::CPU, 1, 3, 2, "cpu");
    ictest::LogCapture cap;
    EXPECT_TRUE(addNew(store, root));
    EXPECT_TRUE(addNew(store, chassis));
    EXPECT_TRUE(addNew(store, cpu));
    EXPECT_TRUE(cap.records().empty());

    EXPECT_EQ(root.getPath(), fromHex("1f5c"));
    EXPECT_EQ(root.getLinkedPath(), "");
    EXPECT_EQ(chassis.getPath(), fromHex("1f201f5c"));
    EXPECT_EQ(chassis.getLinkedPath(), root.getPath());
    EXPECT_EQ(cpu.getPath(), fromHex("2f501f201f5c"));
    EXPECT_EQ(cpu.getLinkedPath(), chassis.getPath());

    for (Node* n : {&root, &chassis, &cpu}) {
        EXPECT_EQ(lookup(store, n->getNodeId()), n);
        EXPECT_EQ(lookup(store, n->getPath()), n);
        EXPECT_EQ(store.getNodePath(n), n->getPath());
        EXPECT_EQ(store.nodePathToSensor(n->getPath()), n->getSensor());
    }
}

TEST_F(NodeStoreRegistry, AddNodeSingleReturnsSuccessEitherWay)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node twin(ST::ROOT, 0, 2, 0, "twin");
    Node* p = &root;
    expectDone(store.addNode(p), 0);
    p = &twin;
    expectDone(store.addNode(p), 0);
    EXPECT_EQ(lookup(store, 1u), &root);
    EXPECT_EQ(lookup(store, 2u), nullptr);
    EXPECT_EQ(allOf(store), std::vector<Node*>{&root});
}

TEST_F(NodeStoreRegistry, MINodeIsFoundButNotListed)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node cpu(ST::CPU, 1, 2, 1, "cpu");
    expectDone(addMI(store, root), 0);
    expectDone(addMI(store, cpu), 0);
    EXPECT_EQ(lookup(store, 1u), &root);
    EXPECT_EQ(lookup(store, 2u), &cpu);
    EXPECT_EQ(cpu.getPath(), store.nodecode(TopoVec{{4, 1}, {59, 0}}));
    EXPECT_EQ(cpu.getLinkedPath(), root.getPath());
    EXPECT_EQ(lookup(store, cpu.getPath()), &cpu);
    EXPECT_TRUE(allOf(store).empty());
    EXPECT_TRUE(allOf(store, ST::CPU).empty());

    // Offering it again through addNodeIfNew finds its own path taken.
    EXPECT_FALSE(addNew(store, cpu));
    EXPECT_TRUE(allOf(store).empty());

    // Removing it from the listing is harmless.
    store.delNodeFromGetMap(cpu.getPath());
    EXPECT_EQ(lookup(store, cpu.getPath()), &cpu);
}

TEST_F(NodeStoreRegistry, DuplicatePathIsNotRegistered)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node twin(ST::ROOT, 0, 2, 0, "same path, other id");
    Node mi(ST::ROOT, 0, 3, 0, "same path through addMINode");
    ASSERT_TRUE(addNew(store, root));

    ictest::LogCapture cap;
    Node* p = &twin;
    bool isNew = true;
    expectDone(store.addNodeIfNew(p, isNew), 0);
    EXPECT_FALSE(isNew);
    expectDone(addMI(store, mi), 6);
    EXPECT_TRUE(cap.records().empty());

    EXPECT_EQ(lookup(store, 2u), nullptr);
    EXPECT_EQ(lookup(store, 3u), nullptr);
    EXPECT_EQ(lookup(store, root.getPath()), &root);
    EXPECT_EQ(twin.getPath(), "");
    EXPECT_EQ(mi.getPath(), "");
    EXPECT_EQ(allOf(store), std::vector<Node*>{&root});
}

TEST_F(NodeStoreRegistry, DuplicateIdCountsAsKnown)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node cpu(ST::CPU, 1, 7, 1, "cpu");
    Node other(ST::Fan, 3, 7, 1, "same id, other type");
    ASSERT_TRUE(addNew(store, root));
    ASSERT_TRUE(addNew(store, cpu));

    ictest::LogCapture cap;
    Node* p = &other;
    bool isNew = true;
    expectDone(store.addNodeIfNew(p, isNew), 0);
    EXPECT_FALSE(isNew);
    expectDone(addMI(store, other), 6);
    EXPECT_TRUE(cap.records().empty());

    EXPECT_EQ(lookup(store, 7u), &cpu);
    EXPECT_TRUE(allOf(store, ST::Fan).empty());
    EXPECT_EQ(allOf(store), (std::vector<Node*>{&cpu, &root}));
    EXPECT_EQ(lookup(store, store.nodecode(TopoVec{{20, 3}, {59, 0}})), nullptr);
}

TEST_F(NodeStoreRegistry, Add2NodeMapOfDuplicateIdFails)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node cpu(ST::CPU, 1, 4000000000u, 1, "cpu");
    Node dup(ST::Fan, 2, 4000000000u, 1, "same id");
    ASSERT_TRUE(addNew(store, root));
    ASSERT_TRUE(addNew(store, cpu));

    ictest::LogCapture cap;
    Node* p = &dup;
    IC::Error const e = store.add2NodeMap(p);
    EXPECT_EQ(e.getStatus(), 1);
    EXPECT_EQ(e.getText(), "NodeStore Duplicated Node Pointer");
    EXPECT_TRUE(e.getCode() == IC::Number(IC::Number::Generic));
    expectEvent(cap, "add2NodeMap: Node 4000000000 found twice during NodeId to Node Map", 6000,
                "add2NodeMap");
    EXPECT_EQ(cap.logs().size(), 1u);

    // The second node is handed the path cached for the id, and its parent's.
    EXPECT_EQ(dup.getPath(), cpu.getPath());
    EXPECT_EQ(dup.getLinkedPath(), root.getPath());
    EXPECT_EQ(lookup(store, 4000000000u), &cpu);
    EXPECT_EQ(lookup(store, cpu.getPath()), &cpu);
}

TEST_F(NodeStoreRegistry, Add2NodeMapRegistersWithoutListing)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node cpu(ST::CPU, 2, 2, 1, "cpu");
    Node* p = &root;
    expectDone(store.add2NodeMap(p), 0);
    p = &cpu;
    expectDone(store.add2NodeMap(p), 0);
    EXPECT_EQ(cpu.getPath(), fromHex("3f501f5c"));
    EXPECT_EQ(cpu.getPath(), store.nodecode(TopoVec{{4, 2}, {59, 0}}));
    EXPECT_EQ(cpu.getLinkedPath(), root.getPath());
    EXPECT_EQ(lookup(store, 2u), &cpu);
    EXPECT_EQ(lookup(store, cpu.getPath()), &cpu);
    EXPECT_TRUE(allOf(store).empty());
}

TEST_F(NodeStoreRegistry, Add2NodeMapLeavesATakenPathToItsFirstNode)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node twin(ST::ROOT, 0, 2, 0, "same path, other id");
    ASSERT_TRUE(addNew(store, root));
    Node* p = &twin;
    expectDone(store.add2NodeMap(p), 0);
    EXPECT_EQ(twin.getPath(), root.getPath());
    EXPECT_EQ(lookup(store, 2u), &twin);
    EXPECT_EQ(lookup(store, root.getPath()), &root);
}

TEST_F(NodeStoreRegistry, Add2NodeMapVectorStopsAtFirstFailure)
{
    Node a(ST::ROOT, 0, 1, 0, "a");
    Node dup(ST::ROOT, 1, 1, 0, "same id as a");
    Node c(ST::ROOT, 2, 3, 0, "c");
    ictest::LogCapture cap;
    IC::Error const e = store.add2NodeMap(std::vector<Node*>{&a, &dup, &c});
    EXPECT_EQ(e.getStatus(), 1);
    EXPECT_EQ(e.getText(), "NodeStore Duplicated Node Pointer");
    expectEvent(cap, "add2NodeMap: Node 1 found twice during NodeId to Node Map", 6000,
                "add2NodeMap");
    EXPECT_EQ(lookup(store, 1u), &a);
    EXPECT_EQ(lookup(store, 3u), nullptr);
    EXPECT_EQ(c.getPath(), "");

    NodeStore other;
    expectDone(other.add2NodeMap(std::vector<Node*>{}), 0);
    Node x(ST::ROOT, 0, 1, 0, "x");
    Node y(ST::Chassis, 0, 2, 1, "y");
    expectDone(other.add2NodeMap(std::vector<Node*>{&x, &y}), 0);
    EXPECT_EQ(lookup(other, 2u), &y);
    EXPECT_EQ(y.getPath(), fromHex("1f201f5c"));
}

TEST_F(NodeStoreRegistry, AddNodeVectorAlwaysSucceeds)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node twin(ST::ROOT, 0, 2, 0, "same path");
    Node dupId(ST::Fan, 0, 1, 0, "same id");
    Node cpu(ST::CPU, 1, 3, 1, "cpu");
    expectDone(store.addNode(std::vector<Node*>{&root, &twin, &dupId, &cpu}), 0);
    EXPECT_EQ(allOf(store), (std::vector<Node*>{&cpu, &root}));
    EXPECT_EQ(lookup(store, 2u), nullptr);
    EXPECT_EQ(lookup(store, 1u), &root);
    EXPECT_EQ(cpu.getLinkedPath(), root.getPath());

    // Entirely made of known nodes: still success.
    expectDone(store.addNode(std::vector<Node*>{&twin, &dupId}), 0);
    expectDone(store.addNode(std::vector<Node*>{}), 0);
}

TEST_F(NodeStoreRegistry, AddMINodeAnswersForItsLastNode)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node twin(ST::ROOT, 0, 2, 0, "same path");
    Node cpu(ST::CPU, 1, 3, 1, "cpu");
    Node fan(ST::Fan, 1, 4, 1, "fan");
    expectDone(store.addMINode(std::vector<Node*>{&root, &twin}), 6);
    EXPECT_EQ(lookup(store, 1u), &root);
    expectDone(store.addMINode(std::vector<Node*>{&twin, &cpu}), 0);
    EXPECT_EQ(lookup(store, 3u), &cpu);
    expectDone(store.addMINode(std::vector<Node*>{&cpu, &fan, &twin}), 6);
    EXPECT_EQ(lookup(store, 4u), &fan);
    EXPECT_EQ(lookup(store, 2u), nullptr);
    expectDone(store.addMINode(std::vector<Node*>{}), 0);
    EXPECT_TRUE(allOf(store).empty());
}

TEST_F(NodeStoreRegistry, LookupMissesLeaveOutPointerAlone)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    ASSERT_TRUE(addNew(store, root));
    Node sentinel(ST::Fan, 0, 0, 0, "sentinel");
    ictest::LogCapture cap;

    Node* out = &sentinel;
    expectDone(store.getNode(2u, &out), 1);
    EXPECT_EQ(out, &sentinel);
    expectDone(store.getNode(fromHex("1f201f5c"), &out), 1);
    EXPECT_EQ(out, &sentinel);
    expectDone(store.getNode(std::string(), &out), 1);
    EXPECT_EQ(out, &sentinel);
    expectDone(store.nodeId2Node(2u, &out), 1);
    expectDone(store.nodePath2Node("nothing", &out), 1);
    EXPECT_EQ(out, &sentinel);
    EXPECT_TRUE(cap.records().empty());

    expectDone(store.getNode(1u, &out), 0);
    EXPECT_EQ(out, &root);
    out = &sentinel;
    expectDone(store.getNode(root.getPath(), &out), 0);
    EXPECT_EQ(out, &root);
}

TEST_F(NodeStoreRegistry, DelNodeFromGetMapOnlyUnlists)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node cpuA(ST::CPU, 1, 2, 1, "cpu a");
    Node cpuB(ST::CPU, 2, 3, 1, "cpu b");
    Node cpuC(ST::CPU, 3, 4, 1, "cpu c");
    for (Node* n : {&root, &cpuA, &cpuB, &cpuC})
        ASSERT_TRUE(addNew(store, *n));

    store.delNodeFromGetMap(cpuB.getPath());
    EXPECT_EQ(allOf(store, ST::CPU), (std::vector<Node*>{&cpuA, &cpuC}));
    EXPECT_EQ(allOf(store), (std::vector<Node*>{&cpuA, &cpuC, &root}));
    EXPECT_EQ(lookup(store, cpuB.getPath()), &cpuB);
    EXPECT_EQ(lookup(store, 3u), &cpuB);
    EXPECT_EQ(store.nodePathToSensor(cpuB.getPath()), ST::CPU);

    store.delNodeFromGetMap(cpuB.getPath()); // already unlisted
    store.delNodeFromGetMap(fromHex("ffff")); // unknown path
    EXPECT_EQ(allOf(store), (std::vector<Node*>{&cpuA, &cpuC, &root}));

    store.delNodeFromGetMap(cpuA.getPath());
    EXPECT_EQ(allOf(store, ST::CPU), std::vector<Node*>{&cpuC});
}

TEST_F(NodeStoreRegistry, EraseRemovesFromEveryIndex)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node cpuA(ST::CPU, 1, 2, 1, "cpu a");
    Node cpuB(ST::CPU, 2, 3, 1, "cpu b");
    for (Node* n : {&root, &cpuA, &cpuB})
        ASSERT_TRUE(addNew(store, *n));
    std::string const pathA = cpuA.getPath();

    store.erase(pathA);
    Node* out = nullptr;
    expectDone(store.getNode(pathA, &out), 1);
    expectDone(store.getNode(2u, &out), 1);
    EXPECT_EQ(out, nullptr);
    EXPECT_EQ(store.nodePathToSensor(pathA), ST::invalid);
    EXPECT_EQ(allOf(store), (std::vector<Node*>{&cpuB, &root}));
    EXPECT_EQ(lookup(store, 3u), &cpuB);

    // Its cached path went too: offered again with another instance, it gets
    // a freshly computed path.
    cpuA.setInstance(9);
    EXPECT_TRUE(addNew(store, cpuA));
    EXPECT_EQ(cpuA.getPath(), store.nodecode(TopoVec{{4, 9}, {59, 0}}));
    EXPECT_EQ(lookup(store, pathA), nullptr);
}

TEST_F(NodeStoreRegistry, EraseOfUnknownPathIsHarmless)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node cpu(ST::CPU, 1, 2, 1, "cpu");
    ASSERT_TRUE(addNew(store, root));
    ASSERT_TRUE(addNew(store, cpu));
    ictest::LogCapture cap;
    store.erase(fromHex("2f601f5c"));
    store.erase("");
    EXPECT_TRUE(cap.records().empty());
    EXPECT_EQ(allOf(store), (std::vector<Node*>{&cpu, &root}));
    EXPECT_EQ(lookup(store, 1u), &root);
    EXPECT_EQ(lookup(store, 2u), &cpu);
    EXPECT_EQ(lookup(store, cpu.getPath()), &cpu);
}

TEST_F(NodeStoreRegistry, DelNodeRemovesEverything)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node cpu(ST::CPU, 1, 2, 1, "cpu");
    Node mi(ST::Fan, 1, 3, 1, "fan");
    ASSERT_TRUE(addNew(store, root));
    ASSERT_TRUE(addNew(store, cpu));
    expectDone(addMI(store, mi), 0);
    std::string const path = cpu.getPath();

    Node* p = &cpu;
    expectDone(store.delNode(p), 0);
    EXPECT_EQ(lookup(store, 2u), nullptr);
    EXPECT_EQ(lookup(store, path), nullptr);
    EXPECT_EQ(allOf(store), std::vector<Node*>{&root});

    p = &mi;
    expectDone(store.delNode(p), 0);
    EXPECT_EQ(lookup(store, 3u), nullptr);
    EXPECT_EQ(lookup(store, mi.getPath()), nullptr);

    // Deleting again, or a node never added, does not fail.
    expectDone(store.delNode(p), 0);
    Node stranger(ST::Fan, 9, 99, 0, "stranger");
    p = &stranger;
    expectDone(store.delNode(p), 0);
    EXPECT_EQ(allOf(store), std::vector<Node*>{&root});
    EXPECT_EQ(lookup(store, 1u), &root);

    // Re-added with another instance, the node's path is computed afresh.
    cpu.setInstance(5);
    EXPECT_TRUE(addNew(store, cpu));
    EXPECT_EQ(cpu.getPath(), store.nodecode(TopoVec{{4, 5}, {59, 0}}));
}

TEST_F(NodeStoreRegistry, ClearEmptiesEveryIndex)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node cpu(ST::CPU, 1, 2, 1, "cpu");
    Node mi(ST::Fan, 1, 3, 1, "fan");
    ASSERT_TRUE(addNew(store, root));
    ASSERT_TRUE(addNew(store, cpu));
    expectDone(addMI(store, mi), 0);
    std::string const cpuPath = cpu.getPath();

    store.clear();
    EXPECT_TRUE(allOf(store).empty());
    for (unsigned int id : {1u, 2u, 3u})
        EXPECT_EQ(lookup(store, id), nullptr) << id;
    EXPECT_EQ(lookup(store, cpuPath), nullptr);
    EXPECT_EQ(store.nodePathToSensor(cpuPath), ST::invalid);

    // The path caches are empty too.
    cpu.setInstance(6);
    ASSERT_TRUE(addNew(store, root));
    EXPECT_TRUE(addNew(store, cpu));
    EXPECT_EQ(cpu.getPath(), store.nodecode(TopoVec{{4, 6}, {59, 0}}));
    EXPECT_EQ(allOf(store), (std::vector<Node*>{&cpu, &root}));
}

// =====================================================================
// Paths
// =====================================================================

class NodeStorePaths : public ::testing::Test {
protected:
    NodeStore store;
};

TEST_F(NodeStorePaths, ChainReproducesWorkedExamples)
{
    Node root(ST::ROOT, 0, 10, 0, "root");
    Node chassis(ST::Chassis, 0, 20, 10, "chassis");
    Node cpu(ST::CPU, 1, 30, 20, "cpu");
    Node temp(ST::TemperatureSensor, 13, 40, 30, "temperature");
    Node* chain[] = {&root, &chassis, &cpu, &temp};
    for (std::size_t i = 0; i < 4; ++i) {
        ASSERT_TRUE(addNew(store, *chain[i]));
        EXPECT_EQ(chain[i]->getPath(), fromHex(kExamples[i].hex)) << kExamples[i].hex;
        EXPECT_EQ(store.hexstring(store.getNodePath(chain[i])), kExamples[i].hex);
    }
}

TEST_F(NodeStorePaths, ParentlessRoot)
{
    Node root(ST::ROOT, 0, 5, 0, "root");
    EXPECT_TRUE(addNew(store, root));
    EXPECT_EQ(root.getPath(), fromHex("1f5c"));
    EXPECT_EQ(store.getNodePath(&root), std::string("\x1f\x5c", 2));
    EXPECT_EQ(store.getNodeHierarchy(&root), "ROOT:00000000");
}

TEST_F(NodeStorePaths, SelfLinkedNodeIsARoot)
{
    Node self(ST::ROOT, 0, 5, 5, "names itself as parent");
    EXPECT_TRUE(addNew(store, self));
    EXPECT_EQ(self.getPath(), fromHex("1f5c"));
    // Its parent id resolves to itself.
    EXPECT_EQ(self.getLinkedPath(), self.getPath());

    NodeStore other;
    Node plain(ST::ROOT, 0, 5, 0, "parentless");
    EXPECT_TRUE(addNew(other, plain));
    EXPECT_EQ(plain.getPath(), self.getPath());

    Node selfCpu(ST::CPU, 3, 8, 8, "self-linked cpu");
    EXPECT_EQ(store.getNodePath(&selfCpu), store.nodecode(TopoVec{{4, 3}}));
}

TEST_F(NodeStorePaths, MissingParentGivesOwnPairForGood)
{
    Node cpu(ST::CPU, 1, 30, 20, "cpu whose chassis is not known yet");
    ASSERT_TRUE(addNew(store, cpu));
    EXPECT_EQ(cpu.getPath(), fromHex("2f50"));
    EXPECT_EQ(cpu.getLinkedPath(), "");

    Node chassis(ST::Chassis, 0, 20, 0, "chassis");
    ASSERT_TRUE(addNew(store, chassis));
    EXPECT_EQ(store.getNodePath(&cpu), fromHex("2f50"));
    EXPECT_EQ(cpu.getPath(), fromHex("2f50"));
    EXPECT_EQ(lookup(store, fromHex("2f50")), &cpu);
    EXPECT_EQ(store.getNodeHierarchy(&cpu), "CPU:00000001");

    // A sibling that arrives now gets the full path.
    Node sibling(ST::CPU, 2, 31, 20, "second cpu");
    ASSERT_TRUE(addNew(store, sibling));
    EXPECT_EQ(sibling.getPath(), store.nodecode(TopoVec{{4, 2}, {1, 0}}));
    EXPECT_EQ(sibling.getLinkedPath(), chassis.getPath());
}

TEST_F(NodeStorePaths, MissingGrandparentEndsTheWalk)
{
    Node chassis(ST::Chassis, 0, 20, 10, "chassis of an unknown root");
    Node cpu(ST::CPU, 1, 30, 20, "cpu");
    ASSERT_TRUE(addNew(store, chassis));
    ASSERT_TRUE(addNew(store, cpu));
    EXPECT_EQ(cpu.getPath(), store.nodecode(TopoVec{{4, 1}, {1, 0}}));
    EXPECT_EQ(store.getNodeHierarchy(&cpu), "Chassis:00000000->CPU:00000001");
}

TEST_F(NodeStorePaths, CachedPathSurvivesInstanceChange)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node cpu(ST::CPU, 1, 2, 1, "cpu");
    ASSERT_TRUE(addNew(store, root));
    ASSERT_TRUE(addNew(store, cpu));
    std::string const first = store.getNodePath(&cpu);
    cpu.setInstance(7);
    EXPECT_EQ(store.getNodePath(&cpu), first);
    EXPECT_EQ(store.calcPathFromLinkedId(&cpu), first);

    // An unregistered node: the first call caches, the second reuses.
    Node loose(ST::Fan, 3, 50, 1, "loose fan");
    std::string const loosePath = store.getNodePath(&loose);
    EXPECT_EQ(loosePath, store.nodecode(TopoVec{{20, 3}, {59, 0}}));
    loose.setInstance(4);
    EXPECT_EQ(store.getNodePath(&loose), loosePath);
}

TEST_F(NodeStorePaths, ChildInheritsParentsCachedPath)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node chassis(ST::Chassis, 2, 2, 1, "chassis");
    ASSERT_TRUE(addNew(store, root));
    ASSERT_TRUE(addNew(store, chassis));
    chassis.setInstance(8); // too late: its path is cached
    Node cpu(ST::CPU, 1, 3, 2, "cpu");
    ASSERT_TRUE(addNew(store, cpu));
    EXPECT_EQ(cpu.getPath(), store.nodecode(TopoVec{{4, 1}, {1, 2}, {59, 0}}));
    EXPECT_EQ(cpu.getLinkedPath(), chassis.getPath());
}

TEST_F(NodeStorePaths, InvalidAncestorCutsInheritedPairs)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node bad(ST::invalid, 3, 2, 1, "invalid");
    Node cpu(ST::CPU, 1, 3, 2, "cpu");
    Node core(ST::CPUCore, 4, 4, 3, "core");
    for (Node* n : {&root, &bad, &cpu, &core})
        ASSERT_TRUE(addNew(store, *n));
    EXPECT_EQ(bad.getPath(), store.nodecode(TopoVec{{74, 3}, {59, 0}}));
    EXPECT_EQ(cpu.getPath(), store.nodecode(TopoVec{{4, 1}, {74, 3}}));
    EXPECT_EQ(core.getPath(), store.nodecode(TopoVec{{42, 4}, {4, 1}, {74, 3}}));
    EXPECT_EQ(cpu.getLinkedPath(), bad.getPath());
    EXPECT_EQ(store.getNodeHierarchy(&core), "invalid:00000003->CPU:00000001->CPU Core:00000004");
}

TEST_F(NodeStorePaths, GetNodePathOfUnregisteredNodeCachesIt)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    ASSERT_TRUE(addNew(store, root));
    Node loose(ST::Fan, 2, 9, 1, "not added");
    std::string const path = store.getNodePath(&loose);
    EXPECT_EQ(path, store.nodecode(TopoVec{{20, 2}, {59, 0}}));
    EXPECT_EQ(lookup(store, path), &loose);
    EXPECT_EQ(lookup(store, 9u), nullptr);
    EXPECT_EQ(store.nodePathToSensor(path), ST::Fan);
    EXPECT_TRUE(allOf(store, ST::Fan).empty());

    // Its path is now taken, by itself and for anybody else.
    EXPECT_FALSE(addNew(store, loose));
    Node twin(ST::Fan, 2, 10, 1, "same path");
    expectDone(addMI(store, twin), 6);
    EXPECT_EQ(lookup(store, 10u), nullptr);
}

TEST_F(NodeStorePaths, CalcNodePathCaches)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    ASSERT_TRUE(addNew(store, root));
    Node loose(ST::DIMM, 4, 9, 1, "not added");
    std::string const path = store.calcNodePath(&loose);
    EXPECT_EQ(path, store.nodecode(TopoVec{{19, 4}, {59, 0}}));
    EXPECT_EQ(lookup(store, path), &loose);
}

TEST_F(NodeStorePaths, CalcPathFromLinkedIdCachesNothing)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node chassis(ST::Chassis, 0, 2, 1, "chassis");
    ASSERT_TRUE(addNew(store, root));
    ASSERT_TRUE(addNew(store, chassis));

    Node cpu(ST::CPU, 1, 3, 2, "cpu");
    std::string const path = store.calcPathFromLinkedId(&cpu);
    EXPECT_EQ(path, fromHex("2f501f201f5c"));
    EXPECT_EQ(lookup(store, path), nullptr);
    EXPECT_EQ(store.nodePathToSensor(path), ST::invalid);

    // Not cached: a changed instance gives a different answer.
    cpu.setInstance(2);
    EXPECT_EQ(store.calcPathFromLinkedId(&cpu), store.nodecode(TopoVec{{4, 2}, {1, 0}, {59, 0}}));
    EXPECT_TRUE(addNew(store, cpu));
    EXPECT_EQ(cpu.getPath(), store.nodecode(TopoVec{{4, 2}, {1, 0}, {59, 0}}));
}

TEST_F(NodeStorePaths, NodePathToSensor)
{
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node psu(ST::PowerSupply, 1, 2, 1, "psu");
    ASSERT_TRUE(addNew(store, root));
    expectDone(addMI(store, psu), 0);
    EXPECT_EQ(store.nodePathToSensor(root.getPath()), ST::ROOT);
    EXPECT_EQ(store.nodePathToSensor(psu.getPath()), ST::PowerSupply);
    EXPECT_EQ(store.nodePathToSensor(fromHex("2f50")), ST::invalid);
    EXPECT_EQ(store.nodePathToSensor(""), ST::invalid);
}

TEST_F(NodeStorePaths, LargeInstancesInAChain)
{
    Node root(ST::ROOT, 0xFFFFFFFFu, 1, 0, "root");
    Node cpu(ST::CPU, 0x80000000u, 2, 1, "cpu");
    ASSERT_TRUE(addNew(store, root));
    ASSERT_TRUE(addNew(store, cpu));
    EXPECT_EQ(cpu.getPath(), refPath(TopoVec{{4, 0x80000000u}, {59, 0xFFFFFFFFu}}));
    EXPECT_EQ(store.getNodeHierarchy(&cpu), "ROOT:ffffffff->CPU:80000000");
    EXPECT_EQ(lookup(store, store.stringhex(store.hexstring(cpu.getPath()))), &cpu);
}

// =====================================================================
// Hierarchy text
// =====================================================================

class NodeStoreHierarchy : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(addNew(store, root));
        ASSERT_TRUE(addNew(store, chassis));
        ASSERT_TRUE(addNew(store, cpu));
    }
    NodeStore store;
    Node root{ST::ROOT, 0, 1, 0, "root"};
    Node chassis{ST::Chassis, 0, 2, 1, "chassis"};
    Node cpu{ST::CPU, 1, 3, 2, "cpu"};
};

TEST_F(NodeStoreHierarchy, WholeChainRootFirst)
{
    ictest::LogCapture cap;
    EXPECT_EQ(store.getNodeHierarchy(&cpu), "ROOT:00000000->Chassis:00000000->CPU:00000001");
    EXPECT_EQ(cap.messages(),
              (std::vector<std::string>{"topovec.size = 3",
                                        " Hierarchy = ROOT:00000000->Chassis:00000000->CPU:00000001"}));
    expectEvent(cap, "topovec.size = 3", 3000, "getNodeHierarchy");
    expectEvent(cap, " Hierarchy = ROOT:00000000->Chassis:00000000->CPU:00000001", 3000,
                "getNodeHierarchy");
    EXPECT_EQ(cap.records().size(), 4u);

    EXPECT_EQ(store.getNodeHierarchy(&cpu, ST::invalid), store.getNodeHierarchy(&cpu));
    EXPECT_EQ(store.getNodeHierarchy(&root), "ROOT:00000000");
    EXPECT_EQ(store.getNodeHierarchy(&chassis), "ROOT:00000000->Chassis:00000000");
}

TEST_F(NodeStoreHierarchy, StopTypeCutsTheChain)
{
    ictest::LogCapture cap;
    EXPECT_EQ(store.getNodeHierarchy(&cpu, ST::Chassis), "Chassis:00000000->CPU:00000001");
    expectEvent(cap, "topovec.size = 2", 3000, "getNodeHierarchy");
    expectEvent(cap, " Hierarchy = Chassis:00000000->CPU:00000001", 3000, "getNodeHierarchy");

    EXPECT_EQ(store.getNodeHierarchy(&cpu, ST::CPU), "CPU:00000001");
    EXPECT_EQ(store.getNodeHierarchy(&cpu, ST::ROOT),
              "ROOT:00000000->Chassis:00000000->CPU:00000001");
    EXPECT_EQ(store.getNodeHierarchy(&cpu, ST::Fan),
              "ROOT:00000000->Chassis:00000000->CPU:00000001");
}

TEST_F(NodeStoreHierarchy, NullNodeGivesEmptyTextSilently)
{
    ictest::LogCapture cap;
    EXPECT_EQ(store.getNodeHierarchy(nullptr), "");
    EXPECT_EQ(store.getNodeHierarchy(nullptr, ST::Chassis), "");
    EXPECT_TRUE(cap.records().empty());
}

TEST_F(NodeStoreHierarchy, InstancesAreEightHexDigits)
{
    Node dimm(ST::DIMM, 0xABCDEF01u, 4, 3, "dimm");
    ASSERT_TRUE(addNew(store, dimm));
    EXPECT_EQ(store.getNodeHierarchy(&dimm),
              "ROOT:00000000->Chassis:00000000->CPU:00000001->DIMM:abcdef01");
}

TEST_F(NodeStoreHierarchy, UnregisteredNodeGetsItsPathComputed)
{
    Node fan(ST::Fan, 2, 50, 2, "not added");
    EXPECT_EQ(store.getNodeHierarchy(&fan), "ROOT:00000000->Chassis:00000000->Fan:00000002");
    EXPECT_EQ(lookup(store, store.nodecode(TopoVec{{20, 2}, {1, 0}, {59, 0}})), &fan);
}

TEST_F(NodeStoreHierarchy, TypeAboveRangePrintsInvalid)
{
    Node odd(static_cast<ST>(200), 7, 4, 2, "type out of range");
    Node child(ST::CPU, 5, 5, 4, "child");
    ASSERT_TRUE(addNew(store, odd));
    ASSERT_TRUE(addNew(store, child));
    EXPECT_EQ(child.getPath(), store.nodecode(TopoVec{{4, 5}, {200, 7}, {1, 0}, {59, 0}}));

    ictest::LogCapture cap;
    std::string const text = store.getNodeHierarchy(&child);
    EXPECT_EQ(text, "ROOT:00000000->Chassis:00000000->invalid:00000007->CPU:00000005");
    std::string const hier = " Hierarchy = " + text;
    EXPECT_EQ(cap.messages(),
              (std::vector<std::string>{"topovec.size = 4",
                                        " getNodeHierarchy: parent sensor value invalid: 200",
                                        hier}));
    expectEvent(cap, " getNodeHierarchy: parent sensor value invalid: 200", 6000,
                "getNodeHierarchy");
    expectEvent(cap, hier, 3000, "getNodeHierarchy");
}

TEST_F(NodeStoreHierarchy, BoundaryOfTheNameTable)
{
    Node last(ST::invalid, 1, 10, 0, "type 74");
    Node beyond(static_cast<ST>(75), 2, 11, 0, "type 75");
    ASSERT_TRUE(addNew(store, last));
    ASSERT_TRUE(addNew(store, beyond));

    ictest::LogCapture cap;
    EXPECT_EQ(store.getNodeHierarchy(&last), "invalid:00000001");
    EXPECT_EQ(cap.logs().size(), 2u); // no complaint about 74 itself
    cap.clear();
    EXPECT_EQ(store.getNodeHierarchy(&beyond), "invalid:00000002");
    expectEvent(cap, " getNodeHierarchy: parent sensor value invalid: 75", 6000,
                "getNodeHierarchy");
}

// =====================================================================
// Sensor type names
// =====================================================================

namespace {
char const* const kSensorNames[] = {
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
static_assert(sizeof kSensorNames / sizeof kSensorNames[0] == 75, "75 sensor types");
} // namespace

class NodeStoreSensorNames : public ::testing::TestWithParam<unsigned int> {
};

TEST_P(NodeStoreSensorNames, NameInHierarchy)
{
    unsigned int const type = GetParam();
    unsigned int const instance = type * 0x01010101u;
    NodeStore store;
    Node root(ST::ROOT, 0, 1, 0, "root");
    Node node(static_cast<ST>(type), instance, 2, 1, "node");
    ASSERT_TRUE(addNew(store, root));
    ASSERT_TRUE(addNew(store, node));
    std::string const own = std::string(kSensorNames[type]) + ":" + hex8(instance);
    std::string const expected = (type == 74) ? own : "ROOT:00000000->" + own;
    ictest::LogCapture cap;
    EXPECT_EQ(store.getNodeHierarchy(&node), expected);
    EXPECT_EQ(store.getNodeHierarchy(&node, static_cast<ST>(type)), own);
    for (auto const& r : cap.logs())
        EXPECT_NE(r.level, 6000) << r.message;
}

INSTANTIATE_TEST_SUITE_P(AllTypes, NodeStoreSensorNames, ::testing::Range(0u, 75u));

// =====================================================================
// Concurrency
// =====================================================================

namespace {

struct Planned {
    std::unique_ptr<Node> node;
    std::string path;
    std::string parentPath;
};

ST treeType(int i)
{
    static ST const types[] = {ST::Chassis, ST::CPU, ST::DIMM, ST::CPUCore, ST::VoltageSensor,
                               ST::PowerSupply, ST::TemperatureSensor};
    return types[i % 7];
}

} // namespace

TEST(NodeStoreConcurrency, ParallelAddsAndQueries)
{
    constexpr int kWriters = 4;
    constexpr int kPerWriter = 120;
    constexpr int kContested = 16;
    constexpr int kReaders = 3;
    constexpr int kReaderRounds = 150;

    NodeStore store;
    Node sharedRoot(ST::ROOT, 0, 1, 0, "shared root");
    ASSERT_TRUE(addNew(store, sharedRoot));
    std::string const rootPath = refPath(TopoVec{{59, 0}});
    ASSERT_EQ(sharedRoot.getPath(), rootPath);
    ASSERT_EQ(store.getNodeHierarchy(&sharedRoot), "ROOT:00000000");

    // Each writer owns a tree under a root of its own instance, built parent
    // first, plus its own copy of every contested node (same path for all
    // writers, distinct ids).
    std::vector<std::vector<Planned>> trees(kWriters);
    std::vector<std::vector<std::unique_ptr<Node>>> contested(kWriters);
    for (int w = 0; w < kWriters; ++w) {
        unsigned int const base = static_cast<unsigned int>(w + 1) << 16;
        std::vector<TopoVec> topo;
        for (int i = 0; i < kPerWriter; ++i) {
            Planned p;
            if (i == 0) {
                p.node = std::make_unique<Node>(ST::ROOT, 100u + w, base | 1u, 0u, "tree root");
                topo.push_back(TopoVec{{59, 100u + w}});
            } else {
                int const parent = (i - 1) / 3;
                ST const type = treeType(i);
                p.node = std::make_unique<Node>(type, static_cast<unsigned int>(i),
                                                base | static_cast<unsigned int>(i + 1),
                                                base | static_cast<unsigned int>(parent + 1),
                                                "tree node");
                TopoVec t{{type, static_cast<unsigned int>(i)}};
                t.insert(t.end(), topo[parent].begin(), topo[parent].end());
                topo.push_back(t);
                p.parentPath = trees[w][parent].path;
            }
            p.path = refPath(topo.back());
            trees[w].push_back(std::move(p));
        }
        for (int j = 0; j < kContested; ++j)
            contested[w].push_back(std::make_unique<Node>(
                ST::Fan, static_cast<unsigned int>(j), base | 0x8000u | static_cast<unsigned int>(j),
                1u, "contested fan"));
    }
    std::vector<std::string> contestedPaths;
    for (int j = 0; j < kContested; ++j)
        contestedPaths.push_back(refPath(TopoVec{{20, static_cast<unsigned int>(j)}, {59, 0}}));

    std::atomic<bool> go{false};
    std::atomic<int> winners[kContested];
    for (auto& a : winners)
        a.store(0);
    std::vector<std::vector<int>> wonBy(kWriters, std::vector<int>(kContested, 0));
    std::vector<int> writerFailures(kWriters, 0);
    std::vector<int> readerFailures(kReaders, 0);

    auto writer = [&](int w) {
        while (!go.load())
            std::this_thread::yield();
        bool const viaMI = (w % 2) == 1;
        for (int i = 0; i < kPerWriter; ++i) {
            Node* n = trees[w][i].node.get();
            if (viaMI) {
                if (store.addMINode(std::vector<Node*>{n}).getStatus() != 0)
                    ++writerFailures[w];
            } else {
                bool isNew = false;
                if (store.addNodeIfNew(n, isNew).getStatus() != 0 || !isNew)
                    ++writerFailures[w];
            }
            if (i < kContested) {
                int const j = (i + w * 5) % kContested;
                Node* c = contested[w][j].get();
                bool isNew = false;
                if (store.addNodeIfNew(c, isNew).getStatus() != 0)
                    ++writerFailures[w];
                if (isNew) {
                    winners[j].fetch_add(1);
                    wonBy[w][j] = 1;
                }
            }
        }
    };

    auto reader = [&](int r) {
        while (!go.load())
            std::this_thread::yield();
        std::mt19937 rng(77u + static_cast<unsigned int>(r));
        std::size_t lastSize = 0;
        std::vector<Node*> v;
        for (int round = 0; round < kReaderRounds; ++round) {
            int const w = static_cast<int>(rng() % kWriters);
            int const i = static_cast<int>(rng() % kPerWriter);
            Planned const& p = trees[w][i];
            unsigned int const id = (static_cast<unsigned int>(w + 1) << 16) |
                                    static_cast<unsigned int>(i + 1);
            Node* found = nullptr;
            if (store.getNode(id, &found).getStatus() == 0 && found != p.node.get())
                ++readerFailures[r];
            found = nullptr;
            if (store.getNode(p.path, &found).getStatus() == 0 && found != p.node.get())
                ++readerFailures[r];
            ST const s = store.nodePathToSensor(p.path);
            if (s != ST::invalid && s != p.node->getSensor())
                ++readerFailures[r];
            if (store.getMap(v).getStatus() != 0 || v.size() < lastSize)
                ++readerFailures[r];
            lastSize = v.size();
            if (!v.empty()) {
                std::string const h = store.getNodeHierarchy(v[rng() % v.size()]);
                if (h.compare(0, 5, "ROOT:") != 0)
                    ++readerFailures[r];
            }
            if (store.getMap(v, ST::Fan).getStatus() != 0 ||
                v.size() > static_cast<std::size_t>(kContested))
                ++readerFailures[r];
        }
    };

    std::vector<std::thread> threads;
    for (int w = 0; w < kWriters; ++w)
        threads.emplace_back(writer, w);
    for (int r = 0; r < kReaders; ++r)
        threads.emplace_back(reader, r);
    go.store(true);
    for (auto& t : threads)
        t.join();

    for (int w = 0; w < kWriters; ++w)
        EXPECT_EQ(writerFailures[w], 0) << "writer " << w;
    for (int r = 0; r < kReaders; ++r)
        EXPECT_EQ(readerFailures[r], 0) << "reader " << r;

    std::size_t listed = 1; // the shared root
    for (int w = 0; w < kWriters; ++w) {
        unsigned int const base = static_cast<unsigned int>(w + 1) << 16;
        for (int i = 0; i < kPerWriter; ++i) {
            Planned const& p = trees[w][i];
            Node* n = p.node.get();
            EXPECT_EQ(lookup(store, base | static_cast<unsigned int>(i + 1)), n);
            EXPECT_EQ(lookup(store, p.path), n);
            EXPECT_EQ(n->getPath(), p.path);
            EXPECT_EQ(n->getLinkedPath(), p.parentPath);
            EXPECT_EQ(store.nodePathToSensor(p.path), n->getSensor());
        }
        if (w % 2 == 0)
            listed += kPerWriter;
    }
    for (int j = 0; j < kContested; ++j) {
        EXPECT_EQ(winners[j].load(), 1) << "contested " << j;
        Node* holder = lookup(store, contestedPaths[j]);
        ASSERT_NE(holder, nullptr);
        int owners = 0;
        for (int w = 0; w < kWriters; ++w)
            if (wonBy[w][j] != 0) {
                ++owners;
                EXPECT_EQ(holder, contested[w][j].get());
            }
        EXPECT_EQ(owners, 1);
    }
    listed += kContested;
    EXPECT_EQ(allOf(store).size(), listed);
    EXPECT_EQ(allOf(store, ST::Fan).size(), static_cast<std::size_t>(kContested));
    EXPECT_EQ(store.getNodeHierarchy(trees[0][1].node.get()),
              "ROOT:00000064->CPU:00000001");
}
