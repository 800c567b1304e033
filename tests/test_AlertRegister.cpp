// Tests of IC::AlertRegister (the filters of one (callback, context) pair,
// their removal codes and the filtering of a batch) and of IC::AlertCall
// (one pending delivery).
#include <IC/AlertRegister.h>

#include <HGLog/HGLogger.h>
#include <IC/Alert.h>
#include <IC/AlertStore.h>
#include <IC/Error.h>
#include <IC/Node.h>
#include <IC/NodeStore.h>
#include <IC/Number.h>

#include <LogCapture.h>

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace {

using IC::Alert;
using IC::AlertCall;
using IC::AlertRegister;
using IC::Node;
using Paths = std::vector<std::string>;
using ST = Node::SensorType;

std::string const kLogger = "Helmgard.IC.InstrumentationControl.AlertRegister";
constexpr unsigned int kFP = 0;
constexpr unsigned int kMI = 1;

Alert::ClassType cls(unsigned int n) { return static_cast<Alert::ClassType>(n); }

Alert alert(unsigned int c, Paths paths, unsigned int status = 2, std::string msg = "m",
            unsigned char sev = 3)
{
    return Alert(sev, cls(c), std::move(paths), status, std::move(msg));
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

// ---- callbacks that remember what they were given ----

struct Delivery {
    void const* context;
    std::vector<Alert> alerts;
    std::size_t storedAtCall; // size of the watched store when called
};
std::vector<Delivery> gDeliveries;
IC::AlertStore* gWatched = nullptr;

IC::Error recordA(std::vector<Alert> const& alerts, void const* context)
{
    std::size_t stored = 0;
    if (gWatched) {
        std::vector<Alert> now;
        gWatched->getAsserted(now);
        stored = now.size();
    }
    gDeliveries.push_back({context, alerts, stored});
    return IC::Error(1, IC::Number(IC::Number::Generic), "ignored by the library");
}

IC::Error recordB(std::vector<Alert> const& alerts, void const* context)
{
    gDeliveries.push_back({context, alerts, 0});
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

int gCtx1 = 1, gCtx2 = 2;

// Exactly one event with this message on each channel, on this module's
// logger with the given level and function.
void expectEvent(ictest::LogCapture const& cap, std::string const& message, int level,
                 std::string const& function)
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
        EXPECT_EQ(r->file, "AlertRegister") << message;
        EXPECT_EQ(r->logger, kLogger) << message;
    }
    EXPECT_EQ(logs[0].line, traces[0].line);
}

std::size_t countPrefix(ictest::LogCapture const& cap, std::string const& prefix)
{
    std::size_t n = 0;
    for (auto const& m : cap.messages())
        n += m.rfind(prefix, 0) == 0;
    return n;
}

// A small tree: ROOT <- CPU 0, CPU 1, Fan 0, in a store of the test's own.
class WithNodes : public ::testing::Test {
protected:
    void SetUp() override
    {
        gDeliveries.clear();
        gWatched = nullptr;
        for (Node* n : {&root, &cpu0, &cpu1, &fan0}) {
            bool isNew = false;
            ASSERT_EQ(store.addNodeIfNew(n, isNew).getStatus(), 0);
            ASSERT_TRUE(isNew);
        }
        P0 = cpu0.getPath();
        P1 = cpu1.getPath();
        PF = fan0.getPath();
        ASSERT_FALSE(P0.empty());
        ASSERT_NE(P0, P1);
    }
    void TearDown() override { gWatched = nullptr; }

    // Filters one batch through r; expects false and returns the calls added.
    std::vector<AlertCall> filter(AlertRegister& r, std::vector<Alert> const& batch,
                                  unsigned int type)
    {
        std::vector<AlertCall> calls;
        EXPECT_FALSE(r.filterAlerts(store, batch, calls, type));
        return calls;
    }

    IC::NodeStore store;
    Node root{ST::ROOT, 0, 1, 0, "root"};
    Node cpu0{ST::CPU, 0, 2, 1, "cpu 0"};
    Node cpu1{ST::CPU, 1, 3, 1, "cpu 1"};
    Node fan0{ST::Fan, 0, 4, 1, "fan 0"};
    std::string P0, P1, PF;
    std::string const unknown = std::string("\x7e\x7f\x01", 3);
};

using AlertRegisterFilters = WithNodes;
using AlertCallTest = WithNodes;

} // namespace

// ---------------------------------------------------------------------------
// Building up and tearing down a register
// ---------------------------------------------------------------------------

TEST(AlertRegisterSets, NewRegisterIsEmptyAndKeepsItsArguments)
{
    AlertRegister r(recordA, &gCtx1, 1);
    EXPECT_EQ(r.getCallback(), &recordA);
    EXPECT_EQ(r.getContext(), &gCtx1);
    EXPECT_EQ(r.getRegType(), 1u);
    EXPECT_TRUE(r.getClasses().empty());
    EXPECT_TRUE(r.getSensorTypes().empty());
    EXPECT_TRUE(r.getNodePaths().empty());
    EXPECT_EQ(AlertRegister(recordB, nullptr, 0).getRegType(), 0u);
}

TEST(AlertRegisterSets, AddInsertsOnceAndAlwaysSucceeds)
{
    AlertRegister r(recordA, &gCtx1, 0);
    EXPECT_TRUE(r.add(recordA, ST::CPU));
    EXPECT_TRUE(r.add(recordA, ST::CPU));
    EXPECT_TRUE(r.add(recordA, cls(5)));
    EXPECT_TRUE(r.add(recordA, cls(5)));
    EXPECT_TRUE(r.add(recordA, Paths{"b", "a", "b"}));
    EXPECT_TRUE(r.add(recordA, Paths{"a"}));
    EXPECT_TRUE(r.add(recordA, Paths{}));
    EXPECT_EQ(r.getSensorTypes(), std::set<ST>{ST::CPU});
    EXPECT_EQ(r.getClasses(), std::set<Alert::ClassType>{cls(5)});
    EXPECT_EQ(r.getNodePaths(), (std::set<std::string>{"a", "b"}));
}

TEST(AlertRegisterSets, AddDoesNotCompareTheCallback)
{
    AlertRegister r(recordA, &gCtx1, 1);
    EXPECT_TRUE(r.add(recordB, ST::Fan));
    EXPECT_TRUE(r.add(nullptr, cls(2)));
    EXPECT_TRUE(r.add(recordB, Paths{"p"}));
    EXPECT_EQ(r.getSensorTypes().size(), 1u);
    EXPECT_EQ(r.getClasses().size(), 1u);
    EXPECT_EQ(r.getNodePaths().size(), 1u);
    EXPECT_EQ(r.getCallback(), &recordA);
}

TEST(AlertRegisterSets, TestCleanOnlySucceedsWhenAllThreeSetsAreEmpty)
{
    AlertRegister bySensor(recordA, &gCtx1, 1), byClass(recordA, &gCtx1, 1),
        byPath(recordA, &gCtx1, 1);
    bySensor.add(recordA, ST::CPU);
    byClass.add(recordA, cls(0));
    byPath.add(recordA, Paths{"x"});
    for (AlertRegister* r : {&bySensor, &byClass, &byPath}) {
        EXPECT_FALSE(r->testClean());
        EXPECT_EQ(r->getCallback(), &recordA);
    }
    AlertRegister empty(recordA, &gCtx1, 1);
    EXPECT_TRUE(empty.testClean());
    EXPECT_EQ(empty.getCallback(), nullptr);
    EXPECT_TRUE(empty.testClean());
}

TEST(AlertRegisterDel, SensorAndClassRemovalReportWhetherAnythingIsLeft)
{
    AlertRegister r(recordA, &gCtx1, 1);
    r.add(recordA, ST::CPU);
    r.add(recordA, ST::Fan);
    r.add(recordA, cls(2));
    ictest::LogCapture cap;
    EXPECT_EQ(r.del(recordA, ST::CPU), 0);
    EXPECT_EQ(r.getSensorTypes(), std::set<ST>{ST::Fan});
    EXPECT_EQ(r.del(recordA, ST::Fan), 0) << "the class is still held";
    EXPECT_EQ(r.getCallback(), &recordA);
    EXPECT_EQ(r.del(recordA, cls(2)), 1);
    EXPECT_TRUE(r.getClasses().empty());
    EXPECT_EQ(r.getCallback(), nullptr) << "an emptied register drops its callback";
    EXPECT_TRUE(cap.records().empty()) << "successful removals log nothing";
}

TEST(AlertRegisterDel, RemovingAnUnregisteredValueIsNotAnError)
{
    AlertRegister r(recordA, &gCtx1, 1);
    r.add(recordA, ST::CPU);
    EXPECT_EQ(r.del(recordA, ST::Fan), 0);
    EXPECT_EQ(r.del(recordA, cls(3)), 0);
    EXPECT_EQ(r.del(recordA, Paths{"nope"}), 0);
    EXPECT_EQ(r.getSensorTypes().size(), 1u);

    AlertRegister empty(recordA, &gCtx1, 1);
    EXPECT_EQ(empty.del(recordA, ST::Fan), 1);
}

TEST(AlertRegisterDel, PathListRemovesEachPath)
{
    AlertRegister r(recordA, &gCtx1, 0);
    r.add(recordA, Paths{"a", "b", "c"});
    EXPECT_EQ(r.del(recordA, Paths{"a", "c", "zz"}), 0);
    EXPECT_EQ(r.getNodePaths(), std::set<std::string>{"b"});
    EXPECT_EQ(r.del(recordA, Paths{"b"}), 1);
    EXPECT_EQ(r.getCallback(), nullptr);
}

TEST(AlertRegisterDel, EmptyPathListOnlyTestsForEmptiness)
{
    AlertRegister holdsClass(recordA, &gCtx1, 1);
    holdsClass.add(recordA, cls(1));
    EXPECT_EQ(holdsClass.del(recordA, Paths{}), 0);
    EXPECT_EQ(holdsClass.getClasses().size(), 1u);
    EXPECT_EQ(holdsClass.getCallback(), &recordA);

    AlertRegister empty(recordA, &gCtx1, 1);
    EXPECT_EQ(empty.del(recordA, Paths{}), 1);
    EXPECT_EQ(empty.getCallback(), nullptr);
}

TEST(AlertRegisterDel, OtherCallbackIsRefusedAndLogged)
{
    AlertRegister r(recordA, &gCtx2, 1);
    r.add(recordA, ST::CPU);
    r.add(recordA, cls(6));
    r.add(recordA, Paths{"p"});
    std::string const head = "del: " + addr(&r) + " Callback mismatch: ";
    std::string const ctx = addr(&gCtx2);

    ictest::LogCapture cap;
    EXPECT_EQ(r.del(recordB, ST::CPU), 2);
    expectEvent(cap, head + "1 != 1 p=" + ctx, 6000, "del");
    cap.clear();
    EXPECT_EQ(r.del(nullptr, cls(6)), 2);
    expectEvent(cap, head + "0 != 1 p=" + ctx, 6000, "del");
    cap.clear();
    // The path form writes its pieces in another order.
    EXPECT_EQ(r.del(recordB, Paths{"p"}), 2);
    expectEvent(cap, head + "1 p=" + ctx + " != 1", 6000, "del");

    EXPECT_EQ(r.getSensorTypes().size(), 1u);
    EXPECT_EQ(r.getClasses().size(), 1u);
    EXPECT_EQ(r.getNodePaths().size(), 1u);
    EXPECT_EQ(r.getCallback(), &recordA);
}

TEST(AlertRegisterDel, EmptiedRegisterRefusesItsFormerCallback)
{
    AlertRegister r(recordA, &gCtx1, 1);
    r.add(recordA, ST::CPU);
    ASSERT_EQ(r.del(recordA, ST::CPU), 1);
    std::string const head = "del: " + addr(&r) + " Callback mismatch: ";
    ictest::LogCapture cap;
    EXPECT_EQ(r.del(recordA, ST::CPU), 2);
    EXPECT_EQ(r.del(recordA, Paths{"p"}), 2);
    EXPECT_EQ(cap.messages(), (std::vector<std::string>{head + "1 != 0 p=" + addr(&gCtx1),
                                                        head + "1 p=" + addr(&gCtx1) + " != 0"}));
}

TEST(AlertRegisterSets, HexstringIsLowerCaseTwoDigitsPerByte)
{
    AlertRegister r(recordA, nullptr, 1);
    EXPECT_EQ(r.hexstring(""), "");
    EXPECT_EQ(r.hexstring(std::string("\x00\x0a\xa0\xff\x5c", 5)), "000aa0ff5c");
}

// ---------------------------------------------------------------------------
// Filtering a batch
// ---------------------------------------------------------------------------

TEST_F(AlertRegisterFilters, ClientRegisterTakesNothingFromManagementBatches)
{
    AlertRegister r(recordA, &gCtx1, 1);
    r.add(recordA, ST::CPU);
    r.add(recordA, cls(7));
    ictest::LogCapture cap;
    EXPECT_TRUE(filter(r, {alert(7, {P0})}, kMI).empty());
    EXPECT_TRUE(cap.records().empty());
    EXPECT_EQ(filter(r, {alert(7, {P0})}, kFP).size(), 1u);
}

TEST_F(AlertRegisterFilters, PlugInRegisterTakesBothKindsOfBatch)
{
    AlertRegister r(recordA, &gCtx1, 0);
    r.add(recordA, ST::CPU);
    for (unsigned int type : {kFP, kMI}) {
        auto const calls = filter(r, {alert(0, {P0})}, type);
        ASSERT_EQ(calls.size(), 1u) << type;
        ASSERT_EQ(calls[0].getAlerts().size(), 1u);
        EXPECT_EQ(calls[0].getAlerts()[0].getNodePaths(), Paths{P0});
    }
}

TEST_F(AlertRegisterFilters, NullCallbackIsLoggedAndSkipped)
{
    AlertRegister r(nullptr, &gCtx1, 0);
    r.add(nullptr, ST::CPU);
    std::vector<AlertCall> calls{AlertCall(recordB, nullptr)};
    ictest::LogCapture cap;
    EXPECT_FALSE(r.filterAlerts(store, {alert(0, {P0})}, calls, kFP));
    EXPECT_EQ(calls.size(), 1u);
    expectEvent(cap, "filterAlerts: Alert Register has null callback address", 6000,
                "filterAlerts");
    EXPECT_EQ(cap.logs().size(), 1u);
}

TEST_F(AlertRegisterFilters, ClientRegisterWithNullCallbackIsSilentForManagementBatches)
{
    AlertRegister r(nullptr, &gCtx1, 1);
    r.add(nullptr, ST::CPU);
    ictest::LogCapture cap;
    EXPECT_TRUE(filter(r, {alert(0, {P0})}, kMI).empty());
    EXPECT_TRUE(cap.records().empty());
}

TEST_F(AlertRegisterFilters, CallCarriesTheRegistersCallbackAndContext)
{
    AlertRegister r(recordB, &gCtx2, 0);
    r.add(recordB, ST::Fan);
    std::vector<AlertCall> calls{AlertCall(recordA, &gCtx1)};
    r.filterAlerts(store, {alert(0, {PF})}, calls, kFP);
    ASSERT_EQ(calls.size(), 2u) << "appended after what the vector held";
    EXPECT_EQ(calls[0].getCallback(), &recordA);
    EXPECT_EQ(calls[1].getCallback(), &recordB);
    EXPECT_EQ(calls[1].getContext(), &gCtx2);
}

TEST_F(AlertRegisterFilters, ClassMatchTakesEveryPathWithoutLookingThemUp)
{
    AlertRegister r(recordA, &gCtx1, 1);
    r.add(recordA, cls(8));
    Alert const in = alert(8, {PF, unknown, P0}, 5, "all", 9);
    ictest::LogCapture cap;
    auto const calls = filter(r, {in}, kFP);
    ASSERT_EQ(calls.size(), 1u);
    ASSERT_EQ(calls[0].getAlerts().size(), 1u);
    Alert const& out = calls[0].getAlerts()[0];
    EXPECT_EQ(out.getNodePaths(), (Paths{PF, unknown, P0}));
    EXPECT_EQ(out.getClass(), cls(8));
    EXPECT_EQ(out.getStatus(), 5u);
    EXPECT_EQ(out.getSeverity(), 9);
    EXPECT_EQ(out.getMessage(), "all");
    EXPECT_EQ(countPrefix(cap, "filterAlerts: could not find"), 0u);
}

TEST_F(AlertRegisterFilters, PathAndSensorMatchesKeepOnlyMatchingPathsInAlertOrder)
{
    AlertRegister r(recordA, &gCtx1, 1);
    r.add(recordA, Paths{P1});
    r.add(recordA, ST::Fan);
    Alert const in = alert(0, {PF, P0, P1}, 2, "mixed", 4);
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
    auto const calls = filter(r, {in}, kFP);
    ASSERT_EQ(calls.size(), 1u);
    ASSERT_EQ(calls[0].getAlerts().size(), 1u);
    Alert const& out = calls[0].getAlerts()[0];
    EXPECT_EQ(out.getNodePaths(), (Paths{PF, P1}));
    EXPECT_EQ(out.getMessage(), "mixed");
    EXPECT_EQ(out.getSeverity(), 4);
    EXPECT_EQ(out.getStatus(), 2u);
    EXPECT_GT(out.getTimeStamp(), in.getTimeStamp()) << "the copy is a new alert";
}

TEST_F(AlertRegisterFilters, RegisteredPathMatchesEvenWhenTheStoreDoesNotKnowIt)
{
    AlertRegister r(recordA, &gCtx1, 0);
    r.add(recordA, Paths{unknown});
    ictest::LogCapture cap;
    auto const calls = filter(r, {alert(0, {unknown})}, kFP);
    ASSERT_EQ(calls.size(), 1u);
    ASSERT_EQ(calls[0].getAlerts().size(), 1u);
    EXPECT_EQ(calls[0].getAlerts()[0].getNodePaths(), Paths{unknown});
    EXPECT_EQ(countPrefix(cap, "filterAlerts: could not find"), 0u);
}

TEST_F(AlertRegisterFilters, UnknownPathIsLoggedAndSkippedEvenForSensor74)
{
    AlertRegister r(recordA, &gCtx1, 1);
    r.add(recordA, ST::invalid);
    r.add(recordA, ST::CPU);
    ictest::LogCapture cap;
    auto const calls = filter(r, {alert(0, {unknown, P0})}, kFP);
    expectEvent(cap,
                "filterAlerts: could not find nodepath for NodePath=" + hex(unknown) +
                    " Sensor Class=74",
                6000, "filterAlerts");
    ASSERT_EQ(calls.size(), 1u);
    ASSERT_EQ(calls[0].getAlerts().size(), 1u);
    EXPECT_EQ(calls[0].getAlerts()[0].getNodePaths(), Paths{P0});

    auto const none = filter(r, {alert(0, {unknown})}, kFP);
    ASSERT_EQ(none.size(), 1u) << "the call is made even without alerts";
    EXPECT_TRUE(none[0].getAlerts().empty());
}

TEST_F(AlertRegisterFilters, NonMatchingBatchStillGivesOneEmptyCall)
{
    AlertRegister r(recordA, &gCtx1, 0);
    r.add(recordA, ST::CPU);
    r.add(recordA, cls(2));
    auto const calls = filter(r, {alert(0, {PF}), alert(2, {})}, kFP);
    ASSERT_EQ(calls.size(), 1u);
    EXPECT_TRUE(calls[0].getAlerts().empty()) << "a class match without paths adds nothing";
}

TEST_F(AlertRegisterFilters, AlertsOfOneBatchKeepTheirOrderInOneCall)
{
    AlertRegister r(recordA, &gCtx1, 0);
    r.add(recordA, ST::CPU);
    auto const calls =
        filter(r, {alert(0, {P1}, 2, "first"), alert(0, {PF}, 2, "skipped"),
                   alert(0, {P0}, 2, "second"), alert(0, {P0, P1}, 2, "third")},
               kFP);
    ASSERT_EQ(calls.size(), 1u);
    auto const& got = calls[0].getAlerts();
    ASSERT_EQ(got.size(), 3u);
    EXPECT_EQ(got[0].getMessage(), "first");
    EXPECT_EQ(got[1].getMessage(), "second");
    EXPECT_EQ(got[2].getMessage(), "third");
    EXPECT_EQ(got[2].getNodePaths(), (Paths{P0, P1}));
}

TEST_F(AlertRegisterFilters, EachInputIsLoggedAndEachTakenAlertAsItCameIn)
{
    AlertRegister r(recordA, &gCtx1, 0);
    r.add(recordA, Paths{P0});
    Alert const taken = alert(0, {P0, P1}, 2, "taken");
    Alert const left = alert(0, {PF}, 2, "left");
    ictest::LogCapture cap;
    filter(r, {taken, left}, kFP);
    std::string const in = "AlertRegister::filterAlerts Input Alert=";
    std::string const out = "AlertRegister::filterAlerts output Alert=";
    EXPECT_EQ(cap.messages(),
              (std::vector<std::string>{in + static_cast<std::string>(taken),
                                        out + static_cast<std::string>(taken),
                                        in + static_cast<std::string>(left)}));
    for (auto const& rec : cap.logs()) {
        EXPECT_EQ(rec.level, 3000);
        EXPECT_EQ(rec.logger, kLogger);
        EXPECT_EQ(rec.function, "filterAlerts");
    }
}

// ---------------------------------------------------------------------------
// One pending delivery
// ---------------------------------------------------------------------------

TEST_F(AlertCallTest, StartsEmptyAndAddsRestrictedCopies)
{
    AlertCall call(recordA, &gCtx1);
    EXPECT_EQ(call.getCallback(), &recordA);
    EXPECT_EQ(call.getContext(), &gCtx1);
    EXPECT_TRUE(call.getAlerts().empty());

    Alert const in = alert(5, {P0, P1, PF}, 3, "source", 7);
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
    Paths only{PF, P0};
    call.add(in, only);
    ASSERT_EQ(call.getAlerts().size(), 1u);
    Alert const& out = call.getAlerts()[0];
    EXPECT_EQ(out.getNodePaths(), (Paths{PF, P0}));
    EXPECT_EQ(out.getSeverity(), 7);
    EXPECT_EQ(out.getClass(), cls(5));
    EXPECT_EQ(out.getStatus(), 3u);
    EXPECT_EQ(out.getMessage(), "source");
    EXPECT_GT(out.getTimeStamp(), in.getTimeStamp());
}

TEST_F(AlertCallTest, CallBackRecordsFirstThenDelivers)
{
    IC::AlertStore local;
    gWatched = &local;
    AlertCall call(recordA, &gCtx2);
    Paths a{P0}, b{PF};
    call.add(alert(0, {P0}, 2, "one"), a);
    call.add(alert(0, {PF}, 0, "two"), b);
    call.callBack(local, kFP);

    ASSERT_EQ(gDeliveries.size(), 1u);
    EXPECT_EQ(gDeliveries[0].context, &gCtx2);
    EXPECT_EQ(gDeliveries[0].storedAtCall, 2u) << "the store is updated before the call";
    ASSERT_EQ(gDeliveries[0].alerts.size(), 2u);
    EXPECT_EQ(gDeliveries[0].alerts[0].getMessage(), "one");
    EXPECT_EQ(gDeliveries[0].alerts[1].getMessage(), "two");
    EXPECT_EQ(gDeliveries[0].alerts[0].getTimeStamp(), call.getAlerts()[0].getTimeStamp());
    std::vector<Alert> stored;
    local.getAsserted(stored);
    EXPECT_EQ(stored.size(), 2u);
}

TEST_F(AlertCallTest, ManagementBatchIsDeliveredButNotRecorded)
{
    IC::AlertStore local;
    gWatched = &local;
    AlertCall call(recordA, &gCtx1);
    Paths a{P0};
    call.add(alert(0, {P0}, 2), a);
    call.callBack(local, kMI);
    ASSERT_EQ(gDeliveries.size(), 1u);
    EXPECT_EQ(gDeliveries[0].alerts.size(), 1u);
    std::vector<Alert> stored;
    local.getAsserted(stored);
    EXPECT_TRUE(stored.empty());
}

TEST_F(AlertCallTest, CallWithoutAlertsStillCallsBackAndClearsNothing)
{
    IC::AlertStore local;
    local.newAlerts({alert(0, {P0}, 2)}, kFP);
    AlertCall call(recordB, &gCtx1);
    call.callBack(local, kFP);
    ASSERT_EQ(gDeliveries.size(), 1u);
    EXPECT_TRUE(gDeliveries[0].alerts.empty());
    EXPECT_EQ(gDeliveries[0].context, &gCtx1);
    std::vector<Alert> stored;
    local.getAsserted(stored);
    EXPECT_EQ(stored.size(), 1u);
}
