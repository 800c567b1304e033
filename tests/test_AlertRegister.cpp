// Tests of IC::AlertRegister (the filters of one (callback, context) pair,
// their removal codes and the filtering of a batch) and of IC::AlertCall
// (one pending delivery). What dispatch makes of them is tested with the
// library's entry points.
#include <IC/AlertRegister.h>

#include <IC/AlertStore.h>

#include "StoreSupport.h"

namespace {

using IC::Alert;
using IC::AlertCall;
using IC::AlertRegister;
using Paths = std::vector<std::string>;
using Strings = std::vector<std::string>;
using ST = IC::Node::SensorType;

ictest::Source const kAR{"Helmgard.IC.InstrumentationControl.AlertRegister", "AlertRegister"};
constexpr unsigned int kFP = 0;
constexpr unsigned int kMI = 1;

Alert::ClassType cls(unsigned int n) { return static_cast<Alert::ClassType>(n); }
Alert alert(unsigned int c, Paths paths, unsigned int status = 2, std::string msg = "m", unsigned char sev = 3)
{
    return Alert(sev, cls(c), std::move(paths), status, std::move(msg));
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
    std::vector<Alert> now;
    if (gWatched)
        gWatched->getAsserted(now);
    gDeliveries.push_back({context, alerts, now.size()});
    return IC::Error(1, IC::Number(IC::Number::Generic), "ignored by the library");
}
IC::Error recordB(std::vector<Alert> const& alerts, void const* context) { return recordA(alerts, context); }

int gCtx1 = 1, gCtx2 = 2;

// ---------------------------------------------------------------------------
// Building up and tearing down a register
// ---------------------------------------------------------------------------

TEST(AlertRegisterSets, AddInsertsOnceWithoutComparingTheCallback)
{
    AlertRegister r(recordA, &gCtx1, 1);
    EXPECT_TRUE(r.getCallback() == &recordA && r.getContext() == &gCtx1 && r.getRegType() == 1u);
    EXPECT_EQ(AlertRegister(recordB, nullptr, 0).getRegType(), 0u);
    EXPECT_TRUE(r.getClasses().empty() && r.getSensorTypes().empty() && r.getNodePaths().empty());
    for (IC::AlertCallBack cb : {&recordA, &recordB, static_cast<IC::AlertCallBack>(nullptr)})
        EXPECT_TRUE(r.add(cb, ST::CPU) && r.add(cb, cls(5)) && r.add(cb, Paths{"b", "a", "b"}) && r.add(cb, Paths{}));
    EXPECT_EQ(r.getSensorTypes(), std::set<ST>{ST::CPU});
    EXPECT_EQ(r.getClasses(), std::set<Alert::ClassType>{cls(5)});
    EXPECT_EQ(r.getNodePaths(), (std::set<std::string>{"a", "b"}));
    EXPECT_EQ(r.getCallback(), &recordA);
    EXPECT_EQ(r.hexstring(std::string("\x00\x0a\xa0\xff\x5c", 5)) + r.hexstring(""), "000aa0ff5c");

    // testClean only succeeds when all three sets are empty, and then drops
    // the callback.
    AlertRegister bySensor(recordA, &gCtx1, 1), byClass(recordA, &gCtx1, 1), byPath(recordA, &gCtx1, 1),
        empty(recordA, &gCtx1, 1);
    bySensor.add(recordA, ST::CPU);
    byClass.add(recordA, cls(0));
    byPath.add(recordA, Paths{"x"});
    for (AlertRegister* h : {&bySensor, &byClass, &byPath})
        EXPECT_TRUE(!h->testClean() && h->getCallback() == &recordA);
    EXPECT_TRUE(empty.testClean() && empty.testClean());
    EXPECT_EQ(empty.getCallback(), nullptr);
}

TEST(AlertRegisterDel, RemovalReportsWhetherAnythingIsLeft)
{
    AlertRegister r(recordA, &gCtx1, 1);
    r.add(recordA, ST::CPU);
    r.add(recordA, ST::Fan);
    r.add(recordA, cls(2));
    r.add(recordA, Paths{"a", "b", "c"});
    ictest::LogCapture cap;
    EXPECT_EQ(r.del(recordA, ST::CPU), 0);
    EXPECT_EQ(r.getSensorTypes(), std::set<ST>{ST::Fan});
    // Values never registered, and an empty path list, remove nothing.
    EXPECT_EQ(r.del(recordA, ST::PowerSupply) + r.del(recordA, cls(3)) + r.del(recordA, Paths{}), 0);
    EXPECT_EQ(r.del(recordA, Paths{"a", "c", "zz"}), 0);
    EXPECT_EQ(r.getNodePaths(), std::set<std::string>{"b"});
    EXPECT_EQ(r.del(recordA, ST::Fan), 0);
    EXPECT_EQ(r.del(recordA, cls(2)), 0) << "a path is still held";
    EXPECT_EQ(r.getCallback(), &recordA);
    EXPECT_EQ(r.del(recordA, Paths{"b"}), 1);
    EXPECT_EQ(r.getCallback(), nullptr) << "an emptied register drops its callback";
    EXPECT_TRUE(cap.records().empty()) << "successful removals log nothing";
    for (int form = 0; form < 3; ++form) {
        AlertRegister empty(recordA, &gCtx1, 1), holdsClass(recordA, &gCtx1, 1);
        holdsClass.add(recordA, cls(1));
        EXPECT_EQ(form == 0   ? empty.del(recordA, ST::Fan)
                  : form == 1 ? empty.del(recordA, cls(1)) : empty.del(recordA, Paths{}),
                  1);
        EXPECT_EQ(form == 0 ? holdsClass.del(recordA, ST::Fan)
                            : form == 1 ? holdsClass.del(recordA, cls(3)) : holdsClass.del(recordA, Paths{}),
                  0);
        EXPECT_TRUE(empty.getCallback() == nullptr && holdsClass.getClasses().size() == 1u) << form;
    }
}

TEST(AlertRegisterDel, AnotherCallbackIsRefusedAndLogged)
{
    AlertRegister r(recordA, &gCtx2, 1);
    r.add(recordA, ST::CPU);
    r.add(recordA, cls(6));
    r.add(recordA, Paths{"p"});
    std::string const head = "del: " + ictest::ptrText(&r) + " Callback mismatch: ";
    std::string const ctx = ictest::ptrText(&gCtx2);
    ictest::LogCapture cap;
    EXPECT_EQ(r.del(recordB, ST::CPU), 2);
    ictest::expectEvent(cap, kAR, head + "1 != 1 p=" + ctx, 6000, "del");
    EXPECT_EQ(r.del(nullptr, cls(6)), 2);
    ictest::expectEvent(cap, kAR, head + "0 != 1 p=" + ctx, 6000, "del");
    // The path form writes its pieces in another order.
    EXPECT_EQ(r.del(recordB, Paths{"p"}), 2);
    ictest::expectEvent(cap, kAR, head + "1 p=" + ctx + " != 1", 6000, "del");
    EXPECT_EQ(r.getSensorTypes().size() + r.getClasses().size() + r.getNodePaths().size(), 3u);
    EXPECT_EQ(r.getCallback(), &recordA);
    // An emptied register refuses its former callback.
    ASSERT_EQ(r.del(recordA, ST::CPU) + r.del(recordA, cls(6)) + r.del(recordA, Paths{"p"}), 1);
    cap.clear();
    EXPECT_EQ(r.del(recordA, ST::CPU) + r.del(recordA, Paths{"p"}), 4);
    EXPECT_EQ(cap.messages(), (Strings{head + "1 != 0 p=" + ctx, head + "1 p=" + ctx + " != 0"}));
}

// ---------------------------------------------------------------------------
// Filtering a batch, and delivering it
// ---------------------------------------------------------------------------

// A small tree: ROOT <- CPU 0, CPU 1, Fan 0, in a store of the test's own.
class AlertRegisterFilters : public testing::Test {
protected:
    void SetUp() override
    {
        gDeliveries.clear();
        gWatched = nullptr;
    }
    // Filters one batch through r; expects false and returns the calls added.
    std::vector<AlertCall> filter(AlertRegister& r, std::vector<Alert> const& batch, unsigned int type)
    {
        std::vector<AlertCall> calls;
        EXPECT_FALSE(r.filterAlerts(store, batch, calls, type));
        return calls;
    }
    IC::NodeStore store;
    ictest::NodeTree tree{store, 2, 1};
    std::string const P0 = tree.cpu[0], P1 = tree.cpu[1], PF = tree.fan[0];
    std::string const unknown = std::string("\x7e\x7f\x01", 3);
};

TEST_F(AlertRegisterFilters, ClientRegistersTakeNothingFromManagementBatches)
{
    AlertRegister client(recordA, &gCtx1, 1), plugIn(recordA, &gCtx1, 0), nullClient(nullptr, &gCtx1, 1);
    for (AlertRegister* r : {&client, &plugIn, &nullClient})
        r->add(recordA, ST::CPU);
    ictest::LogCapture cap;
    EXPECT_TRUE(filter(client, {alert(7, {P0})}, kMI).empty());
    EXPECT_TRUE(filter(nullClient, {alert(0, {P0})}, kMI).empty());
    EXPECT_TRUE(cap.records().empty());
    for (unsigned int type : {kFP, kMI})
        EXPECT_EQ(ictest::sigs(filter(plugIn, {alert(0, {P0})}, type).at(0).getAlerts()),
                  Strings{"3/0/2/m/" + ictest::hex(P0) + ","});
    EXPECT_EQ(filter(client, {alert(7, {P0})}, kFP).size(), 1u);

    // A register without a callback is logged and skipped.
    AlertRegister null(nullptr, &gCtx1, 0);
    null.add(nullptr, ST::CPU);
    std::vector<AlertCall> calls{AlertCall(recordB, nullptr)};
    cap.clear();
    EXPECT_FALSE(null.filterAlerts(store, {alert(0, {P0})}, calls, kFP));
    EXPECT_EQ(calls.size(), 1u);
    ictest::expectEvent(cap, kAR, "filterAlerts: Alert Register has null callback address", 6000, "filterAlerts");
    EXPECT_EQ(cap.logs().size(), 1u);
}

TEST_F(AlertRegisterFilters, EachAlertIsCopiedWithTheMatchingPathsInOneAppendedCall)
{
    AlertRegister r(recordB, &gCtx2, 1);
    r.add(recordB, cls(8));
    r.add(recordB, Paths{P1});
    r.add(recordB, ST::Fan);
    Alert const all = alert(8, {PF, unknown, P0}, 5, "all", 9), mixed = alert(0, {PF, P0, P1}, 2, "mixed", 4);
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
    std::vector<AlertCall> calls{AlertCall(recordA, &gCtx1)};
    r.filterAlerts(store, {all, alert(0, {P0}), mixed}, calls, kFP);
    ASSERT_EQ(calls.size(), 2u) << "appended after what the vector held";
    EXPECT_TRUE(calls[0].getCallback() == &recordA && calls[1].getCallback() == &recordB);
    EXPECT_EQ(calls[1].getContext(), &gCtx2);
    // A class match takes every path without looking it up.
    std::string const h0 = ictest::hex(P0), h1 = ictest::hex(P1), hf = ictest::hex(PF);
    EXPECT_EQ(ictest::sigs(calls[1].getAlerts()),
              (Strings{"9/8/5/all/" + hf + "," + ictest::hex(unknown) + "," + h0 + ",",
                       "4/0/2/mixed/" + hf + "," + h1 + ","}));
    EXPECT_GT(calls[1].getAlerts()[1].getTimeStamp(), mixed.getTimeStamp()) << "the copy is a new alert";

    // A register of paths alone takes the same whether or not its lines are
    // logged, and a path it holds matches even when the store does not know
    // it.
    AlertRegister byPath(recordA, &gCtx1, 0);
    byPath.add(recordA, Paths{P0, PF});
    std::vector<Alert> const batch{alert(0, {P1, PF, P0}, 2, "one"), alert(0, {P1}, 2, "none"),
                                   alert(0, {P0}, 2, "two")};
    Strings const want{"3/0/2/one/" + hf + "," + h0 + ",", "3/0/2/two/" + h0 + ","};
    EXPECT_EQ(ictest::sigs(filter(byPath, batch, kFP).at(0).getAlerts()), want);
    ictest::LogCapture cap;
    EXPECT_EQ(ictest::sigs(filter(byPath, batch, kFP).at(0).getAlerts()), want);
    byPath.add(recordA, Paths{unknown});
    cap.clear();
    EXPECT_EQ(filter(byPath, {alert(0, {unknown})}, kFP).at(0).getAlerts().size(), 1u);
    for (auto const& l : cap.logs())
        EXPECT_EQ(l.level, 3000) << l.message;
    // Without a match, and for a class match without paths, the call is
    // still made, without alerts.
    EXPECT_TRUE(filter(r, {alert(0, {P0}), alert(8, {})}, kFP).at(0).getAlerts().empty());
}

TEST_F(AlertRegisterFilters, EachInputIsLoggedAndEachTakenAlertAsItCameIn)
{
    AlertRegister r(recordA, &gCtx1, 0);
    r.add(recordA, ST::CPU);
    Alert const first = alert(0, {P1, PF}, 2, "first"), skipped = alert(0, {PF}, 2, "skipped"),
                second = alert(0, {P0}, 2, "second");
    ictest::LogCapture cap;
    auto const calls = filter(r, {first, skipped, second}, kFP);
    ASSERT_EQ(calls.size(), 1u);
    std::string const in = "AlertRegister::filterAlerts Input Alert=";
    std::string const out = "AlertRegister::filterAlerts output Alert=";
    auto text = [](Alert const& a) { return static_cast<std::string>(a); };
    EXPECT_EQ(cap.messages(), (Strings{in + text(first), out + text(first), in + text(skipped), in + text(second),
                                       out + text(second)}));
    ictest::expectEvent(cap, kAR, in + text(skipped), 3000, "filterAlerts");
    ictest::expectEvent(cap, kAR, out + text(second), 3000, "filterAlerts");
}

TEST_F(AlertRegisterFilters, ACallAddsRestrictedCopiesAndRecordsPlugInBatchesBeforeDelivering)
{
    IC::AlertStore local;
    gWatched = &local;
    AlertCall call(recordA, &gCtx2);
    EXPECT_TRUE(call.getCallback() == &recordA && call.getContext() == &gCtx2 && call.getAlerts().empty());
    Alert const in = alert(5, {P0, P1, PF}, 3, "one", 7);
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
    Paths a{PF, P0}, b{PF};
    call.add(in, a);
    call.add(alert(0, {PF}, 0, "two"), b);
    EXPECT_EQ(ictest::sigs(call.getAlerts()), (Strings{"7/5/3/one/" + ictest::hex(PF) + "," + ictest::hex(P0) + ",",
                                                       "3/0/0/two/" + ictest::hex(PF) + ","}));
    EXPECT_GT(call.getAlerts()[0].getTimeStamp(), in.getTimeStamp());
    call.callBack(local, kMI);
    call.callBack(local, kFP);
    AlertCall(recordB, &gCtx1).callBack(local, kFP);
    gWatched = nullptr;
    ASSERT_EQ(gDeliveries.size(), 3u);
    EXPECT_EQ(gDeliveries[0].storedAtCall, 0u) << "a management batch is not recorded";
    EXPECT_EQ(gDeliveries[1].storedAtCall, 2u) << "the store is updated before the call";
    EXPECT_EQ(gDeliveries[1].context, &gCtx2);
    EXPECT_EQ(ictest::sigs(gDeliveries[1].alerts), ictest::sigs(call.getAlerts()));
    EXPECT_EQ(gDeliveries[1].alerts[0].getTimeStamp(), call.getAlerts()[0].getTimeStamp());
    // A call without alerts still calls back and clears nothing.
    EXPECT_TRUE(gDeliveries[2].alerts.empty());
    EXPECT_EQ(gDeliveries[2].context, &gCtx1);
    EXPECT_EQ(gDeliveries[2].storedAtCall, 2u);
}

} // namespace
