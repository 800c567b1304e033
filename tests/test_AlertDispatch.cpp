// Tests of the alert entry points of the library: dispatch of batches raised
// by plug-ins, the registration calls and their indexes, and the simple-alert
// adapter. All of it works on the library's global state, which every test
// resets.
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include "StoreSupport.h"

#include <cstdint>
#include <memory>

namespace {

namespace ICC = IC::InstCtrl;
using IC::Alert;
using namespace ictest;
using Strings = std::vector<std::string>;
using Paths = Strings;
using Keys = std::multiset<std::string>;
using ST = IC::Node::SensorType;
std::string const kLogger = "Helmgard.IC.InstrumentationControl";

Alert::ClassType cls(unsigned int n) { return static_cast<Alert::ClassType>(n); }
Alert alert(unsigned int c, Paths paths, std::string msg = "m", unsigned int status = 2)
{
    return Alert(3, cls(c), std::move(paths), status, std::move(msg));
}
void const* slot(std::uintptr_t n) { return reinterpret_cast<void const*>(n); }

// The keys of all three indexes: "sensor 4", "class 6", "path <hex>".
Keys indexed()
{
    Keys out;
    for (auto const& kv : ICC::sensortypeTOalertregister)
        out.insert("sensor " + std::to_string(kv.first));
    for (auto const& kv : ICC::classtypeTOalertregister)
        out.insert("class " + std::to_string(kv.first));
    for (auto const& kv : ICC::nodepathTOalertregister)
        out.insert("path " + hex(kv.first));
    return out;
}

// Every delivery, in call order: the context (an int) and the signatures of
// the alerts, concatenated.
using Deliveries = std::vector<std::pair<int, std::string>>;
Deliveries gDeliveries;
std::function<void(void const*)> gHook;

IC::Error recA(std::vector<Alert> const& alerts, void const* ctx)
{
    gDeliveries.emplace_back(*static_cast<int const*>(ctx), "");
    for (auto const& a : alerts)
        gDeliveries.back().second += ictest::sig(a);
    if (gHook)
        gHook(ctx);
    return IC::Error(1, IC::Number(IC::Number::Generic), "ignored");
}
IC::Error recB(std::vector<Alert> const& alerts, void const* ctx) { return recA(alerts, ctx); }

Deliveries sorted(Deliveries d)
{
    std::sort(d.begin(), d.end());
    return d;
}

// Every simple call: "context:code:path"; and the time of the last one.
Strings gSimple;
SD::DateTime gSimpleTime;
std::function<void()> gSimpleHook;

void simpleA(unsigned int code, SD::DateTime time, std::string path, void const* ctx)
{
    gSimple.push_back(std::to_string(*static_cast<int const*>(ctx)) + ":" + std::to_string(code) + ":" + hex(path));
    gSimpleTime = time;
    if (gSimpleHook)
        gSimpleHook();
}
void simpleB(unsigned int code, SD::DateTime time, std::string path, void const* ctx)
{
    simpleA(code + 100, time, path, ctx);
}

int c1 = 1, c2 = 2, c3 = 3, c4 = 4, c5 = 5, c6 = 6;

// ROOT <- CPU 0, CPU 1, CPU 2, Fan 0 in the library's node store.
class AlertsTest : public testing::Test {
protected:
    void SetUp() override
    {
        gDeliveries.clear();
        gSimple.clear();
        gHook = nullptr;
        gSimpleHook = nullptr;
    }
    // The store's list replaces what the vector held.
    Strings asserted() const
    {
        std::vector<Alert> out{alert(9, {"stale"})};
        ICC::alertstore.getAsserted(out);
        return ictest::sigs(out);
    }

    ictest::CleanAlertState clean_;
    IC::InstrumentationControl ic;
    ictest::NodeTree tree{ICC::nodestore, 3, 1};
    std::string const P0 = tree.cpu[0], P1 = tree.cpu[1], P2 = tree.cpu[2], PF = tree.fan[0];
    std::string const s0 = "3/0/2/m/" + hex(P0) + ",", s1 = "3/4/2/m/" + hex(P1) + ",";
};

using Dispatch = AlertsTest;
using Registration = AlertsTest;
using SimpleAlerts = AlertsTest;

TEST_F(Dispatch, OnlyPlugInRegistrationsSeeManagementBatchesAndEachRegisterIsCalledOnceWithItsAlertsInOrder)
{
    ICC::AlertCallBackFP({alert(0, {P0})});
    EXPECT_TRUE(asserted().empty()) << "reached no register: not recorded";
    ic.registerForAlerts(recA, ST::CPU, &c1);
    ICC::regFPsensorAlerts(recA, ST::CPU, &c2);
    ICC::registerForAlerts(recA, cls(0), &c3);
    ICC::registerForAlerts(recA, Paths{P0, P1}, &c4);
    ICC::registerForAlerts(recA, cls(2), &c4); // found under several keys, called once
    ICC::regFPAlerts(recA, Paths{P0}, &c5);
    ICC::regFPsensorAlerts(recB, ST::Fan, &c6);
    ICC::registerForAlerts(recB, cls(0), &c6); // a register keeps the kind of its first registration
    ic.registerForSimpleAlerts(simpleA, 4, &c1);
    // Every status but 1 asserts, 0 as well.
    std::vector<Alert> const batch{alert(2, {P2}, "first", 0), alert(0, {PF}, "fan"), alert(0, {P0}, "second")};
    std::string const f = "3/2/0/first/" + hex(P2) + ",", s = "3/0/2/second/" + hex(P0) + ",";
    std::string const fan = "3/0/2/fan/" + hex(PF) + ",";
    ictest::LogCapture cap;
    expectError(ICC::AlertCallBackMI(batch, &c6), 0);
    EXPECT_EQ(sorted(gDeliveries), (Deliveries{{2, f + s}, {5, s}, {6, fan + s}}));
    EXPECT_TRUE(gSimple.empty() && asserted().empty());
    gDeliveries.clear();
    expectError(ICC::AlertCallBackFP(batch), 0);
    EXPECT_EQ(sorted(gDeliveries),
              (Deliveries{{1, f + s}, {2, f + s}, {3, fan + s}, {4, f + s}, {5, s}, {6, fan + s}}));
    EXPECT_EQ(gSimple, (Strings{"1:0:" + hex(P2), "1:0:" + hex(P0)}));
    EXPECT_EQ(cap.count(kLogger + ".AlertStore", 4000, "newAlerts: Abnormal Status 2path =" + hex(P0)), 7u)
        << "recorded once per call, as a warning";
    EXPECT_EQ(asserted(), (Strings{fan, s, f})); // by path
    ICC::AlertCallBackFP({alert(0, {"\x90"}, "high")});
    EXPECT_EQ(asserted().back(), "3/0/2/high/" + hex("\x90") + ",") << "paths compare as unsigned bytes";
}

TEST_F(Dispatch, RemovalUnlistsBeforeCallbacksErasesAfterThemAndRegistersKeepThePath)
{
    ICC::registerForAlerts(recA, Paths{P1}, &c1);
    ICC::registerForAlerts(recB, Paths{P1}, &c1);
    ic.registerForAlerts(recA, ST::CPU, &c2);
    gHook = [&](void const*) {
        std::vector<IC::Node*> listed;
        ICC::nodestore.getMap(listed, ST::CPU);
        EXPECT_EQ(listed, (std::vector<IC::Node*>{tree.nodes[1].get(), tree.nodes[3].get()}));
        EXPECT_EQ(ICC::nodestore.nodePathToSensor(P1), ST::CPU) << "still found by path";
        EXPECT_EQ(ICC::nodepathTOalertregister.count(P1), 2u) << "the index is pruned afterwards";
    };
    expectError(ICC::AlertCallBackFP({alert(4, {P1}), alert(4, {P1})}), 0);
    // The sensor registration saw the path: its type was looked up first.
    EXPECT_EQ(sorted(gDeliveries), (Deliveries{{1, s1 + s1}, {1, s1 + s1}, {2, s1 + s1}}));
    EXPECT_EQ(ICC::nodestore.nodePathToSensor(P1), ST::invalid);
    EXPECT_EQ(indexed(), Keys{"sensor 4"});
    // Back again, the path is not indexed anew; deregistering it still
    // succeeds and removes the registers.
    ASSERT_TRUE(ictest::addNew(ICC::nodestore, *tree.nodes[2]));
    gHook = nullptr;
    gDeliveries.clear();
    ICC::AlertCallBackFP({alert(0, {P1})});
    EXPECT_EQ(gDeliveries.size(), 1u);
    expectError(ICC::deRegisterForAlerts(recA, Paths{P1}, &c1), 0);
    expectError(ICC::deRegisterForAlerts(recB, Paths{P1}, &c1), 0);
    EXPECT_EQ(ICC::callbacks.size(), 1u);
}

TEST_F(Dispatch, AssertsAreOnlyRecordedAndCallbacksRunWithoutTheLockSoThatTheyMayReRegister)
{
    ic.registerForAlerts(recA, ST::CPU, &c1);
    ic.registerForAlerts(recA, ST::CPU, &c2);
    expectError(ICC::AssertCallBackFP({alert(0, {P1, PF}, "asserted", 3)}), 0);
    EXPECT_TRUE(gDeliveries.empty());
    EXPECT_EQ(asserted().size(), 2u);
    bool lockFree = false;
    gHook = [&](void const* ctx) {
        lockFree = lockableFromAnotherThread(ICC::registerlock);
        expectError(ic.deRegisterForAlerts(recA, ST::CPU, ctx), 0);
        expectError(ic.registerForAlerts(recB, ST::CPU, &c3), 0);
    };
    ICC::AlertCallBackFP({alert(0, {P0})});
    EXPECT_TRUE(lockFree);
    gHook = nullptr;
    gDeliveries.clear();
    ICC::AlertCallBackFP({alert(0, {P0})});
    EXPECT_EQ(gDeliveries, (Deliveries{{3, s0}}));
}

TEST_F(Registration, EntryPointsLogTheirArgumentsOnceAndTheOtherFormsAreSilent)
{
    std::string const a = " Callback=" + ptrText(reinterpret_cast<void const*>(recA)) + " *p=" + ptrText(&c1);
    std::string const s = " Callback=" + ptrText(reinterpret_cast<void const*>(simpleA)), p = hex(P1) + " " + hex(P0) + " ";
    Paths const ps{P1, P0};
    std::pair<std::function<IC::Error()>, std::string> const rows[] = {
        {[&] { return ic.registerForAlerts(recA, ST::CPU, &c1); }, "registerForAlerts: sensor=4" + a},
        {[&] { return ic.deRegisterForAlerts(recA, ST::CPU, &c1); }, "deRegisterForAlerts: sensor 4" + a},
        {[&] { return ICC::registerForAlerts(recA, ps, &c1); }, "registerFor Alerts paths={ " + p + "}" + a},
        {[&] { return ICC::deRegisterForAlerts(recA, ps, &c1); }, "deRegisterForAlerts: Node paths={ " + p + "}" + a},
        {[&] { return ic.registerForSimpleAlerts(simpleA, 65540, &c1); },
         "registerForSimpleAlerts: Sensor=65540" + s + "*p=" + ictest::ptrText(&c1)},
        {[&] { return ic.deRegisterForSimpleAlerts(simpleA, 4, &c1); },
         "deRegisterForSimpleAlerts: sensor=4" + s + " *p=" + ictest::ptrText(&c1)}};
    for (auto const& [call, message] : rows) {
        ictest::LogCapture cap;
        expectError(call(), 0);
        EXPECT_EQ(cap.count(kLogger, 3000, message), 1u);
    }
    ictest::LogCapture cap;
    for (IC::Error const& e : {ICC::registerForAlerts(recA, cls(6), &c1), ICC::deRegisterForAlerts(recA, cls(6), &c1),
                               ICC::regFPAlerts(recB, Paths{PF}, &c3), ICC::deRegFPAlerts(recB, Paths{PF}, &c3)})
        expectError(e, 0);
    EXPECT_TRUE(cap.records().empty() && indexed().empty() && ICC::callbacks.empty() && ICC::mysam.empty());
}

TEST_F(Registration, OneRegisterPerPairIndexedOncePerKeyGoneWithItsLastFilterAndUnknownPairsRefused)
{
    for (int* c : {&c1, &c2, &c1}) {
        ic.registerForAlerts(recA, ST::Fan, c);
        ICC::registerForAlerts(recA, Paths{P0, P0}, c);
    }
    ICC::registerForAlerts(recA, cls(2), &c1);
    ICC::regFPAlerts(recB, Paths{PF}, &c3);
    ICC::registerForAlerts(recB, cls(2), &c3); // still a plug-in's register
    EXPECT_EQ(ICC::callbacks.size(), 3u);
    Keys const all{"sensor 20", "sensor 20", "path " + hex(P0), "path " + hex(P0),
                   "class 2",   "class 2",   "path " + hex(PF)};
    EXPECT_EQ(indexed(), all);
    // Unknown pairs are refused; values that a register does not hold are not.
    for (IC::Error const& e :
         {ic.deRegisterForAlerts(recA, ST::Fan, &c3), ic.deRegisterForAlerts(recB, ST::Fan, &c1),
          ICC::deRegFPsensorAlerts(recA, ST::Fan, &c4), ICC::deRegisterForAlerts(recA, cls(2), &c4),
          ICC::deRegisterForAlerts(recB, Paths{P0}, &c1), ICC::deRegFPAlerts(recA, Paths{P0}, &c3)})
        expectError(e, 1);
    for (IC::Error const& e : {ic.deRegisterForAlerts(recA, ST::CPU, &c1), ICC::deRegisterForAlerts(recA, cls(4), &c1),
                               ICC::deRegisterForAlerts(recA, Paths{P1}, &c1)})
        expectError(e, 0);
    EXPECT_EQ(indexed(), all);
    // A register goes with its last filter, and only its index entries.
    expectError(ICC::deRegisterForAlerts(recA, Paths{P0}, &c2), 0);
    expectError(ic.deRegisterForAlerts(recA, ST::Fan, &c2), 0);
    expectError(ic.deRegisterForAlerts(recA, ST::Fan, &c1), 0);
    EXPECT_EQ(ICC::callbacks.count({recA, &c2}) * 10 + ICC::callbacks.count({recA, &c1}), 1u);
    EXPECT_EQ(indexed(), (Keys{"path " + hex(P0), "class 2", "class 2", "path " + hex(PF)}));
    // An empty path list alone makes an empty register, removed by the same.
    expectError(ICC::registerForAlerts(recA, Paths{}, &c4), 0);
    EXPECT_EQ(ICC::callbacks.count({recA, &c4}), 1u);
    expectError(ICC::deRegisterForAlerts(recA, Paths{}, &c4), 0);
    EXPECT_EQ(ICC::callbacks.count({recA, &c4}), 0u);
}

TEST_F(SimpleAlerts, OneCallPerPathWithTheClassesCodeUnderTheLockAndTheirOwnAfterChanges)
{
    ic.registerForSimpleAlerts(simpleA, 65536u + 4, &c1); // the low 16 bits count
    ic.registerForSimpleAlerts(simpleA, 4, &c1); // the same subscription
    ic.registerForSimpleAlerts(simpleB, 4, &c2);
    ic.registerForSimpleAlerts(simpleA, 20, &c3);
    bool freeForOthers = false;
    gSimpleHook = [&] { freeForOthers = freeForOthers || lockableFromAnotherThread(ICC::registerlock); };
    ICC::AlertCallBackFP({alert(5, {P0, PF}), alert(3, {P0}), alert(4, {P1}), alert(0, {P2})});
    EXPECT_FALSE(freeForOthers);
    // By subscriber, each in batch order; removals are not passed on.
    std::stable_sort(gSimple.begin(), gSimple.end(), [](auto const& x, auto const& y) { return x[0] < y[0]; });
    EXPECT_EQ(gSimple,
              (Strings{"1:1:" + hex(P0), "1:2:" + hex(P0), "1:0:" + hex(P2), "2:101:" + hex(P0), "2:102:" + hex(P0),
                       "2:100:" + hex(P2), "3:1:" + hex(PF)}));
    // The adapter passes the alert's own time and every path; an unknown slot gets nothing.
    gSimple.clear();
    Alert const direct = alert(5, {P1, PF});
    expectError(ICC::AlertCallBackSimple({direct}, slot(1)), 0);
    expectError(ICC::AlertCallBackSimple({direct}, slot(7)), 0);
    EXPECT_EQ(gSimple, (Strings{"2:101:" + hex(P1), "2:101:" + hex(PF)}));
    EXPECT_EQ(gSimpleTime, direct.getTimeStamp());
    // Deregistration needs the whole triple; later slots keep their numbers.
    for (IC::Error const& e :
         {ic.deRegisterForSimpleAlerts(simpleA, 4, &c3), ic.deRegisterForSimpleAlerts(simpleB, 4, &c1),
          ic.deRegisterForSimpleAlerts(simpleA, 20, &c1)})
        expectError(e, 1);
    expectError(ic.deRegisterForSimpleAlerts(simpleB, 4, &c2), 0);
    ic.registerForSimpleAlerts(simpleB, 4, &c4);
    ic.deRegisterForSimpleAlerts(simpleA, 4, &c1);
    ic.registerForSimpleAlerts(simpleA, 20, &c5);
    gSimple.clear();
    ICC::AlertCallBackFP({alert(3, {P0, PF})});
    std::sort(gSimple.begin(), gSimple.end());
    EXPECT_EQ(gSimple, (Strings{"3:2:" + hex(PF), "4:102:" + hex(P0), "5:2:" + hex(PF)}));
}

} // namespace

TEST_F(Dispatch, ARemovalNamingManyPathsDropsExactlyThoseAndRegistersStillMatchThePathsTheIndexDropped)
{
    std::vector<std::unique_ptr<IC::Node>> sensors;
    Paths all, even;
    for (unsigned int i = 0; i < 300; ++i) {
        sensors.push_back(std::make_unique<IC::Node>(ST::TemperatureSensor, i, 1000 + i, 1, "t"));
        ASSERT_TRUE(ictest::addNew(ICC::nodestore, *sensors.back()));
        all.push_back(sensors.back()->getPath());
        if (i % 2 == 0)
            even.push_back(all.back());
    }
    ICC::registerForAlerts(recA, Paths{P0, all[4], all[5]}, &c1);
    expectError(ICC::AlertCallBackFP({alert(4, even)}), 0);
    EXPECT_EQ(gDeliveries, (Deliveries{{1, "3/4/2/m/" + hex(all[4]) + ","}}));
    for (unsigned int i = 0; i < 300; ++i)
        EXPECT_EQ(ICC::nodestore.nodePathToSensor(all[i]), i % 2 ? ST::TemperatureSensor : ST::invalid) << i;
    EXPECT_EQ(indexed(), (Keys{"path " + hex(P0), "path " + hex(all[5])}));
    // Back under its path, the node is matched through the register's own
    // set wherever the register is found, though the index lost the path.
    ASSERT_TRUE(ictest::addNew(ICC::nodestore, *sensors[4]));
    // The paths of an alert, and the deliveries it makes.
    std::pair<Paths, Deliveries> const cases[] = {
        {{all[4]}, {}},
        {{all[4], P0}, {{1, "3/0/2/m/" + hex(all[4]) + "," + hex(P0) + ","}}},
        {{all[5], all[6], all[4]}, {{1, "3/0/2/m/" + hex(all[5]) + "," + hex(all[4]) + ","}}},
    };
    for (auto const& [paths, expected] : cases) {
        gDeliveries.clear();
        expectError(ICC::AlertCallBackFP({alert(0, paths)}), 0);
        EXPECT_EQ(gDeliveries, expected) << paths.size();
    }
    ICC::registerForAlerts(recA, cls(7), &c2);
    gDeliveries.clear();
    ICC::AlertCallBackFP({alert(7, {})});
    EXPECT_EQ(gDeliveries, (Deliveries{{2, ""}})) << "a class match of no path: an empty call";
}
