// IC::AlertRegister (the filtering of a batch by the filters of one
// (callback, context) pair) and IC::AlertCall (one pending delivery).
// Adding and removing filters is tested through the entry points.
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
Alert alert(unsigned int c, Strings paths, std::string msg = "m") { return Alert(3, cls(c), std::move(paths), 2, std::move(msg)); }

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

// A class match takes every path, known or not; a path held matches even
// when the store does not know it; a sensor type skips an unknown path.
// Clients take nothing from a management batch; no callback, no call.
TEST_F(AlertRegisterFilters, EachAlertIsCopiedWithTheMatchingPaths)
{
    AlertRegister r(recordB, &gCtx, 1), client(recordA, &gCtx, 1), null(nullptr, &gCtx, 0), byPath(recordA, &gCtx, 0);
    r.add(recordB, cls(8));
    r.add(recordB, Strings{P1});
    r.add(recordB, ST::Fan);
    client.add(recordA, ST::CPU);
    null.add(nullptr, ST::CPU);
    byPath.add(recordA, Strings{P0, PF, unknown});
    struct Row {
        AlertRegister* reg;
        std::vector<Alert> batch;
        Strings taken;
        unsigned int type = IC::FP_ALERT;
    } const rows[] = {
        {&r, {alert(8, {PF, unknown, P0}, "all"), alert(0, {P0}), alert(0, {PF, P0, P1}, "mixed")},
         {"3/8/2/all/" + hf + hu + h0, "3/0/2/mixed/" + hf + h1}},
        {&r, {alert(0, {P0}), alert(8, {})}, {}}, // the call is made all the same
        {&client, {alert(0, {P0})}, {"<0 calls>"}, IC::MI_ALERT},
        {&null, {alert(0, {P0})}, {"<0 calls>"}},
        {&client, {alert(0, {unknown, P0})}, {"3/0/2/m/" + h0}},
        {&byPath, {alert(0, {P1, PF, P0}, "one"), alert(0, {P1}), alert(0, {unknown})}, {"3/0/2/one/" + hf + h0, "3/0/2/m/" + hu}}};
    for (auto const& row : rows)
        EXPECT_EQ(take(*row.reg, row.batch, row.type), row.taken);
    ictest::LogCapture cap;
    take(client, {alert(0, {unknown})});
    EXPECT_EQ(cap.count(kAR.logger, 6000, "filterAlerts: could not find nodepath for NodePath=7e7f01 Sensor Class=74"), 1u);
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
