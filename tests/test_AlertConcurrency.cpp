// Stress test of the alert subsystem: registrations of every form come and go
// while management-interface and functional plug-in batches are dispatched,
// nodes are removed and come back, simple subscriptions change and clients
// read the asserted alerts. Every callback checks that what it receives
// matches its own filter; at the end nothing may be left registered.
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include "StoreSupport.h"

namespace {

namespace ICC = IC::InstCtrl;
using IC::Alert;
using IC::Node;
using Paths = std::vector<std::string>;
using ST = Node::SensorType;

constexpr int kOps = 2000;           // operations per thread
constexpr unsigned char kFromMI = 1; // severity marking management batches
constexpr unsigned char kFromFP = 2; // severity marking plug-in batches
Alert::ClassType const kWatched = static_cast<Alert::ClassType>(7);

// The message of every alert raised here is its number of paths, so that a
// receiver can tell whether it got all of them.
Alert alertFrom(unsigned char source, unsigned int c, Paths paths, unsigned int status)
{
    std::string const n = std::to_string(paths.size());
    return Alert(source, static_cast<Alert::ClassType>(c), std::move(paths), status, n);
}

std::set<std::string> gCpuPaths, gFanPaths; // fixed after set-up

enum class Form { ClientSensor, ClientClass, ClientPaths, PlugInSensor, PlugInPaths };

// One subscriber with a single, fixed filter.
struct Watch {
    Form form;
    IC::AlertCallBack cb;
    ST sensor = ST::CPU;
    Paths paths = {};
    std::atomic<long> calls{0}, alerts{0}, fromMI{0}, bad{0};

    void check(std::vector<Alert> const& batch)
    {
        ++calls;
        bool const client = form <= Form::ClientPaths;
        for (auto const& a : batch) {
            ++alerts;
            fromMI += a.getSeverity() == kFromMI;
            bad += a.getSeverity() == kFromMI && client; // clients only see what plug-ins raise
            Paths const& got = a.nodePaths();
            if (form == Form::ClientClass) {
                bad += a.getClass() != kWatched || std::to_string(got.size()) != a.getMessage();
                continue;
            }
            bad += got.empty();
            bool const bySensor = form == Form::ClientSensor || form == Form::PlugInSensor;
            for (auto const& p : got)
                bad += bySensor ? (sensor == ST::CPU ? gCpuPaths : gFanPaths).count(p) == 0
                                : std::find(paths.begin(), paths.end(), p) == paths.end();
        }
    }
};

template <unsigned char Status>
IC::Error watch(std::vector<Alert> const& a, void const* ctx)
{
    static_cast<Watch*>(const_cast<void*>(ctx))->check(a);
    return IC::Error(Status, IC::Number(IC::Number::Generic), "");
}

std::atomic<long> gSelfRemovals{0};

// Drops its own registration from inside the delivery.
IC::Error selfRemoving(std::vector<Alert> const& a, void const* ctx)
{
    auto* w = static_cast<Watch*>(const_cast<void*>(ctx));
    w->check(a);
    gSelfRemovals += ICC::deRegFPsensorAlerts(selfRemoving, w->sensor, ctx).getStatus() == 0;
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

bool ok(IC::Error const& e) { return e.getStatus() == 0; }

// Registers (on) or deregisters the watch in its form; true on success.
bool subscribe(IC::InstrumentationControl& ic, Watch& w, bool on)
{
    switch (w.form) {
    case Form::ClientSensor:
        return ok(on ? ic.registerForAlerts(w.cb, w.sensor, &w) : ic.deRegisterForAlerts(w.cb, w.sensor, &w));
    case Form::ClientClass:
        return ok(on ? ICC::registerForAlerts(w.cb, kWatched, &w) : ICC::deRegisterForAlerts(w.cb, kWatched, &w));
    case Form::ClientPaths:
        return ok(on ? ICC::registerForAlerts(w.cb, w.paths, &w) : ICC::deRegisterForAlerts(w.cb, w.paths, &w));
    case Form::PlugInSensor:
        return ok(on ? ICC::regFPsensorAlerts(w.cb, w.sensor, &w) : ICC::deRegFPsensorAlerts(w.cb, w.sensor, &w));
    default:
        return ok(on ? ICC::regFPAlerts(w.cb, w.paths, &w) : ICC::deRegFPAlerts(w.cb, w.paths, &w));
    }
}

struct SimpleWatch {
    std::set<std::string> const* paths;
    std::atomic<long> calls{0}, bad{0};
};

void simpleWatch(unsigned int code, SD::DateTime, std::string path, void const* ctx)
{
    auto* w = static_cast<SimpleWatch*>(const_cast<void*>(ctx));
    ++w->calls;
    w->bad += code > 2 || w->paths->count(path) == 0;
}

class AlertStress : public testing::Test {
protected:
    void SetUp() override
    {
        // Thousands of warnings would otherwise go to standard error.
        std::string const conf = testing::TempDir() + "alert_stress_log.properties";
        std::ofstream(conf) << "log4j.rootLogger=OFF\n";
        ASSERT_TRUE(HGLog::HGLogger::configure(conf));
        std::remove(conf.c_str());
        gCpuPaths = std::set<std::string>(cpu.begin(), cpu.end());
        gFanPaths = std::set<std::string>(fan.begin(), fan.end());
        ASSERT_EQ(gCpuPaths.size() + gFanPaths.size(), 12u);
    }
    void TearDown() override { HGLog::HGLogger::configureDefault(); }

    ictest::CleanAlertState clean_;
    ictest::NodeTree tree{ICC::nodestore, 8, 4};
    Paths const &cpu = tree.cpu, &fan = tree.fan;
};

} // namespace

TEST_F(AlertStress, RegistrationsDispatchAndQueriesInterleaveSafely)
{
    IC::InstrumentationControl ic;
    // CPU 6 and 7 and fan 3 are removed and re-added.
    std::vector<Node*> const removable{tree.nodes[7].get(), tree.nodes[8].get(), tree.nodes[12].get()};
    Watch longClient{Form::ClientSensor, watch<0>}, longPlugIn{Form::PlugInSensor, watch<1>};
    Watch self{Form::PlugInSensor, selfRemoving};
    Watch clientSensor{Form::ClientSensor, watch<1>}, clientClass{Form::ClientClass, watch<0>};
    Watch clientPaths{Form::ClientPaths, watch<1>, ST::CPU, {cpu[1], fan[0], cpu[7]}};
    Watch plugInSensor{Form::PlugInSensor, watch<0>, ST::Fan};
    Watch plugInPaths{Form::PlugInPaths, watch<0>, ST::CPU, {cpu[2], fan[3]}};
    SimpleWatch simpleLong{&gFanPaths}, simpleToggled{&gCpuPaths};
    for (Watch* w : {&longClient, &longPlugIn, &self})
        ASSERT_TRUE(subscribe(ic, *w, true));
    ASSERT_EQ(ic.registerForSimpleAlerts(simpleWatch, ST::Fan, &simpleLong).getStatus(), 0);

    std::atomic<long> failures{0}, removals{0};
    std::atomic<bool> go{false};
    std::atomic<int> sourcesRunning{2};
    // Registration and query threads keep going while alerts still flow, so
    // that the two overlap however the threads are scheduled.
    auto more = [&](int i) { return i < kOps || (sourcesRunning.load() > 0 && i < 20 * kOps); };
    auto waitForStart = [&go] {
        while (!go.load())
            std::this_thread::yield();
    };
    // Each toggles its subscriptions: on at one visit, off at the next.
    auto toggler = [&](std::vector<Watch*> mine, bool feedSelf) {
        waitForStart();
        std::vector<bool> on(mine.size(), false);
        for (int i = 0; more(i); ++i) {
            std::size_t const k = static_cast<std::size_t>(i) % mine.size();
            on[k] = !on[k];
            failures += !subscribe(ic, *mine[k], on[k]);
            failures += feedSelf && i % 4 == 0 && !subscribe(ic, self, true);
        }
        for (std::size_t k = 0; k < mine.size(); ++k)
            failures += on[k] && !subscribe(ic, *mine[k], false);
    };
    auto source = [&](bool fromFP) {
        waitForStart();
        for (std::size_t i = 0; i < kOps; ++i) {
            std::string const &c = cpu[i % 8], &f = fan[i % 4];
            if (!fromFP) {
                std::vector<Alert> const batch{alertFrom(kFromMI, 0, {c}, 2), alertFrom(kFromMI, kWatched, {c, f}, 3),
                                               alertFrom(kFromMI, 5, {f}, 2)};
                failures += !ok(ICC::AlertCallBackMI(batch, nullptr));
                continue;
            }
            failures += ICC::AlertCallBackFP({alertFrom(kFromFP, 0, {c}, i % 2 ? 1u : 2u),
                                              alertFrom(kFromFP, kWatched, {cpu[(i + 3) % 8], f}, 2),
                                              alertFrom(kFromFP, 5, {f}, 0)}).getStatus() != 0;
            if (i % 10 == 0)
                failures += ICC::AssertCallBackFP({alertFrom(kFromFP, 0, {c}, 3)}).getStatus() != 0;
            if (i % 16 == 0) {
                Node* n = removable[(i / 16) % removable.size()];
                std::string const path = n->getPath();
                failures += ICC::AlertCallBackFP({alertFrom(kFromFP, 4, {path}, 2)}).getStatus() != 0;
                Node* found = nullptr;
                failures += ICC::nodestore.getNode(path, &found).getStatus() != 1;
                failures += !ictest::addNew(ICC::nodestore, *n);
                ++removals;
            }
        }
        --sourcesRunning;
    };
    auto reader = [&] {
        waitForStart();
        bool on = false;
        std::vector<Alert> out;
        for (int i = 0; more(i); ++i) {
            failures += i % 2 == 0 && ic.getAssertedAlerts(out).getStatus() != 0;
            for (auto const& a : out)
                failures += a.getStatus() == 1 || a.getNodePaths().empty();
            on = !on;
            failures += (on ? ic.registerForSimpleAlerts(simpleWatch, ST::CPU, &simpleToggled)
                            : ic.deRegisterForSimpleAlerts(simpleWatch, ST::CPU, &simpleToggled)).getStatus() != 0;
        }
        failures += on && ic.deRegisterForSimpleAlerts(simpleWatch, ST::CPU, &simpleToggled).getStatus() != 0;
    };
    {
        ictest::Watchdog dog(240, "alert stress test (deadlock?)");
        ictest::JoinedThread t1(toggler, std::vector<Watch*>{&clientSensor, &clientClass, &clientPaths}, false);
        ictest::JoinedThread t2(toggler, std::vector<Watch*>{&plugInSensor, &plugInPaths}, true);
        ictest::JoinedThread t3(source, false), t4(source, true), t5(reader);
        go = true;
    }

    EXPECT_EQ(failures.load(), 0);
    EXPECT_TRUE(subscribe(ic, longClient, false) && subscribe(ic, longPlugIn, false));
    subscribe(ic, self, false); // may already have removed itself
    EXPECT_EQ(ic.deRegisterForSimpleAlerts(simpleWatch, ST::Fan, &simpleLong).getStatus(), 0);
    EXPECT_TRUE(ictest::noRegistrations());
    for (Watch* w :
         {&longClient, &longPlugIn, &self, &clientSensor, &clientClass, &clientPaths, &plugInSensor, &plugInPaths})
        EXPECT_EQ(w->bad.load(), 0) << "a callback received alerts outside its filter";
    EXPECT_EQ(simpleLong.bad.load() + simpleToggled.bad.load(), 0);
    // The long-lived subscriptions saw the traffic they asked for.
    EXPECT_GT(longClient.alerts.load(), 0);
    EXPECT_EQ(longClient.fromMI.load(), 0);
    EXPECT_GT(longPlugIn.fromMI.load(), 0);
    EXPECT_GT(longPlugIn.alerts.load() - longPlugIn.fromMI.load(), 0);
    EXPECT_GT(simpleLong.calls.load(), 0);
    EXPECT_EQ(removals.load(), (kOps + 15) / 16);
    EXPECT_GT(self.calls.load(), 0);
    EXPECT_GT(gSelfRemovals.load(), 0);
    std::vector<Alert> left;
    ic.getAssertedAlerts(left);
    for (auto const& a : left)
        EXPECT_NE(a.getStatus(), 1u);
}
