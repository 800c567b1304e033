// Tests of IC::AlertRegister (the filters of one (callback, context) pair,
// their removal codes and the filtering of a batch) and of IC::AlertCall
// (one pending delivery). What dispatch makes of them is tested with the
// library's entry points.
#include <IC/AlertRegister.h>

#include <IC/AlertStore.h>

#include "StoreSupport.h"

namespace {

using IC::Alert;
using IC::AlertRegister;
using Strings = std::vector<std::string>;
using ST = IC::Node::SensorType;

ictest::Source const kAR{"Helmgard.IC.InstrumentationControl.AlertRegister", "AlertRegister"};

Alert::ClassType cls(unsigned int n) { return static_cast<Alert::ClassType>(n); }
Alert alert(unsigned int c, Strings paths, std::string msg = "m")
{
    return Alert(3, cls(c), std::move(paths), 2, std::move(msg));
}

// Each call: its context, and how many alerts the watched store held then.
std::vector<std::pair<void const*, std::size_t>> gCalls;
IC::AlertStore gWatched;

IC::Error recordA(std::vector<Alert> const&, void const* context)
{
    std::vector<Alert> now;
    gWatched.getAsserted(now);
    gCalls.emplace_back(context, now.size());
    return IC::Error(1, IC::Number(IC::Number::Generic), "ignored by the library");
}
IC::Error recordB(std::vector<Alert> const& alerts, void const* context) { return recordA(alerts, context); }

int gCtx = 2;

TEST(AlertRegisterSets, AddKeepsEachValueOnceAndDelTellsWhatIsLeftOrRefusesAnotherCallback)
{
    AlertRegister r(recordA, &gCtx, 1);
    EXPECT_TRUE(r.add(recordA, ST::CPU) && r.add(recordB, cls(6)) && r.add(nullptr, Strings{"b", "a"}));
    std::string const head = "del: " + ictest::ptrText(&r) + " Callback mismatch: ", ctx = ictest::ptrText(&gCtx);
    ictest::LogCapture cap;
    EXPECT_EQ((std::vector<int>{r.del(recordB, ST::CPU), r.del(nullptr, cls(6)), r.del(recordB, Strings{"a"})}),
              (std::vector<int>{2, 2, 2}));
    // The path form writes its pieces in another order.
    EXPECT_EQ(cap.messages(),
              (Strings{head + "1 != 1 p=" + ctx, head + "0 != 1 p=" + ctx, head + "1 p=" + ctx + " != 1"}));
    for (auto const& m : cap.messages())
        ictest::expectEvent(cap, kAR, m, 6000, "del");
    cap.clear();
    EXPECT_EQ((std::vector<int>{r.del(recordA, ST::Fan), r.del(recordA, ST::CPU), r.del(recordA, cls(3)),
                                r.del(recordA, cls(6)), r.del(recordA, Strings{"a", "zz"}), r.del(recordA, Strings{})}),
              (std::vector<int>{0, 0, 0, 0, 0, 0}));
    EXPECT_TRUE(!r.testClean() && r.getCallback() == &recordA && cap.records().empty());
    EXPECT_EQ(r.del(recordA, Strings{"b"}), 1);
    EXPECT_EQ(r.getCallback(), nullptr) << "an emptied register drops its callback";
    EXPECT_EQ(r.del(recordA, ST::CPU), 2);
    AlertRegister bySensor(recordA, &gCtx, 1), byClass(recordA, &gCtx, 1);
    EXPECT_EQ(bySensor.del(recordA, ST::Fan) + byClass.del(recordA, cls(1)), 2);
}

// ROOT <- CPU 0, CPU 1, Fan 0 in a store of the test's own.
class AlertRegisterFilters : public testing::Test {
protected:
    // What r takes from the batch, as alert signatures; "<n calls>" unless it
    // appends exactly one call, to r's callback and context.
    Strings take(AlertRegister& r, std::vector<Alert> const& batch, unsigned int type = IC::FP_ALERT)
    {
        std::vector<IC::AlertCall> calls{IC::AlertCall(recordB, nullptr)};
        EXPECT_FALSE(r.filterAlerts(store, batch, calls, type));
        if (calls.size() != 2 || calls[1].getCallback() != r.getCallback() || calls[1].getContext() != &gCtx)
            return {"<" + std::to_string(calls.size() - 1) + " calls>"};
        return ictest::sigs(calls[1].getAlerts());
    }
    IC::NodeStore store;
    ictest::NodeTree tree{store, 2, 1};
    std::string const P0 = tree.cpu[0], P1 = tree.cpu[1], PF = tree.fan[0], unknown{"\x7e\x7f\x01"};
    std::string const h0 = ictest::hex(P0) + ",", h1 = ictest::hex(P1) + ",", hf = ictest::hex(PF) + ",",
                      hu = ictest::hex(unknown) + ",";
};

TEST_F(AlertRegisterFilters, EachAlertIsCopiedWithTheMatchingPaths)
{
    AlertRegister r(recordB, &gCtx, 1), client(recordA, &gCtx, 1), null(nullptr, &gCtx, 0);
    r.add(recordB, cls(8));
    r.add(recordB, Strings{P1});
    r.add(recordB, ST::Fan);
    // A class match takes every path, known or not; the others the paths they match.
    EXPECT_EQ(take(r, {alert(8, {PF, unknown, P0}, "all"), alert(0, {P0}), alert(0, {PF, P0, P1}, "mixed")}),
              (Strings{"3/8/2/all/" + hf + hu + h0, "3/0/2/mixed/" + hf + h1}));
    EXPECT_EQ(take(r, {alert(0, {P0}), alert(8, {})}), Strings{}) << "the call is made all the same";
    client.add(recordA, ST::CPU);
    null.add(nullptr, ST::CPU);
    EXPECT_EQ(take(client, {alert(0, {P0})}, IC::MI_ALERT), Strings{"<0 calls>"}) << "clients take no management batch";
    ictest::LogCapture cap;
    EXPECT_EQ(take(null, {alert(0, {P0})}), Strings{"<0 calls>"});
    ictest::expectEvent(cap, kAR, "filterAlerts: Alert Register has null callback address", 6000, "filterAlerts");
    // Sensor types skip an unknown path with an error.
    cap.clear();
    EXPECT_EQ(take(client, {alert(0, {unknown, P0})}), Strings{"3/0/2/m/" + h0});
    ictest::expectEvent(cap, kAR, "filterAlerts: could not find nodepath for NodePath=7e7f01 Sensor Class=74", 6000,
                        "filterAlerts");
}

TEST_F(AlertRegisterFilters, PathsAloneTakeTheSameLoggedOrNotAndLoggingShowsEachInputAndOutput)
{
    // A path held matches even when the store does not know it.
    AlertRegister byPath(recordA, &gCtx, 0);
    byPath.add(recordA, Strings{P0, PF, unknown});
    Alert const one = alert(0, {P1, PF, P0}, "one"), none = alert(0, {P1}, "none");
    Strings const want{"3/0/2/one/" + hf + h0, "3/0/2/two/" + h0};
    EXPECT_EQ(take(byPath, {one, none, alert(0, {P0}, "two")}), want);
    ictest::LogCapture cap;
    EXPECT_EQ(take(byPath, {one, none, alert(0, {P0}, "two")}), want);
    EXPECT_EQ(take(byPath, {alert(0, {unknown})}), Strings{"3/0/2/m/" + hu});
    cap.clear();
    take(byPath, {one, none});
    std::string const in = "AlertRegister::filterAlerts Input Alert=";
    std::string const out = "AlertRegister::filterAlerts output Alert=";
    EXPECT_EQ(cap.messages(), (Strings{in + std::string(one), out + std::string(one), in + std::string(none)}));
    for (auto const& m : cap.messages())
        ictest::expectEvent(cap, kAR, m, 3000, "filterAlerts");
}

TEST_F(AlertRegisterFilters, ACallCopiesTheAlertsAndRecordsPlugInBatchesBeforeDelivering)
{
    IC::AlertCall call(recordA, &gCtx);
    Alert const in(7, cls(5), {P0, P1, PF}, 3, "one");
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
    Strings some{PF, P0};
    call.add(in, some);
    EXPECT_EQ(ictest::sigs(call.getAlerts()), Strings{"7/5/3/one/" + hf + h0});
    EXPECT_GT(call.getAlerts()[0].getTimeStamp(), in.getTimeStamp()) << "the copy is a new alert";
    gCalls.clear();
    call.callBack(gWatched, IC::MI_ALERT);
    call.callBack(gWatched, IC::FP_ALERT);
    IC::AlertCall(recordB, nullptr).callBack(gWatched, IC::FP_ALERT);
    // Management batches are not recorded; the store is updated before the call.
    EXPECT_EQ(gCalls, (std::vector<std::pair<void const*, std::size_t>>{{&gCtx, 0}, {&gCtx, 2}, {nullptr, 2}}));
    gWatched.clear();
}

} // namespace
