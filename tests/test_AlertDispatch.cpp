// Tests of the alert entry points of the library: dispatch of batches raised
// by plug-ins, the registration calls and their indexes, the simple-alert
// adapter and the query of asserted alerts. All of it works on the library's
// global state, which every test resets.
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include "StoreSupport.h"

#include <cstdint>

namespace {

namespace ICC = IC::InstCtrl;
using IC::Alert;
using IC::AlertRegister;
using IC::Node;
using ictest::expectError;
using ictest::fnText;
using ictest::hex;
using ictest::ptrText;
using Paths = std::vector<std::string>;
using Contexts = std::vector<void const*>;
using Keys = std::multiset<std::string>;
using ST = Node::SensorType;

ictest::Source const kIC{"Helmgard.IC.InstrumentationControl", "InstrumentationControl"};

Alert::ClassType cls(unsigned int n) { return static_cast<Alert::ClassType>(n); }
Alert alert(unsigned int c, Paths paths, unsigned int status = 2, std::string msg = "m")
{
    return Alert(3, cls(c), std::move(paths), status, std::move(msg));
}
void const* slot(std::uintptr_t n) { return reinterpret_cast<void const*>(n); }

AlertRegister* registerOf(IC::AlertCallBack cb, void const* ctx)
{
    SD::MutexGuard g(ICC::registerlock);
    auto it = ICC::callbacks.find(ICC::CallbackKey(cb, ctx));
    return it == ICC::callbacks.end() ? nullptr : it->second;
}

// The keys of the three indexes that lead to r ("sensor 4", "class 6",
// "path <hex>"), or to any register when r is null.
Keys indexed(AlertRegister const* r = nullptr)
{
    SD::MutexGuard g(ICC::registerlock);
    Keys out;
    for (auto const& kv : ICC::sensortypeTOalertregister)
        if (!r || kv.second == r)
            out.insert("sensor " + std::to_string(kv.first));
    for (auto const& kv : ICC::classtypeTOalertregister)
        if (!r || kv.second == r)
            out.insert("class " + std::to_string(kv.first));
    for (auto const& kv : ICC::nodepathTOalertregister)
        if (!r || kv.second == r)
            out.insert("path " + hex(kv.first));
    return out;
}

std::vector<Alert> assertedNow()
{
    std::vector<Alert> out;
    ICC::alertstore.getAsserted(out);
    return out;
}

// ---- recording callbacks ----

struct Delivery {
    void const* context;
    std::vector<Alert> alerts;
};
std::vector<Delivery> gDeliveries;
std::function<void(void const*)> gHook;

IC::Error recA(std::vector<Alert> const& alerts, void const* ctx)
{
    gDeliveries.push_back({ctx, alerts});
    if (gHook)
        gHook(ctx);
    return IC::Error(1, IC::Number(IC::Number::Generic), "ignored");
}
IC::Error recB(std::vector<Alert> const& alerts, void const* ctx)
{
    gDeliveries.push_back({ctx, alerts});
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

Contexts sortedOf(Contexts v)
{
    std::sort(v.begin(), v.end(), std::less<void const*>());
    return v;
}

// The contexts of the deliveries so far, sorted unless asked otherwise.
Contexts delivered(bool sorted = true)
{
    Contexts out;
    for (auto const& d : gDeliveries)
        out.push_back(d.context);
    return sorted ? sortedOf(out) : out;
}

// Each delivery to ctx as the messages and paths of its alerts:
// "message:path,path;message:path;".
std::vector<std::string> got(void const* ctx)
{
    std::vector<std::string> out;
    for (auto const& d : gDeliveries)
        if (d.context == ctx) {
            out.emplace_back();
            for (auto const& a : d.alerts) {
                out.back() += a.getMessage() + ":";
                for (auto const& p : a.nodePaths())
                    out.back() += hex(p) + (&p == &a.nodePaths().back() ? "" : ",");
                out.back() += ";";
            }
        }
    return out;
}

struct SimpleCall {
    unsigned int code;
    SD::DateTime time;
    std::string path;
    void const* context;
};
std::vector<SimpleCall> gSimple;
std::function<void()> gSimpleHook;

void simpleA(unsigned int code, SD::DateTime time, std::string path, void const* ctx)
{
    gSimple.push_back({code, time, path, ctx});
    if (gSimpleHook)
        gSimpleHook();
}
void simpleB(unsigned int code, SD::DateTime time, std::string path, void const* ctx)
{
    gSimple.push_back({code + 100, time, path, ctx});
}

int c1 = 1, c2 = 2, c3 = 3, c4 = 4, c5 = 5, c6 = 6;

bool registerlockFreeForOthers()
{
    bool free = false;
    ictest::JoinedThread([&free] {
        if ((free = ICC::registerlock.try_lock()))
            ICC::registerlock.unlock();
    }).join();
    return free;
}

// ROOT <- CPU 0, CPU 1, CPU 2, Fan 0 in the library's node store.
class AlertsTest : public testing::Test {
protected:
    void SetUp() override
    {
        gDeliveries.clear();
        gSimple.clear();
    }
    void TearDown() override
    {
        gHook = nullptr;
        gSimpleHook = nullptr;
    }

    ictest::CleanAlertState clean_;
    IC::InstrumentationControl ic;
    ictest::NodeTree tree{ICC::nodestore, 3, 1};
    std::string const P0 = tree.cpu[0], P1 = tree.cpu[1], P2 = tree.cpu[2], PF = tree.fan[0];
    Node* const cpu0 = tree.nodes[1].get();
    Node* const cpu1 = tree.nodes[2].get();
    std::string const unknown = std::string("\x7e\x7f\x01", 3);
};

using Dispatch = AlertsTest;
using Registration = AlertsTest;
using SimpleAlerts = AlertsTest;

// ===========================================================================
// Dispatch
// ===========================================================================

TEST_F(Dispatch, ManagementBatchesReachOnlyPlugInRegistrationsAndAreNotRecorded)
{
    ic.registerForAlerts(recA, ST::CPU, &c1);
    ICC::regFPsensorAlerts(recA, ST::CPU, &c2);
    ICC::registerForAlerts(recA, cls(7), &c3);
    ICC::registerForAlerts(recA, Paths{P0}, &c4);
    ICC::regFPAlerts(recA, Paths{P0}, &c5);
    // A register keeps the kind of its first registration.
    ICC::regFPsensorAlerts(recB, ST::Fan, &c6);
    ICC::registerForAlerts(recB, cls(7), &c6);
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    EXPECT_EQ(registerOf(recB, &c6)->getRegType(), 0u);
    EXPECT_EQ(registerOf(recA, &c4)->getRegType(), 1u);

    expectError(ICC::AlertCallBackMI({alert(7, {P0})}, &c6), 0);
    expectError(ICC::AlertCallBackCommon({alert(7, {P0})}, nullptr, IC::MI_ALERT), 0);
    EXPECT_EQ(delivered(), sortedOf({&c2, &c2, &c5, &c5, &c6, &c6}));
    EXPECT_TRUE(gSimple.empty());
    EXPECT_TRUE(assertedNow().empty());

    gDeliveries.clear();
    expectError(ICC::AlertCallBackFP({alert(7, {P0})}), 0);
    expectError(ICC::AlertCallBackCommon({alert(7, {P0})}, &c2, IC::FP_ALERT), 0);
    EXPECT_EQ(delivered(), sortedOf({&c1, &c1, &c2, &c2, &c3, &c3, &c4, &c4, &c5, &c5, &c6, &c6}));
    for (void const* c : {&c1, &c2, &c3, &c4, &c5, &c6})
        EXPECT_EQ(got(c), (std::vector<std::string>(2, "m:" + hex(P0) + ";")));
    EXPECT_EQ(gSimple.size(), 2u);
    EXPECT_EQ(assertedNow().size(), 1u);
}

TEST_F(Dispatch, MatchesDeliverCopiesWithTheMatchingPaths)
{
    ICC::registerForAlerts(recA, cls(9), &c1);
    ICC::registerForAlerts(recA, Paths{P0}, &c2);
    ic.registerForAlerts(recA, ST::Fan, &c2);
    ICC::registerForAlerts(recA, Paths{P0}, &c3);
    ic.registerForAlerts(recA, ST::invalid, &c4); // what an unknown path selects
    Alert const in = alert(0, {P0, PF, P1}, 5, "pair");
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
    {
        ictest::LogCapture cap;
        ICC::AlertCallBackFP({alert(0, {unknown})});
        ictest::expectEvent(cap, {"Helmgard.IC.InstrumentationControl.AlertRegister", "AlertRegister"},
                            "filterAlerts: could not find nodepath for NodePath=" + hex(unknown) + " Sensor Class=74",
                            6000, "filterAlerts");
    }
    ICC::AlertCallBackFP({alert(9, {PF, unknown, P0}, 2, "all")});
    ICC::AlertCallBackFP({in, alert(8, {P1})}); // no unknown path: a shorter way for paths alone
    EXPECT_EQ(got(&c4), (std::vector<std::string>{"", ""})) << "filtered out, the call is still made";
    // A class match takes every path, known or not.
    EXPECT_EQ(got(&c1), std::vector<std::string>{"all:" + hex(PF) + "," + hex(unknown) + "," + hex(P0) + ";"});
    EXPECT_EQ(got(&c2), (std::vector<std::string>{"all:" + hex(PF) + "," + hex(P0) + ";",
                                                  "pair:" + hex(P0) + "," + hex(PF) + ";"}));
    EXPECT_EQ(got(&c3), (std::vector<std::string>{"all:" + hex(P0) + ";", "pair:" + hex(P0) + ";"}));
    for (auto const& d : gDeliveries)
        if (!d.alerts.empty() && d.alerts[0].getMessage() == "pair") {
            EXPECT_EQ(d.alerts[0].getStatus(), 5u);
            EXPECT_GT(d.alerts[0].getTimeStamp(), in.getTimeStamp()) << "a copy is a new alert";
        }
}

TEST_F(Dispatch, OneCallPerRegisterInAscendingRegisterAddressWithTheAlertsInBatchOrder)
{
    std::vector<int> ctx(6);
    for (auto& c : ctx)
        ic.registerForAlerts(recA, ST::CPU, &c);
    ic.registerForAlerts(recB, ST::CPU, &ctx[0]);
    // Found under several keys, a register is still called once.
    ICC::registerForAlerts(recA, cls(2), &ctx[1]);
    ICC::registerForAlerts(recA, Paths{P0, P1}, &ctx[1]);
    std::vector<AlertRegister*> regs;
    for (auto const& kv : ICC::callbacks)
        regs.push_back(kv.second);
    std::sort(regs.begin(), regs.end(), std::less<AlertRegister*>());
    Contexts want;
    for (AlertRegister* r : regs)
        want.push_back(r->getContext());
    ICC::AlertCallBackFP({alert(2, {P2}, 2, "first"), alert(0, {PF}, 2, "other"), alert(0, {P0, P1}, 2, "second")});
    EXPECT_EQ(delivered(false), want);
    for (auto& c : ctx)
        for (auto const& g : got(&c))
            EXPECT_EQ(g, "first:" + hex(P2) + ";second:" + hex(P0) + "," + hex(P1) + ";");
}

TEST_F(Dispatch, RemovalUnlistsBeforeCallbacksAndErasesAfterThem)
{
    ICC::registerForAlerts(recA, Paths{P1}, &c1);
    ic.registerForAlerts(recB, ST::CPU, &c2);
    int hookRuns = 0;
    gHook = [&](void const*) {
        ++hookRuns;
        std::vector<Node*> listed;
        ICC::nodestore.getMap(listed);
        EXPECT_EQ(std::count(listed.begin(), listed.end(), cpu1), 0) << "unlisted before the callbacks";
        EXPECT_EQ(std::count(listed.begin(), listed.end(), cpu0), 1);
        Node* n = nullptr;
        EXPECT_EQ(ICC::nodestore.getNode(P1, &n).getStatus(), 0) << "still found by path";
        EXPECT_EQ(n, cpu1);
        EXPECT_EQ(ICC::nodepathTOalertregister.count(P1), 1u) << "the index is pruned afterwards";
    };
    expectError(ICC::AlertCallBackFP({alert(4, {P1}), alert(4, {P1})}), 0);
    EXPECT_EQ(hookRuns, 1);
    // The sensor registration saw the path: it was looked up before removal.
    EXPECT_EQ(got(&c2), std::vector<std::string>{"m:" + hex(P1) + ";m:" + hex(P1) + ";"});
    Node* n = nullptr;
    EXPECT_EQ(ICC::nodestore.getNode(P1, &n).getStatus(), 1);
    EXPECT_EQ(ICC::nodestore.nodePathToSensor(P1), ST::invalid);
    EXPECT_EQ(indexed(), Keys{"sensor 4"});
    AlertRegister* r = registerOf(recA, &c1);
    ASSERT_NE(r, nullptr) << "the register itself survives";
    EXPECT_EQ(r->getNodePaths().count(P1), 1u);

    // A management interface's removal drops nodes without any registration.
    ICC::AlertCallBackMI({alert(4, {P0, PF})}, nullptr);
    EXPECT_EQ(ICC::nodestore.getNode(P0, &n).getStatus() + ICC::nodestore.getNode(PF, &n).getStatus(), 2);
    EXPECT_EQ(ICC::nodestore.getNode(P2, &n).getStatus(), 0);
}

TEST_F(Dispatch, RemovedPathIsNotReindexedWhenTheNodeReturns)
{
    ICC::registerForAlerts(recA, Paths{P1}, &c1);
    ICC::registerForAlerts(recB, Paths{P1}, &c1);
    ICC::AlertCallBackFP({alert(4, {P1})});
    EXPECT_TRUE(indexed().empty()) << "every entry of the path goes";
    ASSERT_TRUE(ictest::addNew(ICC::nodestore, *cpu1));
    ASSERT_EQ(cpu1->getPath(), P1);
    gDeliveries.clear();
    ICC::AlertCallBackFP({alert(0, {P1})});
    EXPECT_TRUE(gDeliveries.empty());
    // The registers still hold the path, so deregistering it succeeds and
    // removes them.
    expectError(ICC::deRegisterForAlerts(recA, Paths{P1}, &c1), 0);
    EXPECT_EQ(registerOf(recA, &c1), nullptr);
    expectError(ICC::deRegisterForAlerts(recB, Paths{P1}, &c1), 0);
    EXPECT_TRUE(ictest::noRegistrations());
}

TEST_F(Dispatch, OnlyDeliveredAlertsAreRecordedOncePerCallAndAssertsAreOnlyRecorded)
{
    std::string const line = "newAlerts: Abnormal Status 2path =" + hex(P0);
    ictest::LogCapture cap;
    ICC::AlertCallBackFP({alert(0, {P0})});
    EXPECT_TRUE(assertedNow().empty()) << "reached no register: not recorded";
    EXPECT_EQ(cap.count(line), 0u);
    ic.registerForAlerts(recA, ST::CPU, &c1);
    ic.registerForAlerts(recA, ST::CPU, &c2);
    ICC::registerForAlerts(recA, Paths{P1}, &c3);
    ic.registerForAlerts(recA, ST::invalid, &c3);
    ICC::AlertCallBackFP({alert(0, {P0, PF}, 2, "rec"), alert(0, {unknown}, 2, "filtered out")});
    EXPECT_EQ(cap.count(line), 2u) << "recorded once per register";
    EXPECT_EQ(ictest::sigs(assertedNow()), std::vector<std::string>{"3/0/2/rec/" + hex(P0) + ","});

    gDeliveries.clear();
    expectError(ICC::AssertCallBackFP({alert(0, {P1, unknown}, 3, "asserted")}), 0);
    EXPECT_TRUE(gDeliveries.empty());
    auto const stored = assertedNow();
    ASSERT_EQ(stored.size(), 3u);
    EXPECT_EQ(stored[1].getNodePaths(), (Paths{P1, unknown}));
    expectError(ICC::AssertCallBackFP({alert(0, {P1}, 1)}), 0);
    EXPECT_EQ(assertedNow().size(), 2u);
}

TEST_F(Dispatch, CallbacksRunWithoutTheLockAndMayChangeRegistrations)
{
    ic.registerForAlerts(recA, ST::CPU, &c1);
    bool lockFree = false;
    gHook = [&](void const* ctx) {
        if (ctx != &c1)
            return;
        lockFree = registerlockFreeForOthers();
        expectError(ic.registerForAlerts(recB, ST::CPU, &c2), 0);
        expectError(ICC::registerForAlerts(recB, Paths{PF}, &c3), 0);
        expectError(ic.deRegisterForAlerts(recA, ST::CPU, &c1), 0);
    };
    ICC::AlertCallBackFP({alert(0, {P0})});
    EXPECT_TRUE(lockFree);
    EXPECT_EQ(registerOf(recA, &c1), nullptr);
    gDeliveries.clear();
    ICC::AlertCallBackFP({alert(0, {P0, PF})});
    EXPECT_EQ(delivered(), sortedOf({&c2, &c3}));
}

TEST_F(Dispatch, AssertedAlertsFollowPlugInBatchesByPathAndTheQueryLogs)
{
    ICC::regFPsensorAlerts(recA, ST::CPU, &c1);
    ICC::regFPsensorAlerts(recA, ST::Fan, &c1);
    Paths sorted{P0, P1, PF};
    std::sort(sorted.begin(), sorted.end());
    ICC::AlertCallBackFP({alert(0, {sorted[2], sorted[0]}, 0, "two"), alert(0, {sorted[1]}, 3, "one")});
    std::vector<Alert> out{alert(0, {P2})};
    {
        ictest::LogCapture cap;
        expectError(ic.getAssertedAlerts(out), 0);
        ictest::expectEvent(cap, kIC, "getAssertedAlerts:", 3000, "getAssertedAlerts");
        EXPECT_EQ(cap.logs().size(), 1u);
    }
    std::string const two = "3/0/0/two/" + hex(sorted[2]) + "," + hex(sorted[0]) + ",";
    EXPECT_EQ(ictest::sigs(out), (std::vector<std::string>{two, "3/0/3/one/" + hex(sorted[1]) + ",", two}));
    ICC::AlertCallBackFP({alert(0, {sorted[0]}, 1)});
    ic.getAssertedAlerts(out);
    EXPECT_EQ(ictest::sigs(out), (std::vector<std::string>{"3/0/3/one/" + hex(sorted[1]) + ",", two}));
    ICC::AlertCallBackMI({alert(0, {sorted[1]}, 1), alert(0, {P2}, 2)}, nullptr);
    ic.getAssertedAlerts(out);
    EXPECT_EQ(out.size(), 2u) << "management batches leave the store alone";
    ICC::alertstore.clear();
    ic.getAssertedAlerts(out);
    EXPECT_TRUE(out.empty());
}

// ===========================================================================
// Registration
// ===========================================================================

TEST_F(Registration, SensorFormsLogIndexOnceAndRemove)
{
    for (bool plugIn : {false, true}) {
        IC::AlertCallBack const cb = plugIn ? recB : recA;
        void const* const ctx = plugIn ? &c2 : &c1;
        auto reg = [&] {
            return plugIn ? ICC::regFPsensorAlerts(cb, ST::CPU, ctx) : ic.registerForAlerts(cb, ST::CPU, ctx);
        };
        std::string const tail = " Callback=" + fnText(cb) + " *p=" + ptrText(ctx);
        ictest::LogCapture cap;
        expectError(reg(), 0);
        ictest::expectEvent(cap, kIC,
                            (plugIn ? "registerFPsensorAlerts: sensor 4" : "registerForAlerts: sensor=4") + tail,
                            3000, plugIn ? "regFPsensorAlerts" : "registerForAlerts");
        expectError(reg(), 0);
        AlertRegister* r = registerOf(cb, ctx);
        ASSERT_NE(r, nullptr);
        EXPECT_EQ(r->getRegType(), plugIn ? 0u : 1u);
        EXPECT_EQ(r->getContext(), ctx);
        EXPECT_EQ(r->getSensorTypes(), std::set<ST>{ST::CPU});
        EXPECT_EQ(indexed(), Keys{"sensor 4"});
        cap.clear();
        expectError(plugIn ? ICC::deRegFPsensorAlerts(cb, ST::CPU, ctx) : ic.deRegisterForAlerts(cb, ST::CPU, ctx), 0);
        ictest::expectEvent(cap, kIC,
                            (plugIn ? "deRegFPsensorAlerts: sensor 4" : "deRegisterForAlerts: sensor 4") + tail,
                            3000, plugIn ? "deRegFPsensorAlerts" : "deRegisterForAlerts");
        EXPECT_EQ(cap.logs().size(), 1u);
        EXPECT_TRUE(ictest::noRegistrations());
    }
}

TEST_F(Registration, ClassAndPlugInPathFormsAreSilent)
{
    ictest::LogCapture cap;
    expectError(ICC::registerForAlerts(recA, cls(6), &c1), 0);
    expectError(ICC::registerForAlerts(recA, cls(6), &c1), 0);
    expectError(ICC::regFPAlerts(recB, Paths{PF, P2}, &c3), 0);
    AlertRegister* byClass = registerOf(recA, &c1);
    AlertRegister* byPath = registerOf(recB, &c3);
    ASSERT_TRUE(byClass && byPath);
    EXPECT_EQ(byClass->getRegType() * 10 + byPath->getRegType(), 10u);
    EXPECT_EQ(byClass->getClasses(), std::set<Alert::ClassType>{cls(6)});
    EXPECT_EQ(indexed(byClass), Keys{"class 6"});
    EXPECT_EQ(indexed(byPath), (Keys{"path " + hex(PF), "path " + hex(P2)}));
    expectError(ICC::deRegisterForAlerts(recA, cls(6), &c1), 0);
    expectError(ICC::deRegFPAlerts(recB, Paths{P2, PF}, &c3), 0);
    EXPECT_TRUE(ictest::noRegistrations());
    EXPECT_TRUE(cap.records().empty());
}

TEST_F(Registration, ClientPathFormLogsEveryPathAndIndexesEachOnce)
{
    std::string const tail = "} Callback=" + fnText(recA) + " *p=" + ptrText(&c1);
    ictest::LogCapture cap;
    expectError(ICC::registerForAlerts(recA, Paths{P1, P0, P1}, &c1), 0);
    ictest::expectEvent(cap, kIC, "registerFor Alerts paths={ " + hex(P1) + " " + hex(P0) + " " + hex(P1) + " " + tail,
                        3000, "registerForAlerts");
    AlertRegister* r = registerOf(recA, &c1);
    ASSERT_NE(r, nullptr);
    EXPECT_EQ(r->getRegType(), 1u);
    EXPECT_EQ(r->getNodePaths(), (std::set<std::string>{P0, P1}));
    EXPECT_EQ(indexed(), (Keys{"path " + hex(P0), "path " + hex(P1)}));
    cap.clear();
    expectError(ICC::deRegisterForAlerts(recA, Paths{P0}, &c1), 0);
    ictest::expectEvent(cap, kIC, "deRegisterForAlerts: Node paths={ " + hex(P0) + " " + tail, 3000,
                        "deRegisterForAlerts");
    EXPECT_EQ(indexed(), Keys{"path " + hex(P1)});
    EXPECT_EQ(registerOf(recA, &c1), r);
    expectError(ICC::deRegisterForAlerts(recA, Paths{}, &c2), 1);
    ictest::expectEvent(cap, kIC,
                        "deRegisterForAlerts: Node paths={ } Callback=" + fnText(recA) + " *p=" + ptrText(&c2), 3000,
                        "deRegisterForAlerts");
    EXPECT_EQ(cap.logs().size(), 2u);
    expectError(ICC::deRegisterForAlerts(recA, Paths{P1}, &c1), 0);
    EXPECT_TRUE(ictest::noRegistrations());
}

TEST_F(Registration, OneRegisterPerPairWhateverItsFilters)
{
    for (int* c : {&c1, &c2}) {
        ic.registerForAlerts(recA, static_cast<ST>(5), c);
        ICC::registerForAlerts(recA, Paths{P0}, c);
    }
    ICC::registerForAlerts(recA, cls(2), &c1);
    AlertRegister* r1 = registerOf(recA, &c1);
    AlertRegister* r2 = registerOf(recA, &c2);
    ASSERT_TRUE(r1 && r2 && r1 != r2);
    EXPECT_EQ(ICC::callbacks.size(), 2u);
    EXPECT_EQ(indexed(r1), (Keys{"sensor 5", "path " + hex(P0), "class 2"}));
    EXPECT_EQ(indexed(r2), (Keys{"sensor 5", "path " + hex(P0)}));
    // Removing the later register's entries leaves the earlier one's in place.
    ICC::deRegisterForAlerts(recA, Paths{P0}, &c2);
    ic.deRegisterForAlerts(recA, static_cast<ST>(5), &c2);
    EXPECT_EQ(registerOf(recA, &c2), nullptr);
    EXPECT_EQ(indexed(), (Keys{"sensor 5", "path " + hex(P0), "class 2"}));
    // One filter kind gone, the register stays with the others.
    expectError(ic.deRegisterForAlerts(recA, static_cast<ST>(5), &c1), 0);
    expectError(ICC::deRegisterForAlerts(recA, Paths{}, &c1), 0);
    EXPECT_EQ(registerOf(recA, &c1), r1);
    EXPECT_EQ(indexed(), (Keys{"path " + hex(P0), "class 2"}));
    expectError(ICC::deRegisterForAlerts(recA, cls(2), &c1), 0);
    expectError(ICC::deRegisterForAlerts(recA, Paths{P0}, &c1), 0);
    EXPECT_TRUE(ictest::noRegistrations());
    // An empty path list alone makes an empty register, removed by the same.
    expectError(ICC::registerForAlerts(recA, Paths{}, &c1), 0);
    ASSERT_NE(registerOf(recA, &c1), nullptr);
    EXPECT_TRUE(registerOf(recA, &c1)->getNodePaths().empty());
    expectError(ICC::deRegisterForAlerts(recA, Paths{}, &c1), 0);
    EXPECT_TRUE(ictest::noRegistrations());
}

TEST_F(Registration, UnknownPairsAreRefusedUnregisteredValuesAreNot)
{
    ic.registerForAlerts(recA, ST::CPU, &c1);
    ICC::registerForAlerts(recA, cls(1), &c1);
    ICC::registerForAlerts(recA, Paths{P0}, &c1);
    AlertRegister* r = registerOf(recA, &c1);
    expectError(ic.deRegisterForAlerts(recA, ST::CPU, &c2), 1);
    expectError(ic.deRegisterForAlerts(recB, ST::CPU, &c1), 1); // the key is the pair
    expectError(ICC::deRegFPsensorAlerts(recA, ST::CPU, &c2), 1);
    expectError(ICC::deRegisterForAlerts(recA, cls(1), &c2), 1);
    expectError(ICC::deRegisterForAlerts(recB, Paths{P0}, &c1), 1);
    expectError(ICC::deRegFPAlerts(recA, Paths{P0}, &c3), 1);
    expectError(ic.deRegisterForAlerts(recA, ST::Fan, &c1), 0);
    expectError(ICC::deRegisterForAlerts(recA, cls(4), &c1), 0);
    expectError(ICC::deRegisterForAlerts(recA, Paths{P1}, &c1), 0);
    EXPECT_EQ(ICC::callbacks.size(), 1u);
    EXPECT_EQ(registerOf(recA, &c1), r);
    EXPECT_EQ(indexed(), (Keys{"sensor 4", "class 1", "path " + hex(P0)}));
    EXPECT_EQ(indexed(r), indexed());
}

TEST_F(Registration, WorkersTakeTheKindGivenAndIgnoreItOnRemoval)
{
    {
        SD::MutexGuard g(ICC::registerlock);
        expectError(ICC::regAlerts(recA, ST::CPU, &c1, IC::FP_REGISTRATION), 0);
    }
    expectError(ICC::regAlerts(recB, Paths{P0}, &c2, IC::FP_REGISTRATION), 0);
    EXPECT_EQ(registerOf(recA, &c1)->getRegType() + registerOf(recB, &c2)->getRegType(), 0u);
    {
        SD::MutexGuard g(ICC::registerlock);
        expectError(ICC::deRegAlerts(recA, ST::CPU, &c1, IC::CLIENT_REGISTRATION), 0);
        expectError(ICC::deRegAlerts(recA, ST::CPU, &c1, IC::FP_REGISTRATION), 1);
    }
    expectError(ICC::deRegAlerts(recB, Paths{P0}, &c2, IC::CLIENT_REGISTRATION), 0);
    EXPECT_TRUE(ictest::noRegistrations());
}

// ===========================================================================
// Simple alerts
// ===========================================================================

TEST_F(SimpleAlerts, SlotsAreNumberedAndTheSmallestFreeOneIsReused)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    ic.registerForSimpleAlerts(simpleA, 4, &c2);
    ic.registerForSimpleAlerts(simpleB, 20, &c3);
    // Slot, sensor and context of each subscription, and whether its
    // registration (context: the slot) exists as a client one.
    auto slots = [] {
        std::string s;
        for (auto const& r : ICC::mysam) {
            AlertRegister const* reg = registerOf(ICC::AlertCallBackSimple, slot(r.index));
            s += std::to_string(r.index) + ":" + std::to_string(r.sensor) + ":" +
                 std::to_string(*static_cast<int const*>(r.context)) +
                 (reg && reg->getRegType() == 1 && reg->getSensorTypes().count(static_cast<ST>(r.sensor)) ? " " : "? ");
        }
        return s;
    };
    EXPECT_EQ(slots(), "0:4:1 1:4:2 2:20:3 ");
    EXPECT_EQ(indexed(), (Keys{"sensor 4", "sensor 4", "sensor 20"}));
    expectError(ic.deRegisterForSimpleAlerts(simpleA, 4, &c2), 0);
    EXPECT_EQ(registerOf(ICC::AlertCallBackSimple, slot(1)), nullptr);
    EXPECT_EQ(slots(), "0:4:1 2:20:3 ") << "later slots keep their numbers";
    expectError(ic.registerForSimpleAlerts(simpleB, 4, &c4), 0);
    EXPECT_EQ(slots(), "0:4:1 1:4:4 2:20:3 ");
    EXPECT_EQ(ICC::mysam[1].callback, &simpleB);
    ic.deRegisterForSimpleAlerts(simpleA, 4, &c1);
    ic.registerForSimpleAlerts(simpleA, 22, &c5);
    ic.registerForSimpleAlerts(simpleA, 22, &c6);
    EXPECT_EQ(slots(), "0:22:5 1:4:4 2:20:3 3:22:6 ");
}

TEST_F(SimpleAlerts, ASubscriptionIsItsTripleWithTheSensorsLow16Bits)
{
    std::string const cb = " Callback=" + fnText(simpleA);
    {
        ictest::LogCapture cap;
        expectError(ic.registerForSimpleAlerts(simpleA, 65536u + 4, &c1), 0);
        ictest::expectEvent(cap, kIC, "registerForSimpleAlerts: Sensor=65540" + cb + "*p=" + ptrText(&c1), 3000,
                            "registerForSimpleAlerts");
        EXPECT_EQ(cap.logs().size(), 1u);
    }
    expectError(ic.registerForSimpleAlerts(simpleA, 4, &c1), 0);
    ASSERT_EQ(ICC::mysam.size(), 1u) << "a repeated registration changes nothing";
    EXPECT_EQ(ICC::mysam[0].sensor, 4);
    EXPECT_EQ(indexed(), Keys{"sensor 4"});
    ICC::AlertCallBackFP({alert(0, {P0})});
    EXPECT_EQ(gSimple.size(), 1u);
    expectError(ic.deRegisterForSimpleAlerts(simpleA, 4, &c2), 1);
    expectError(ic.deRegisterForSimpleAlerts(simpleB, 4, &c1), 1);
    expectError(ic.deRegisterForSimpleAlerts(simpleA, 20, &c1), 1);
    // Another context or sensor is another subscription.
    ic.registerForSimpleAlerts(simpleA, 4, &c2);
    ic.registerForSimpleAlerts(simpleA, 20, &c1);
    EXPECT_EQ(ICC::mysam.size(), 3u);
    ictest::LogCapture cap;
    for (auto s : {std::make_pair(4u, &c1), std::make_pair(4u, &c2), std::make_pair(20u, &c1)})
        expectError(ic.deRegisterForSimpleAlerts(simpleA, s.first, s.second), 0);
    EXPECT_TRUE(ictest::noRegistrations());
    ictest::expectEvent(cap, kIC, "deRegisterForSimpleAlerts: sensor=20" + cb + " *p=" + ptrText(&c1), 3000,
                        "deRegisterForSimpleAlerts");
    EXPECT_EQ(cap.logs().size(), 3u);
}

TEST_F(SimpleAlerts, OneCallPerPathWithTheClassesEventCodeAndNoneForRemovals)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    ic.registerForSimpleAlerts(simpleB, 4, &c2);
    ic.registerForSimpleAlerts(simpleA, 20, &c3);
    ICC::AlertCallBackFP({alert(0, {P2, P0, PF, P1})});
    ASSERT_EQ(gSimple.size(), 7u) << "each subscriber its own calls";
    std::set<std::int64_t> times;
    for (auto const& s : gSimple)
        if (s.context == &c1)
            times.insert(s.time.getEpochMicroseconds());
    EXPECT_EQ(times.size(), 1u) << "one time for the calls of one alert";
    ICC::AlertCallBackFP({alert(5, {P0}), alert(3, {P0}), alert(4, {P1}), alert(0, {P0}), alert(9, {P2})});
    std::vector<std::string> calls;
    for (auto const& s : gSimple)
        if (s.context == &c1)
            calls.push_back(std::to_string(s.code) + ":" + hex(s.path));
    EXPECT_EQ(calls, (std::vector<std::string>{"0:" + hex(P2), "0:" + hex(P0), "0:" + hex(P1), "1:" + hex(P0),
                                               "2:" + hex(P0), "0:" + hex(P0), "0:" + hex(P2)}));
    EXPECT_EQ(gSimple.size(), 15u);
}

TEST_F(SimpleAlerts, AdapterPassesTheAlertsOwnTimeAndIgnoresUnknownSlots)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    ic.registerForSimpleAlerts(simpleB, 4, &c2);
    Alert const a = alert(5, {P1, PF});
    expectError(ICC::AlertCallBackSimple({a}, slot(1)), 0);
    ASSERT_EQ(gSimple.size(), 2u);
    EXPECT_EQ(gSimple[0].code, 101u) << "slot 1 is the second subscription";
    EXPECT_EQ(gSimple[0].time, a.getTimeStamp());
    EXPECT_EQ(gSimple[0].path + gSimple[1].path, P1 + PF) << "the adapter does not filter paths itself";
    EXPECT_EQ(gSimple[0].context, &c2);
    gSimple.clear();
    expectError(ICC::AlertCallBackSimple({a}, slot(7)), 0);
    EXPECT_TRUE(gSimple.empty());
}

TEST_F(SimpleAlerts, SimpleCallbacksRunUnderTheRegistrationLock)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    bool freeForOthers = true;
    gSimpleHook = [&] { freeForOthers = registerlockFreeForOthers(); };
    ICC::AlertCallBackFP({alert(0, {P0})});
    ASSERT_EQ(gSimple.size(), 1u);
    EXPECT_FALSE(freeForOthers);
}

} // namespace
