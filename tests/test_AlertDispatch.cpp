// Tests of the alert entry points of the library: dispatch of batches raised
// by plug-ins, the registration calls and their indexes, the simple-alert
// adapter and the query of asserted alerts. All of it works on the library's
// global state, which every fixture resets.
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include <HGLog/HGLogger.h>
#include <IC/Alert.h>
#include <IC/AlertRegister.h>
#include <IC/Error.h>
#include <IC/Node.h>
#include <IC/Number.h>
#include <SD/Mutex.h>

#include <LogCapture.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <functional>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace {

namespace ICC = IC::InstCtrl;
using IC::Alert;
using IC::AlertRegister;
using IC::Node;
using Paths = std::vector<std::string>;
using ST = Node::SensorType;

std::string const kLibLogger = "Helmgard.IC.InstrumentationControl";
std::string const kRegLogger = "Helmgard.IC.InstrumentationControl.AlertRegister";

Alert::ClassType cls(unsigned int n) { return static_cast<Alert::ClassType>(n); }

Alert alert(unsigned int c, Paths paths, unsigned int status = 2, std::string msg = "m")
{
    return Alert(3, cls(c), std::move(paths), status, std::move(msg));
}

std::string hex(std::string const& s)
{
    static char const digits[] = "0123456789abcdef";
    std::string out;
    for (unsigned char c : s) {
        out.push_back(digits[c >> 4]);
        out.push_back(digits[c & 15]);
    }
    return out;
}

std::string addr(void const* p)
{
    std::ostringstream os;
    os << p;
    return os.str();
}

template <class F>
std::string fnaddr(F f)
{
    return addr(reinterpret_cast<void const*>(f));
}

void const* slot(std::uintptr_t n) { return reinterpret_cast<void const*>(n); }

void expectStatus(IC::Error const& e, unsigned char status)
{
    EXPECT_EQ(e.getStatus(), status);
    EXPECT_EQ(e.getText(), "");
    EXPECT_EQ(e.getCode(), IC::Number(IC::Number::Generic));
}

// Exactly one event with this message on each channel, with these fields.
void expectEvent(ictest::LogCapture const& cap, std::string const& message, int level,
                 std::string const& function, std::string const& logger = kLibLogger,
                 std::string const& file = "InstrumentationControl")
{
    std::vector<HGLog::Record> logs, traces;
    for (auto const& r : cap.records())
        if (r.message == message)
            (r.channel == HGLog::Channel::Log ? logs : traces).push_back(r);
    ASSERT_EQ(logs.size(), 1u) << "log channel: '" << message << "'";
    ASSERT_EQ(traces.size(), 1u) << "trace channel: '" << message << "'";
    for (auto const* r : {&logs[0], &traces[0]}) {
        EXPECT_EQ(r->level, level) << message;
        EXPECT_EQ(r->function, function) << message;
        EXPECT_EQ(r->file, file) << message;
        EXPECT_EQ(r->logger, logger) << message;
    }
    EXPECT_EQ(logs[0].line, traces[0].line);
}

// ---- global state ----

void resetAlertState()
{
    {
        SD::MutexGuard g(ICC::registerlock);
        for (auto& kv : ICC::callbacks)
            delete kv.second;
        ICC::callbacks.clear();
        ICC::nodepathTOalertregister.clear();
        ICC::sensortypeTOalertregister.clear();
        ICC::classtypeTOalertregister.clear();
        ICC::mysam.clear();
    }
    ICC::nodestore.clear();
    ICC::alertstore.clear();
}

AlertRegister* registerOf(IC::AlertCallBack cb, void const* ctx)
{
    SD::MutexGuard g(ICC::registerlock);
    auto it = ICC::callbacks.find(ICC::CallbackKey(cb, ctx));
    return it == ICC::callbacks.end() ? nullptr : it->second;
}

// Entries under key that point at r.
template <class Map, class Key>
std::size_t entries(Map const& index, Key const& key, AlertRegister const* r)
{
    SD::MutexGuard g(ICC::registerlock);
    auto range = index.equal_range(key);
    return static_cast<std::size_t>(std::count_if(
        range.first, range.second, [r](auto const& kv) { return kv.second == r; }));
}

std::size_t indexedUnder(std::string const& path)
{
    SD::MutexGuard g(ICC::registerlock);
    return ICC::nodepathTOalertregister.count(path);
}

bool allEmpty()
{
    SD::MutexGuard g(ICC::registerlock);
    return ICC::callbacks.empty() && ICC::nodepathTOalertregister.empty() &&
           ICC::sensortypeTOalertregister.empty() && ICC::classtypeTOalertregister.empty() &&
           ICC::mysam.empty();
}

std::vector<Alert> assertedNow()
{
    std::vector<Alert> out;
    ICC::alertstore.getAsserted(out);
    return out;
}

// ---- recording callbacks ----

struct Delivery {
    IC::AlertCallBack cb;
    void const* context;
    std::vector<Alert> alerts;
};
std::vector<Delivery> gDeliveries;
std::function<void(std::vector<Alert> const&, void const*)> gHook;

IC::Error recA(std::vector<Alert> const& alerts, void const* ctx)
{
    gDeliveries.push_back({recA, ctx, alerts});
    return IC::Error(1, IC::Number(IC::Number::Generic), "ignored");
}

IC::Error recB(std::vector<Alert> const& alerts, void const* ctx)
{
    gDeliveries.push_back({recB, ctx, alerts});
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

IC::Error recHook(std::vector<Alert> const& alerts, void const* ctx)
{
    gDeliveries.push_back({recHook, ctx, alerts});
    if (gHook)
        gHook(alerts, ctx);
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

std::vector<void const*> contextsDelivered()
{
    std::vector<void const*> out;
    for (auto const& d : gDeliveries)
        out.push_back(d.context);
    return out;
}

std::vector<Delivery> deliveredTo(void const* ctx)
{
    std::vector<Delivery> out;
    for (auto const& d : gDeliveries)
        if (d.context == ctx)
            out.push_back(d);
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
    std::thread t([&free] {
        free = ICC::registerlock.try_lock();
        if (free)
            ICC::registerlock.unlock();
    });
    t.join();
    return free;
}

// ROOT <- CPU 0, CPU 1, CPU 2, Fan 0 in the library's node store.
class AlertsTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        resetAlertState();
        gDeliveries.clear();
        gSimple.clear();
        gHook = nullptr;
        gSimpleHook = nullptr;
        for (Node* n : {&root, &cpu0, &cpu1, &cpu2, &fan0}) {
            bool isNew = false;
            ASSERT_EQ(ICC::nodestore.addNodeIfNew(n, isNew).getStatus(), 0);
            ASSERT_TRUE(isNew);
        }
        P0 = cpu0.getPath();
        P1 = cpu1.getPath();
        P2 = cpu2.getPath();
        PF = fan0.getPath();
    }
    void TearDown() override
    {
        gHook = nullptr;
        gSimpleHook = nullptr;
        resetAlertState();
    }

    IC::InstrumentationControl ic;
    Node root{ST::ROOT, 0, 1, 0, "root"};
    Node cpu0{ST::CPU, 0, 2, 1, "cpu 0"};
    Node cpu1{ST::CPU, 1, 3, 1, "cpu 1"};
    Node cpu2{ST::CPU, 2, 4, 1, "cpu 2"};
    Node fan0{ST::Fan, 0, 5, 1, "fan 0"};
    std::string P0, P1, P2, PF;
    std::string const unknown = std::string("\x7e\x7f\x01", 3);
};

using Dispatch = AlertsTest;
using Registration = AlertsTest;
using SimpleAlerts = AlertsTest;
using AssertedAlerts = AlertsTest;

} // namespace

// ===========================================================================
// Dispatch
// ===========================================================================

TEST_F(Dispatch, ManagementBatchesReachOnlyPlugInRegistrations)
{
    ic.registerForAlerts(recA, ST::CPU, &c1);
    ICC::regFPsensorAlerts(recA, ST::CPU, &c2);
    ICC::registerForAlerts(recA, cls(7), &c3);
    ICC::registerForAlerts(recA, Paths{P0}, &c4);
    ICC::regFPAlerts(recA, Paths{P0}, &c5);

    expectStatus(ICC::AlertCallBackMI({alert(7, {P0})}, &c6), 0);
    auto got = contextsDelivered();
    std::sort(got.begin(), got.end());
    std::vector<void const*> want{&c2, &c5};
    std::sort(want.begin(), want.end());
    EXPECT_EQ(got, want);

    gDeliveries.clear();
    expectStatus(ICC::AlertCallBackFP({alert(7, {P0})}), 0);
    EXPECT_EQ(gDeliveries.size(), 5u);
    for (auto const& d : gDeliveries)
        EXPECT_EQ(d.alerts.size(), 1u);
}

TEST_F(Dispatch, RegisterKeepsTheKindOfItsFirstRegistration)
{
    ICC::regFPsensorAlerts(recA, ST::Fan, &c1);
    ICC::registerForAlerts(recA, cls(7), &c1);
    ic.registerForAlerts(recB, ST::Fan, &c2);
    ICC::regFPAlerts(recB, Paths{P0}, &c2);
    ASSERT_NE(registerOf(recA, &c1), nullptr);
    EXPECT_EQ(registerOf(recA, &c1)->getRegType(), 0u);
    EXPECT_EQ(registerOf(recB, &c2)->getRegType(), 1u);

    ICC::AlertCallBackMI({alert(7, {P0})}, nullptr);
    EXPECT_EQ(contextsDelivered(), std::vector<void const*>{&c1});
}

TEST_F(Dispatch, ClassMatchDeliversEveryPath)
{
    ICC::registerForAlerts(recA, cls(9), &c1);
    ictest::LogCapture cap;
    ICC::AlertCallBackFP({alert(9, {PF, unknown, P0}, 2, "all"), alert(8, {P1})});
    ASSERT_EQ(gDeliveries.size(), 1u);
    ASSERT_EQ(gDeliveries[0].alerts.size(), 1u);
    EXPECT_EQ(gDeliveries[0].alerts[0].getNodePaths(), (Paths{PF, unknown, P0}));
    EXPECT_EQ(gDeliveries[0].alerts[0].getMessage(), "all");
    for (auto const& m : cap.messages())
        EXPECT_EQ(m.find("could not find"), std::string::npos) << m;
}

TEST_F(Dispatch, PathAndSensorRegistrationsGetCopiesWithTheMatchingPaths)
{
    ICC::registerForAlerts(recA, Paths{P0}, &c1);
    ic.registerForAlerts(recA, ST::Fan, &c1);
    ICC::registerForAlerts(recA, Paths{P0}, &c2);
    Alert const in = alert(0, {P0, PF, P1}, 5, "pair");
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
    ICC::AlertCallBackFP({in});

    auto const both = deliveredTo(&c1);
    ASSERT_EQ(both.size(), 1u);
    ASSERT_EQ(both[0].alerts.size(), 1u);
    EXPECT_EQ(both[0].alerts[0].getNodePaths(), (Paths{P0, PF}));
    EXPECT_EQ(both[0].alerts[0].getStatus(), 5u);
    EXPECT_GT(both[0].alerts[0].getTimeStamp(), in.getTimeStamp());

    auto const one = deliveredTo(&c2);
    ASSERT_EQ(one.size(), 1u);
    ASSERT_EQ(one[0].alerts.size(), 1u);
    EXPECT_EQ(one[0].alerts[0].getNodePaths(), Paths{P0});
}

TEST_F(Dispatch, UnknownPathSelectsSensor74ButIsFilteredOut)
{
    ic.registerForAlerts(recA, ST::invalid, &c1);
    ic.registerForAlerts(recA, ST::CPU, &c2);
    ictest::LogCapture cap;
    ICC::AlertCallBackFP({alert(0, {unknown})});
    ASSERT_EQ(gDeliveries.size(), 1u);
    EXPECT_EQ(gDeliveries[0].context, &c1);
    EXPECT_TRUE(gDeliveries[0].alerts.empty());
    expectEvent(cap,
                "filterAlerts: could not find nodepath for NodePath=" + hex(unknown) +
                    " Sensor Class=74",
                6000, "filterAlerts", kRegLogger, "AlertRegister");
}

TEST_F(Dispatch, OneCallPerRegisterInAscendingRegisterAddress)
{
    std::vector<int> ctx(6);
    for (auto& c : ctx)
        ic.registerForAlerts(recA, ST::CPU, &c);
    ic.registerForAlerts(recB, ST::CPU, &ctx[0]);
    std::vector<AlertRegister*> regs;
    {
        SD::MutexGuard g(ICC::registerlock);
        for (auto const& kv : ICC::callbacks)
            regs.push_back(kv.second);
    }
    std::sort(regs.begin(), regs.end(), std::less<AlertRegister*>());
    std::vector<void const*> want;
    for (AlertRegister* r : regs)
        want.push_back(r->getContext());

    ICC::AlertCallBackFP({alert(0, {P0}), alert(0, {P1})});
    EXPECT_EQ(contextsDelivered(), want);
    for (auto const& d : gDeliveries)
        EXPECT_EQ(d.alerts.size(), 2u);
}

TEST_F(Dispatch, RegisterFoundUnderSeveralKeysIsCalledOnce)
{
    ICC::registerForAlerts(recA, cls(2), &c1);
    ic.registerForAlerts(recA, ST::CPU, &c1);
    ICC::registerForAlerts(recA, Paths{P0, P1}, &c1);
    ICC::AlertCallBackFP({alert(2, {P0, P1})});
    ASSERT_EQ(gDeliveries.size(), 1u);
    ASSERT_EQ(gDeliveries[0].alerts.size(), 1u);
    EXPECT_EQ(gDeliveries[0].alerts[0].getNodePaths(), (Paths{P0, P1}));
}

TEST_F(Dispatch, TwoAlertsForOneRegisterArriveTogetherInBatchOrder)
{
    ic.registerForAlerts(recA, ST::CPU, &c1);
    ICC::AlertCallBackFP(
        {alert(0, {P2}, 2, "first"), alert(0, {PF}, 2, "other"), alert(0, {P0}, 2, "second")});
    ASSERT_EQ(gDeliveries.size(), 1u);
    ASSERT_EQ(gDeliveries[0].alerts.size(), 2u);
    EXPECT_EQ(gDeliveries[0].alerts[0].getMessage(), "first");
    EXPECT_EQ(gDeliveries[0].alerts[1].getMessage(), "second");
}

TEST_F(Dispatch, RemovalUnlistsBeforeCallbacksAndErasesAfterThem)
{
    ICC::registerForAlerts(recHook, Paths{P1}, &c1);
    ic.registerForAlerts(recA, ST::CPU, &c2);
    int hookRuns = 0;
    gHook = [&](std::vector<Alert> const&, void const*) {
        ++hookRuns;
        std::vector<Node*> listed;
        ICC::nodestore.getMap(listed);
        EXPECT_EQ(std::count(listed.begin(), listed.end(), &cpu1), 0)
            << "unlisted before the callbacks";
        EXPECT_EQ(std::count(listed.begin(), listed.end(), &cpu0), 1);
        Node* n = nullptr;
        EXPECT_EQ(ICC::nodestore.getNode(P1, &n).getStatus(), 0) << "still found by path";
        EXPECT_EQ(n, &cpu1);
        EXPECT_EQ(indexedUnder(P1), 1u) << "the path index is pruned after the callbacks";
    };
    expectStatus(ICC::AlertCallBackFP({alert(4, {P1}), alert(4, {P1})}), 0);
    EXPECT_EQ(hookRuns, 1);

    // The sensor registration saw the path: it was looked up before removal.
    auto const bySensor = deliveredTo(&c2);
    ASSERT_EQ(bySensor.size(), 1u);
    ASSERT_EQ(bySensor[0].alerts.size(), 2u);
    EXPECT_EQ(bySensor[0].alerts[0].getNodePaths(), Paths{P1});

    Node* n = nullptr;
    EXPECT_EQ(ICC::nodestore.getNode(P1, &n).getStatus(), 1);
    EXPECT_EQ(ICC::nodestore.nodePathToSensor(P1), ST::invalid);
    EXPECT_EQ(indexedUnder(P1), 0u);
    AlertRegister* r = registerOf(recHook, &c1);
    ASSERT_NE(r, nullptr) << "the register itself survives";
    EXPECT_EQ(r->getNodePaths().count(P1), 1u);
}

TEST_F(Dispatch, RemovedPathIsNotReindexedWhenTheNodeReturns)
{
    ICC::registerForAlerts(recA, Paths{P1}, &c1);
    ICC::registerForAlerts(recB, Paths{P1}, &c1);
    ICC::AlertCallBackFP({alert(4, {P1})});
    EXPECT_EQ(indexedUnder(P1), 0u) << "every entry of the path goes";
    bool isNew = false;
    Node* back = &cpu1;
    ASSERT_EQ(ICC::nodestore.addNodeIfNew(back, isNew).getStatus(), 0);
    ASSERT_TRUE(isNew);
    ASSERT_EQ(cpu1.getPath(), P1);

    gDeliveries.clear();
    ICC::AlertCallBackFP({alert(0, {P1})});
    EXPECT_TRUE(gDeliveries.empty());

    // The register still holds the path, so deregistering it succeeds and
    // removes the register.
    expectStatus(ICC::deRegisterForAlerts(recA, Paths{P1}, &c1), 0);
    EXPECT_EQ(registerOf(recA, &c1), nullptr);
    expectStatus(ICC::deRegisterForAlerts(recB, Paths{P1}, &c1), 0);
    EXPECT_TRUE(allEmpty());
}

TEST_F(Dispatch, ManagementRemovalDropsNodesWithoutAnyRegistration)
{
    ICC::AlertCallBackMI({alert(4, {P0, PF})}, nullptr);
    Node* n = nullptr;
    EXPECT_EQ(ICC::nodestore.getNode(P0, &n).getStatus(), 1);
    EXPECT_EQ(ICC::nodestore.getNode(PF, &n).getStatus(), 1);
    EXPECT_EQ(ICC::nodestore.getNode(P1, &n).getStatus(), 0);
}

TEST_F(Dispatch, StoreIsUpdatedOncePerDeliveredCall)
{
    std::string const line = "newAlerts: Abnormal Status 2path =" + hex(P0);
    {
        ictest::LogCapture cap;
        ICC::AlertCallBackFP({alert(0, {P0})});
        EXPECT_TRUE(assertedNow().empty()) << "reached no register: not recorded";
        EXPECT_EQ(cap.count(line), 0u);
    }
    ic.registerForAlerts(recA, ST::CPU, &c1);
    ic.registerForAlerts(recA, ST::CPU, &c2);
    {
        ictest::LogCapture cap;
        ICC::AlertCallBackFP({alert(0, {P0, PF}, 2, "rec")});
        EXPECT_EQ(cap.count(line), 2u) << "recorded once per register";
    }
    auto const stored = assertedNow();
    ASSERT_EQ(stored.size(), 1u) << "only the delivered copy's path";
    EXPECT_EQ(stored[0].getNodePaths(), Paths{P0});
    EXPECT_EQ(stored[0].getMessage(), "rec");
}

TEST_F(Dispatch, OnlyTheAlertsARegisterTookAreRecorded)
{
    ICC::registerForAlerts(recA, Paths{P0}, &c1);
    ic.registerForAlerts(recA, ST::invalid, &c2);
    ICC::AlertCallBackFP({alert(0, {P0}, 2, "taken"), alert(0, {P1}, 2, "passed by"),
                          alert(0, {unknown}, 2, "filtered out")});
    EXPECT_EQ(gDeliveries.size(), 2u);
    auto const stored = assertedNow();
    ASSERT_EQ(stored.size(), 1u);
    EXPECT_EQ(stored[0].getMessage(), "taken");
}

TEST_F(Dispatch, ManagementBatchIsNotRecorded)
{
    ICC::regFPsensorAlerts(recA, ST::CPU, &c1);
    ICC::AlertCallBackMI({alert(0, {P0}, 2)}, nullptr);
    EXPECT_EQ(gDeliveries.size(), 1u);
    EXPECT_TRUE(assertedNow().empty());
}

TEST_F(Dispatch, AssertCallBackRecordsWithoutDelivering)
{
    ic.registerForAlerts(recA, ST::CPU, &c1);
    expectStatus(ICC::AssertCallBackFP({alert(0, {P0, unknown}, 3, "asserted")}), 0);
    EXPECT_TRUE(gDeliveries.empty());
    auto const stored = assertedNow();
    ASSERT_EQ(stored.size(), 2u);
    EXPECT_EQ(stored[0].getNodePaths(), (Paths{P0, unknown}));
    expectStatus(ICC::AssertCallBackFP({alert(0, {P0}, 1)}), 0);
    EXPECT_EQ(assertedNow().size(), 1u);
}

TEST_F(Dispatch, CommonDispatcherServesBothTypes)
{
    ic.registerForAlerts(recA, ST::CPU, &c1);
    expectStatus(ICC::AlertCallBackCommon({alert(0, {P0})}, nullptr, IC::MI_ALERT), 0);
    EXPECT_TRUE(gDeliveries.empty());
    expectStatus(ICC::AlertCallBackCommon({alert(0, {P0})}, &c2, IC::FP_ALERT), 0);
    EXPECT_EQ(contextsDelivered(), std::vector<void const*>{&c1});
    EXPECT_EQ(assertedNow().size(), 1u);
}

TEST_F(Dispatch, CallbacksRunWithoutTheLockAndMayChangeRegistrations)
{
    ic.registerForAlerts(recHook, ST::CPU, &c1);
    bool lockFree = false;
    gHook = [&](std::vector<Alert> const&, void const* ctx) {
        if (ctx != &c1)
            return;
        lockFree = registerlockFreeForOthers();
        expectStatus(ic.registerForAlerts(recB, ST::CPU, &c2), 0);
        expectStatus(ICC::registerForAlerts(recB, Paths{PF}, &c3), 0);
        expectStatus(ic.deRegisterForAlerts(recHook, ST::CPU, &c1), 0);
    };
    ICC::AlertCallBackFP({alert(0, {P0})});
    EXPECT_TRUE(lockFree);
    EXPECT_EQ(registerOf(recHook, &c1), nullptr);
    ASSERT_NE(registerOf(recB, &c2), nullptr);

    gDeliveries.clear();
    ICC::AlertCallBackFP({alert(0, {P0, PF})});
    auto got = contextsDelivered();
    std::sort(got.begin(), got.end());
    std::vector<void const*> want{&c2, &c3};
    std::sort(want.begin(), want.end());
    EXPECT_EQ(got, want);
}

// ===========================================================================
// Registration
// ===========================================================================

TEST_F(Registration, ClientSensorFormLogsIndexesAndRemoves)
{
    std::string const tail = " Callback=" + fnaddr(recA) + " *p=" + addr(&c1);
    {
        ictest::LogCapture cap;
        expectStatus(ic.registerForAlerts(recA, ST::CPU, &c1), 0);
        expectEvent(cap, "registerForAlerts: sensor=4" + tail, 3000, "registerForAlerts");
        EXPECT_EQ(cap.logs().size(), 1u);
    }
    expectStatus(ic.registerForAlerts(recA, ST::CPU, &c1), 0);
    AlertRegister* r = registerOf(recA, &c1);
    ASSERT_NE(r, nullptr);
    EXPECT_EQ(r->getRegType(), 1u);
    EXPECT_EQ(r->getContext(), &c1);
    EXPECT_EQ(r->getSensorTypes(), std::set<ST>{ST::CPU});
    EXPECT_EQ(entries(ICC::sensortypeTOalertregister, ST::CPU, r), 1u);
    EXPECT_EQ(ICC::sensortypeTOalertregister.size(), 1u);
    {
        ictest::LogCapture cap;
        expectStatus(ic.deRegisterForAlerts(recA, ST::CPU, &c1), 0);
        expectEvent(cap, "deRegisterForAlerts: sensor 4" + tail, 3000, "deRegisterForAlerts");
        EXPECT_EQ(cap.logs().size(), 1u);
    }
    EXPECT_TRUE(allEmpty());
}

TEST_F(Registration, PlugInSensorFormLogsAndRegistersAsPlugIn)
{
    std::string const tail = " Callback=" + fnaddr(recB) + " *p=" + addr(&c2);
    {
        ictest::LogCapture cap;
        expectStatus(ICC::regFPsensorAlerts(recB, ST::Fan, &c2), 0);
        expectEvent(cap, "registerFPsensorAlerts: sensor 20" + tail, 3000, "regFPsensorAlerts");
    }
    AlertRegister* r = registerOf(recB, &c2);
    ASSERT_NE(r, nullptr);
    EXPECT_EQ(r->getRegType(), 0u);
    EXPECT_EQ(entries(ICC::sensortypeTOalertregister, ST::Fan, r), 1u);
    {
        ictest::LogCapture cap;
        expectStatus(ICC::deRegFPsensorAlerts(recB, ST::Fan, &c2), 0);
        expectEvent(cap, "deRegFPsensorAlerts: sensor 20" + tail, 3000, "deRegFPsensorAlerts");
    }
    EXPECT_TRUE(allEmpty());
}

TEST_F(Registration, ClassFormIsSilentAndRegistersAsClient)
{
    ictest::LogCapture cap;
    expectStatus(ICC::registerForAlerts(recA, cls(6), &c1), 0);
    expectStatus(ICC::registerForAlerts(recA, cls(6), &c1), 0);
    AlertRegister* r = registerOf(recA, &c1);
    ASSERT_NE(r, nullptr);
    EXPECT_EQ(r->getRegType(), 1u);
    EXPECT_EQ(r->getClasses(), std::set<Alert::ClassType>{cls(6)});
    EXPECT_EQ(entries(ICC::classtypeTOalertregister, cls(6), r), 1u);
    EXPECT_EQ(ICC::classtypeTOalertregister.size(), 1u);
    expectStatus(ICC::deRegisterForAlerts(recA, cls(6), &c1), 0);
    EXPECT_TRUE(allEmpty());
    EXPECT_TRUE(cap.records().empty());
}

TEST_F(Registration, ClientPathFormLogsEveryPathAndIndexesEachOnce)
{
    std::string const tail = "} Callback=" + fnaddr(recA) + " *p=" + addr(&c1);
    {
        ictest::LogCapture cap;
        expectStatus(ICC::registerForAlerts(recA, Paths{P1, P0, P1}, &c1), 0);
        expectEvent(cap,
                    "registerFor Alerts paths={ " + hex(P1) + " " + hex(P0) + " " + hex(P1) +
                        " " + tail,
                    3000, "registerForAlerts");
        EXPECT_EQ(cap.logs().size(), 1u);
    }
    AlertRegister* r = registerOf(recA, &c1);
    ASSERT_NE(r, nullptr);
    EXPECT_EQ(r->getRegType(), 1u);
    EXPECT_EQ(r->getNodePaths(), (std::set<std::string>{P0, P1}));
    EXPECT_EQ(entries(ICC::nodepathTOalertregister, P0, r), 1u);
    EXPECT_EQ(entries(ICC::nodepathTOalertregister, P1, r), 1u);
    EXPECT_EQ(ICC::nodepathTOalertregister.size(), 2u);
    {
        ictest::LogCapture cap;
        expectStatus(ICC::deRegisterForAlerts(recA, Paths{P0}, &c1), 0);
        expectEvent(cap, "deRegisterForAlerts: Node paths={ " + hex(P0) + " " + tail, 3000,
                    "deRegisterForAlerts");
    }
    EXPECT_EQ(entries(ICC::nodepathTOalertregister, P0, r), 0u);
    EXPECT_EQ(registerOf(recA, &c1), r);
    {
        ictest::LogCapture cap;
        expectStatus(ICC::deRegisterForAlerts(recA, Paths{}, &c2), 1);
        expectEvent(cap, "deRegisterForAlerts: Node paths={ } Callback=" + fnaddr(recA) +
                             " *p=" + addr(&c2),
                    3000, "deRegisterForAlerts");
    }
    expectStatus(ICC::deRegisterForAlerts(recA, Paths{P1}, &c1), 0);
    EXPECT_TRUE(allEmpty());
}

TEST_F(Registration, PlugInPathFormIsSilentAndRegistersAsPlugIn)
{
    ictest::LogCapture cap;
    expectStatus(ICC::regFPAlerts(recB, Paths{PF, P2}, &c3), 0);
    AlertRegister* r = registerOf(recB, &c3);
    ASSERT_NE(r, nullptr);
    EXPECT_EQ(r->getRegType(), 0u);
    EXPECT_EQ(entries(ICC::nodepathTOalertregister, PF, r), 1u);
    EXPECT_EQ(entries(ICC::nodepathTOalertregister, P2, r), 1u);
    expectStatus(ICC::deRegFPAlerts(recB, Paths{P2, PF}, &c3), 0);
    EXPECT_TRUE(allEmpty());
    EXPECT_TRUE(cap.records().empty());
}

TEST_F(Registration, SensorAndClassOfOnePairShareOneRegister)
{
    ic.registerForAlerts(recA, static_cast<ST>(5), &c1);
    ICC::registerForAlerts(recA, cls(2), &c1);
    AlertRegister* r = registerOf(recA, &c1);
    ASSERT_NE(r, nullptr);
    EXPECT_EQ(ICC::callbacks.size(), 1u);

    expectStatus(ic.deRegisterForAlerts(recA, static_cast<ST>(5), &c1), 0);
    EXPECT_EQ(registerOf(recA, &c1), r);
    EXPECT_EQ(entries(ICC::classtypeTOalertregister, cls(2), r), 1u);
    EXPECT_TRUE(ICC::sensortypeTOalertregister.empty());

    expectStatus(ICC::deRegisterForAlerts(recA, cls(2), &c1), 0);
    EXPECT_TRUE(allEmpty());
}

TEST_F(Registration, TwoContextsGiveTwoRegisters)
{
    ic.registerForAlerts(recA, ST::CPU, &c1);
    ic.registerForAlerts(recA, ST::CPU, &c2);
    ICC::registerForAlerts(recA, Paths{P0}, &c1);
    ICC::registerForAlerts(recA, Paths{P0}, &c2);
    AlertRegister* r1 = registerOf(recA, &c1);
    AlertRegister* r2 = registerOf(recA, &c2);
    ASSERT_NE(r1, nullptr);
    ASSERT_NE(r2, nullptr);
    EXPECT_NE(r1, r2);
    EXPECT_EQ(ICC::sensortypeTOalertregister.count(ST::CPU), 2u);
    EXPECT_EQ(entries(ICC::sensortypeTOalertregister, ST::CPU, r1), 1u);
    EXPECT_EQ(entries(ICC::sensortypeTOalertregister, ST::CPU, r2), 1u);

    // Removing the later register's entries leaves the earlier one's in place.
    ICC::deRegisterForAlerts(recA, Paths{P0}, &c2);
    ic.deRegisterForAlerts(recA, ST::CPU, &c2);
    EXPECT_EQ(registerOf(recA, &c2), nullptr);
    EXPECT_EQ(entries(ICC::sensortypeTOalertregister, ST::CPU, r1), 1u);
    EXPECT_EQ(entries(ICC::nodepathTOalertregister, P0, r1), 1u);
    EXPECT_EQ(ICC::sensortypeTOalertregister.size(), 1u);
    EXPECT_EQ(ICC::nodepathTOalertregister.size(), 1u);
}

TEST_F(Registration, EmptyPathListKeepsARegisterThatHoldsAClass)
{
    ICC::registerForAlerts(recA, cls(3), &c1);
    expectStatus(ICC::deRegisterForAlerts(recA, Paths{}, &c1), 0);
    AlertRegister* r = registerOf(recA, &c1);
    ASSERT_NE(r, nullptr);
    EXPECT_EQ(r->getClasses().size(), 1u);
    EXPECT_EQ(ICC::classtypeTOalertregister.size(), 1u);
}

TEST_F(Registration, EmptyPathListAloneMakesAnEmptyRegister)
{
    expectStatus(ICC::registerForAlerts(recA, Paths{}, &c1), 0);
    AlertRegister* r = registerOf(recA, &c1);
    ASSERT_NE(r, nullptr);
    EXPECT_TRUE(r->getNodePaths().empty());
    expectStatus(ICC::deRegisterForAlerts(recA, Paths{}, &c1), 0);
    EXPECT_TRUE(allEmpty());
}

TEST_F(Registration, UnknownPairsAreRefused)
{
    ic.registerForAlerts(recA, ST::CPU, &c1);
    ICC::registerForAlerts(recA, cls(1), &c1);
    ICC::registerForAlerts(recA, Paths{P0}, &c1);
    AlertRegister* r = registerOf(recA, &c1);

    expectStatus(ic.deRegisterForAlerts(recA, ST::CPU, &c2), 1);
    expectStatus(ic.deRegisterForAlerts(recB, ST::CPU, &c1), 1); // the key is the pair
    expectStatus(ICC::deRegFPsensorAlerts(recA, ST::CPU, &c2), 1);
    expectStatus(ICC::deRegisterForAlerts(recA, cls(1), &c2), 1);
    expectStatus(ICC::deRegisterForAlerts(recB, Paths{P0}, &c1), 1);
    expectStatus(ICC::deRegFPAlerts(recA, Paths{P0}, &c3), 1);

    EXPECT_EQ(ICC::callbacks.size(), 1u);
    EXPECT_EQ(registerOf(recA, &c1), r);
    EXPECT_EQ(ICC::sensortypeTOalertregister.size(), 1u);
    EXPECT_EQ(ICC::classtypeTOalertregister.size(), 1u);
    EXPECT_EQ(ICC::nodepathTOalertregister.size(), 1u);
}

TEST_F(Registration, RemovingAValueNeverRegisteredSucceeds)
{
    ic.registerForAlerts(recA, ST::CPU, &c1);
    expectStatus(ic.deRegisterForAlerts(recA, ST::Fan, &c1), 0);
    expectStatus(ICC::deRegisterForAlerts(recA, cls(4), &c1), 0);
    expectStatus(ICC::deRegisterForAlerts(recA, Paths{P0}, &c1), 0);
    AlertRegister* r = registerOf(recA, &c1);
    ASSERT_NE(r, nullptr);
    EXPECT_EQ(entries(ICC::sensortypeTOalertregister, ST::CPU, r), 1u);
}

TEST_F(Registration, WorkersTakeTheKindGivenAndIgnoreItOnRemoval)
{
    {
        SD::MutexGuard g(ICC::registerlock);
        expectStatus(ICC::regAlerts(recA, ST::CPU, &c1, IC::FP_REGISTRATION), 0);
    }
    expectStatus(ICC::regAlerts(recB, Paths{P0}, &c2, IC::FP_REGISTRATION), 0);
    EXPECT_EQ(registerOf(recA, &c1)->getRegType(), 0u);
    EXPECT_EQ(registerOf(recB, &c2)->getRegType(), 0u);
    {
        SD::MutexGuard g(ICC::registerlock);
        expectStatus(ICC::deRegAlerts(recA, ST::CPU, &c1, IC::CLIENT_REGISTRATION), 0);
        expectStatus(ICC::deRegAlerts(recA, ST::CPU, &c1, IC::FP_REGISTRATION), 1);
    }
    expectStatus(ICC::deRegAlerts(recB, Paths{P0}, &c2, IC::CLIENT_REGISTRATION), 0);
    EXPECT_TRUE(allEmpty());
}

// ===========================================================================
// Simple alerts
// ===========================================================================

TEST_F(SimpleAlerts, EntryLinesAreLogged)
{
    ictest::LogCapture cap;
    expectStatus(ic.registerForSimpleAlerts(simpleA, 4, &c1), 0);
    expectEvent(cap,
                "registerForSimpleAlerts: Sensor=4 Callback=" + fnaddr(simpleA) + "*p=" +
                    addr(&c1),
                3000, "registerForSimpleAlerts");
    expectStatus(ic.deRegisterForSimpleAlerts(simpleA, 4, &c1), 0);
    expectEvent(cap,
                "deRegisterForSimpleAlerts: sensor=4 Callback=" + fnaddr(simpleA) + " *p=" +
                    addr(&c1),
                3000, "deRegisterForSimpleAlerts");
    EXPECT_EQ(cap.logs().size(), 2u);
    EXPECT_TRUE(allEmpty());
}

TEST_F(SimpleAlerts, SlotsAreNumberedAndTheSmallestFreeOneIsReused)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    ic.registerForSimpleAlerts(simpleA, 4, &c2);
    ic.registerForSimpleAlerts(simpleB, 20, &c3);
    ASSERT_EQ(ICC::mysam.size(), 3u);
    for (unsigned int i = 0; i < 3; ++i) {
        EXPECT_EQ(ICC::mysam[i].index, i);
        EXPECT_NE(registerOf(ICC::AlertCallBackSimple, slot(i)), nullptr) << i;
    }
    EXPECT_EQ(ICC::sensortypeTOalertregister.count(ST::CPU), 2u);
    AlertRegister* r2 = registerOf(ICC::AlertCallBackSimple, slot(2));
    EXPECT_EQ(r2->getSensorTypes(), std::set<ST>{ST::Fan});
    EXPECT_EQ(r2->getRegType(), 1u);

    expectStatus(ic.deRegisterForSimpleAlerts(simpleA, 4, &c2), 0);
    EXPECT_EQ(registerOf(ICC::AlertCallBackSimple, slot(1)), nullptr);
    ASSERT_EQ(ICC::mysam.size(), 2u);
    EXPECT_EQ(ICC::mysam[1].index, 2u) << "later slots keep their numbers";

    expectStatus(ic.registerForSimpleAlerts(simpleB, 4, &c4), 0);
    ASSERT_EQ(ICC::mysam.size(), 3u);
    EXPECT_EQ(ICC::mysam[0].context, &c1);
    EXPECT_EQ(ICC::mysam[1].context, &c4);
    EXPECT_EQ(ICC::mysam[1].index, 1u);
    EXPECT_EQ(ICC::mysam[1].callback, &simpleB);
    EXPECT_EQ(ICC::mysam[2].context, &c3);
    EXPECT_NE(registerOf(ICC::AlertCallBackSimple, slot(1)), nullptr);

    ic.deRegisterForSimpleAlerts(simpleA, 4, &c1);
    ic.registerForSimpleAlerts(simpleA, 22, &c5);
    EXPECT_EQ(ICC::mysam[0].index, 0u);
    EXPECT_EQ(ICC::mysam[0].context, &c5);
    ic.registerForSimpleAlerts(simpleA, 22, &c6);
    EXPECT_EQ(ICC::mysam.back().index, 3u);
}

TEST_F(SimpleAlerts, RepeatedRegistrationChangesNothing)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    expectStatus(ic.registerForSimpleAlerts(simpleA, 4, &c1), 0);
    expectStatus(ic.registerForSimpleAlerts(simpleA, 65536u + 4, &c1), 0);
    EXPECT_EQ(ICC::mysam.size(), 1u);
    EXPECT_EQ(ICC::callbacks.size(), 1u);
    EXPECT_EQ(ICC::sensortypeTOalertregister.size(), 1u);
    // Another context or sensor is another subscription.
    ic.registerForSimpleAlerts(simpleA, 4, &c2);
    ic.registerForSimpleAlerts(simpleA, 20, &c1);
    EXPECT_EQ(ICC::mysam.size(), 3u);
}

TEST_F(SimpleAlerts, SensorIsKeptByItsLow16Bits)
{
    ic.registerForSimpleAlerts(simpleA, 65536u + 4, &c1);
    ASSERT_EQ(ICC::mysam.size(), 1u);
    EXPECT_EQ(ICC::mysam[0].sensor, 4);
    EXPECT_EQ(ICC::sensortypeTOalertregister.count(ST::CPU), 1u);
    ICC::AlertCallBackFP({alert(0, {P0})});
    EXPECT_EQ(gSimple.size(), 1u);
    expectStatus(ic.deRegisterForSimpleAlerts(simpleA, 4, &c1), 0);
    EXPECT_TRUE(allEmpty());
}

TEST_F(SimpleAlerts, UnknownTripleIsRefused)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    expectStatus(ic.deRegisterForSimpleAlerts(simpleA, 4, &c2), 1);
    expectStatus(ic.deRegisterForSimpleAlerts(simpleB, 4, &c1), 1);
    expectStatus(ic.deRegisterForSimpleAlerts(simpleA, 20, &c1), 1);
    EXPECT_EQ(ICC::mysam.size(), 1u);
    EXPECT_EQ(ICC::callbacks.size(), 1u);
}

TEST_F(SimpleAlerts, OneCallPerPathWithOneCodeAndTime)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    ICC::AlertCallBackFP({alert(0, {P2, P0, PF, P1})});
    ASSERT_EQ(gSimple.size(), 3u);
    std::vector<std::string> paths;
    for (auto const& s : gSimple) {
        paths.push_back(s.path);
        EXPECT_EQ(s.code, 0u);
        EXPECT_EQ(s.context, &c1);
        EXPECT_EQ(s.time, gSimple[0].time);
    }
    EXPECT_EQ(paths, (Paths{P2, P0, P1}));
}

TEST_F(SimpleAlerts, EventCodesFollowTheClassAndRemovalsAreSkipped)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    ICC::AlertCallBackFP({alert(5, {P0}), alert(3, {P0}), alert(4, {P1}), alert(0, {P0}),
                          alert(9, {P2})});
    std::vector<unsigned int> codes;
    for (auto const& s : gSimple)
        codes.push_back(s.code);
    EXPECT_EQ(codes, (std::vector<unsigned int>{1, 2, 0, 0}));
    for (auto const& s : gSimple)
        EXPECT_NE(s.path, P1);
}

TEST_F(SimpleAlerts, AdapterPassesTheAlertsOwnTimeAndIgnoresUnknownSlots)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    ic.registerForSimpleAlerts(simpleB, 4, &c2);
    Alert const a = alert(5, {P1, PF});
    expectStatus(ICC::AlertCallBackSimple({a}, slot(1)), 0);
    ASSERT_EQ(gSimple.size(), 2u);
    EXPECT_EQ(gSimple[0].code, 101u) << "slot 1 is the second subscription";
    EXPECT_EQ(gSimple[0].time, a.getTimeStamp());
    EXPECT_EQ(gSimple[0].path, P1);
    EXPECT_EQ(gSimple[1].path, PF) << "the adapter does not filter paths itself";
    EXPECT_EQ(gSimple[0].context, &c2);

    gSimple.clear();
    expectStatus(ICC::AlertCallBackSimple({a}, slot(7)), 0);
    EXPECT_TRUE(gSimple.empty());
}

TEST_F(SimpleAlerts, SubscribersOfOneSensorEachGetTheirCall)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    ic.registerForSimpleAlerts(simpleB, 4, &c2);
    ic.registerForSimpleAlerts(simpleA, 20, &c3);
    ICC::AlertCallBackFP({alert(0, {P0})});
    ASSERT_EQ(gSimple.size(), 2u);
    std::set<void const*> got{gSimple[0].context, gSimple[1].context};
    EXPECT_EQ(got, (std::set<void const*>{&c1, &c2}));
}

TEST_F(SimpleAlerts, ManagementBatchesDoNotReachSimpleSubscribers)
{
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    ICC::AlertCallBackMI({alert(0, {P0})}, nullptr);
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

// ===========================================================================
// Asserted alerts
// ===========================================================================

TEST_F(AssertedAlerts, QueryLogsAndReplacesTheCallersVector)
{
    ICC::AssertCallBackFP({alert(0, {P1}, 2, "x")});
    std::vector<Alert> out{alert(0, {P0}), alert(0, {P2})};
    ictest::LogCapture cap;
    expectStatus(ic.getAssertedAlerts(out), 0);
    expectEvent(cap, "getAssertedAlerts:", 3000, "getAssertedAlerts");
    EXPECT_EQ(cap.logs().size(), 1u);
    ASSERT_EQ(out.size(), 1u);
    EXPECT_EQ(out[0].getMessage(), "x");

    ICC::alertstore.clear();
    ic.getAssertedAlerts(out);
    EXPECT_TRUE(out.empty());
}

TEST_F(AssertedAlerts, FollowDispatchedPlugInBatches)
{
    ICC::regFPsensorAlerts(recA, ST::CPU, &c1);
    ICC::regFPsensorAlerts(recA, ST::Fan, &c1);
    std::vector<std::string> sorted{P0, P1, PF};
    std::sort(sorted.begin(), sorted.end());

    ICC::AlertCallBackFP({alert(0, {sorted[2], sorted[0]}, 0, "two"), alert(0, {sorted[1]}, 3, "one")});
    std::vector<Alert> out;
    ic.getAssertedAlerts(out);
    ASSERT_EQ(out.size(), 3u);
    EXPECT_EQ(out[0].getMessage(), "two");
    EXPECT_EQ(out[1].getMessage(), "one");
    EXPECT_EQ(out[2].getMessage(), "two");
    EXPECT_EQ(out[0].getNodePaths(), (Paths{sorted[2], sorted[0]}));

    ICC::AlertCallBackFP({alert(0, {sorted[0]}, 1)});
    ic.getAssertedAlerts(out);
    ASSERT_EQ(out.size(), 2u);
    EXPECT_EQ(out[0].getMessage(), "one");
    EXPECT_EQ(out[1].getMessage(), "two");
    EXPECT_EQ(out[1].getNodePaths(), (Paths{sorted[2], sorted[0]}));

    ICC::AlertCallBackMI({alert(0, {sorted[1]}, 1), alert(0, {P2}, 2)}, nullptr);
    ic.getAssertedAlerts(out);
    EXPECT_EQ(out.size(), 2u) << "management batches leave the store alone";
}
