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
using Paths = std::vector<std::string>;
using ST = IC::Node::SensorType;

constexpr int kOps = 2000; // operations per thread
constexpr unsigned char kFromMI = 1, kFromFP = 2; // severities that mark the source
Alert::ClassType const kWatched = static_cast<Alert::ClassType>(7);

// The message of every alert raised here is its number of paths, so that a
// receiver can tell whether it got all of them.
Alert raised(unsigned char source, unsigned int c, Paths paths, unsigned int status)
{
    std::string const n = std::to_string(paths.size());
    return Alert(source, static_cast<Alert::ClassType>(c), std::move(paths), status, n);
}

enum class Form { ClientSensor, ClientClass, ClientPaths, PlugInSensor, PlugInPaths, Simple };

// One subscriber with a single, fixed filter: the paths it may receive (its
// sensor type's or its own). One that removes itself does so from inside
// each delivery.
struct Watch {
    Form form;
    std::set<std::string> allowed = {};
    ST sensor = ST::CPU;
    bool removesItself = false;
    std::atomic<long> calls{0}, alerts{0}, fromMI{0}, bad{0}, selfRemovals{0};
};

IC::Error watch(std::vector<Alert> const& batch, void const* ctx)
{
    auto& w = *static_cast<Watch*>(const_cast<void*>(ctx));
    ++w.calls;
    for (auto const& a : batch) {
        ++w.alerts;
        w.fromMI += a.getSeverity() == kFromMI;
        w.bad += a.getSeverity() == kFromMI && w.form <= Form::ClientPaths; // clients see only plug-ins' alerts
        if (w.form == Form::ClientClass)
            w.bad += a.getClass() != kWatched || std::to_string(a.nodePaths().size()) != a.getMessage();
        else
            w.bad += a.nodePaths().empty() ||
                std::any_of(a.nodePaths().begin(), a.nodePaths().end(),
                            [&w](auto const& p) { return w.allowed.count(p) == 0; });
    }
    if (w.removesItself)
        w.selfRemovals += ICC::deRegFPsensorAlerts(watch, w.sensor, ctx).getStatus() == 0;
    return IC::Error(static_cast<unsigned char>(w.calls % 2), IC::Number(IC::Number::Generic), "ignored");
}

void simpleWatch(unsigned int code, SD::DateTime, std::string path, void const* ctx)
{
    auto& w = *static_cast<Watch*>(const_cast<void*>(ctx));
    ++w.calls;
    w.bad += code > 2 || w.allowed.count(path) == 0;
}

bool ok(IC::Error const& e) { return e.getStatus() == 0; }

// Registers (on) or deregisters the watch in its form; true on success.
bool subscribe(IC::InstrumentationControl& ic, Watch& w, bool on)
{
    Paths const paths(w.allowed.begin(), w.allowed.end());
    switch (w.form) {
    case Form::ClientSensor:
        return ok(on ? ic.registerForAlerts(watch, w.sensor, &w) : ic.deRegisterForAlerts(watch, w.sensor, &w));
    case Form::ClientClass:
        return ok(on ? ICC::registerForAlerts(watch, kWatched, &w) : ICC::deRegisterForAlerts(watch, kWatched, &w));
    case Form::ClientPaths:
        return ok(on ? ICC::registerForAlerts(watch, paths, &w) : ICC::deRegisterForAlerts(watch, paths, &w));
    case Form::PlugInSensor:
        return ok(on ? ICC::regFPsensorAlerts(watch, w.sensor, &w) : ICC::deRegFPsensorAlerts(watch, w.sensor, &w));
    case Form::PlugInPaths:
        return ok(on ? ICC::regFPAlerts(watch, paths, &w) : ICC::deRegFPAlerts(watch, paths, &w));
    default:
        return ok(on ? ic.registerForSimpleAlerts(simpleWatch, w.sensor, &w)
                     : ic.deRegisterForSimpleAlerts(simpleWatch, w.sensor, &w));
    }
}

} // namespace

TEST(AlertStress, RegistrationsDispatchAndQueriesInterleaveSafely)
{
    ictest::CleanAlertState clean;
    ictest::NodeTree tree{ICC::nodestore, 8, 4};
    Paths const &cpu = tree.cpu, &fan = tree.fan;
    std::set<std::string> const cpus(cpu.begin(), cpu.end()), fans(fan.begin(), fan.end());
    // Thousands of warnings would otherwise go to standard error.
    std::string const conf = testing::TempDir() + "alert_stress_log.properties";
    std::ofstream(conf) << "log4j.rootLogger=OFF\n";
    ASSERT_TRUE(HGLog::HGLogger::configure(conf));
    std::remove(conf.c_str());

    IC::InstrumentationControl ic;
    // CPU 6 and 7 and fan 3 are removed and come back.
    std::vector<IC::Node*> const removable{tree.nodes[7].get(), tree.nodes[8].get(), tree.nodes[12].get()};
    Watch longClient{Form::ClientSensor, cpus}, longPlugIn{Form::PlugInSensor, cpus}, self{Form::PlugInSensor, cpus};
    Watch simpleLong{Form::Simple, fans, ST::Fan}, simpleToggled{Form::Simple, cpus};
    Watch clientSensor{Form::ClientSensor, cpus}, clientClass{Form::ClientClass};
    Watch clientPaths{Form::ClientPaths, {cpu[1], fan[0], cpu[7]}}, plugInPaths{Form::PlugInPaths, {cpu[2], fan[3]}};
    Watch plugInSensor{Form::PlugInSensor, fans, ST::Fan};
    self.removesItself = true;
    for (Watch* w : {&longClient, &longPlugIn, &self, &simpleLong})
        ASSERT_TRUE(subscribe(ic, *w, true));

    std::atomic<long> failures{0};
    std::atomic<bool> go{false};
    std::atomic<int> sourcesRunning{2};
    auto waitForStart = [&go] {
        while (!go.load())
            std::this_thread::yield();
    };
    // Each toggles its subscriptions, on at one visit and off at the next,
    // and goes on while alerts still flow, so that both overlap however the
    // threads are scheduled; one also reads the asserted alerts.
    auto toggler = [&](std::vector<Watch*> mine, bool feedSelf, bool reads) {
        waitForStart();
        std::vector<bool> on(mine.size(), false);
        for (int i = 0; i < kOps || (sourcesRunning.load() > 0 && i < 20 * kOps); ++i) {
            std::size_t const k = static_cast<std::size_t>(i) % mine.size();
            on[k] = !on[k];
            failures += !subscribe(ic, *mine[k], on[k]) + (feedSelf && i % 4 == 0 && !subscribe(ic, self, true));
            std::vector<Alert> out;
            failures += reads && i % 2 == 0 && !ok(ic.getAssertedAlerts(out));
            for (auto const& a : out)
                failures += a.getStatus() == 1 || a.getNodePaths().empty();
        }
        for (std::size_t k = 0; k < mine.size(); ++k)
            failures += on[k] && !subscribe(ic, *mine[k], false);
    };
    auto source = [&](bool fromFP) {
        waitForStart();
        for (int i = 0; i < kOps; ++i) {
            std::string const &c = cpu[i % 8], &f = fan[i % 4];
            if (!fromFP) {
                failures += !ok(ICC::AlertCallBackMI(
                    {raised(kFromMI, 0, {c}, 2), raised(kFromMI, kWatched, {c, f}, 3), raised(kFromMI, 5, {f}, 2)},
                    nullptr));
                continue;
            }
            failures += !ok(ICC::AlertCallBackFP({raised(kFromFP, 0, {c}, i % 2 ? 1u : 2u),
                                                  raised(kFromFP, kWatched, {cpu[(i + 3) % 8], f}, 2),
                                                  raised(kFromFP, 5, {f}, 0)}));
            failures += i % 10 == 0 && !ok(ICC::AssertCallBackFP({raised(kFromFP, 0, {c}, 3)}));
            if (i % 16 == 0) {
                IC::Node* n = removable[(i / 16) % removable.size()];
                std::string const path = n->getPath();
                failures += !ok(ICC::AlertCallBackFP({raised(kFromFP, 4, {path}, 2)}));
                failures += ICC::nodestore.nodePathToSensor(path) != ST::invalid || !ictest::addNew(ICC::nodestore, *n);
            }
        }
        --sourcesRunning;
    };
    {
        ictest::Watchdog dog(240, "alert stress test (deadlock?)");
        ictest::JoinedThread t1(toggler, std::vector<Watch*>{&clientSensor, &clientClass, &clientPaths}, false, false);
        ictest::JoinedThread t2(toggler, std::vector<Watch*>{&plugInSensor, &plugInPaths}, true, false);
        ictest::JoinedThread t3(source, false), t4(source, true),
            t5(toggler, std::vector<Watch*>{&simpleToggled}, false, true);
        go = true;
    }
    HGLog::HGLogger::configureDefault();

    EXPECT_EQ(failures.load(), 0);
    for (Watch* w : {&longClient, &longPlugIn, &simpleLong})
        EXPECT_TRUE(subscribe(ic, *w, false));
    subscribe(ic, self, false); // may have removed itself already
    EXPECT_TRUE(ictest::noRegistrations());
    for (Watch* w : {&longClient, &longPlugIn, &self, &simpleLong, &simpleToggled, &clientSensor, &clientClass,
                     &clientPaths, &plugInSensor, &plugInPaths})
        EXPECT_EQ(w->bad.load(), 0) << "a callback received alerts outside its filter";
    // The long-lived subscriptions saw the traffic they asked for.
    EXPECT_TRUE(longClient.alerts > 0 && longClient.fromMI == 0 && simpleLong.calls > 0 && self.selfRemovals > 0);
    EXPECT_TRUE(longPlugIn.fromMI > 0 && longPlugIn.alerts > longPlugIn.fromMI);
}
