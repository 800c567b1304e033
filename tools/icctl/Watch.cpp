// watch: alerts as they arrive, while a loader thread lets plug-ins come and
// go, until interrupted or for a given time.
#include "Commands.h"

#include "Errors.h"
#include "Output.h"
#include "SensorNames.h"

#include <IC/InstCtrl.h>
#include <IC/LoaderThread.h>
#include <SD/Mutex.h>

#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <iostream>
#include <mutex>
#include <stdexcept>
#include <thread>

namespace icctl {
namespace {

volatile std::sig_atomic_t gStop = 0;

extern "C" void onSignal(int)
{
    gStop = 1;
}

void catchSignals()
{
    struct sigaction sa {};
    sa.sa_handler = onSignal;
    sigemptyset(&sa.sa_mask);
    sigaction(SIGINT, &sa, nullptr);
    sigaction(SIGTERM, &sa, nullptr);
}

// The output side of the registrations. It lives as long as the process: a
// delivery the library has begun may still arrive while it unloads.
struct Watcher {
    std::mutex out;
    bool json = false;
    IC::InstrumentationControl* ic = nullptr;

    void emit(std::string const& line)
    {
        std::lock_guard<std::mutex> g(out);
        std::cout << line << '\n' << std::flush;
    }
} gWatcher;

IC::Error onAlerts(std::vector<IC::Alert> const& alerts, void const* context)
{
    auto* w = static_cast<Watcher*>(const_cast<void*>(context));
    try {
        for (IC::Alert const& a : alerts)
            w->emit(w->json ? jsonLine(alertJson(*w->ic, a)) : alertLine(*w->ic, a));
    } catch (std::exception const& e) {
        std::cerr << "icctl: cannot show an alert: " << e.what() << '\n';
    }
    return IC::Error(0, IC::Number(IC::Number::Generic), std::string());
}

std::string simpleEventName(unsigned int code)
{
    switch (code) {
    case 1: return "threshold";
    case 2: return "node-arrival";
    default: return "other";
    }
}

void onSimple(unsigned int code, SD::DateTime time, std::string path, void const* context)
{
    auto* w = static_cast<Watcher*>(const_cast<void*>(context));
    try {
        IC::InstrumentationControl& ic = *w->ic;
        IC::Node* node = nullptr;
        bool const known = ic.getNode(path, &node).getStatus() == 0 && node;
        if (w->json) {
            Json j{{"simple", true},
                   {"time", time.toIso8601()},
                   {"event", code},
                   {"eventName", simpleEventName(code)},
                   {"path", ic.pathToPrintablePath(path)}};
            j["node"] = known ? Json{{"type", static_cast<unsigned int>(node->getSensor())},
                                     {"typeName", sensorName(node->getSensor())},
                                     {"instance", node->getInstance()},
                                     {"description", node->getDescription()}}
                              : Json(nullptr);
            w->emit(jsonLine(j));
        } else {
            std::string line = time.toIso8601() + " simple " + simpleEventName(code) + " [" +
                               ic.pathToPrintablePath(path);
            if (known)
                line += " " + nodeSummary(*node);
            w->emit(line + "]");
        }
    } catch (std::exception const& e) {
        std::cerr << "icctl: cannot show an alert: " << e.what() << '\n';
    }
}

void check(IC::Error const& e, std::string const& what)
{
    if (e.getStatus() != 0)
        throw Failure("cannot register for " + what + ": " + e.getText());
}

} // namespace

int runWatch(GlobalOptions const& g, WatchOptions const& o)
{
    if (o.simple && (!o.classes.empty() || !o.paths.empty()))
        throw UsageError("--simple selects by --sensor only");
    // Names are checked before anything is loaded.
    std::vector<IC::Node::SensorType> sensors;
    for (std::string const& s : o.sensors)
        sensors.push_back(parseSensor(s));
    std::vector<IC::Alert::ClassType> classes;
    for (std::string const& c : o.classes)
        classes.push_back(parseClass(c));
    bool const everything = sensors.empty() && classes.empty() && o.paths.empty();
    if (sensors.empty() && (everything || o.simple))
        for (unsigned int t = 0; t < IC::Node::invalid; ++t)
            sensors.push_back(static_cast<IC::Node::SensorType>(t));
    // Removals reach sensor registrations only while the node is still
    // known; by class they always arrive.
    if (everything && !o.simple)
        classes.push_back(IC::Alert::NodeRemoval);

    gStop = 0;
    catchSignals();
    Library lib(g);
    IC::InstrumentationControl& ic = lib.ic();
    std::vector<std::string> paths;
    for (std::string const& p : o.paths) {
        if (p.empty())
            throw UsageError("empty node path");
        try {
            paths.push_back(ic.printablePathToPath(p));
        } catch (std::invalid_argument const& e) {
            throw UsageError("invalid node path '" + p + "': " + e.what());
        }
    }

    gWatcher.json = g.json;
    gWatcher.ic = &ic;
    void const* const context = &gWatcher;
    if (o.simple) {
        for (IC::Node::SensorType s : sensors)
            check(ic.registerForSimpleAlerts(onSimple, s, context), "simple alerts");
    } else {
        for (IC::Node::SensorType s : sensors)
            check(ic.registerForAlerts(onAlerts, s, context), "alerts of " + sensorName(s));
        for (IC::Alert::ClassType c : classes)
            check(IC::InstCtrl::registerForAlerts(onAlerts, c, context),
                  "alerts of class " + className(c));
        if (!paths.empty())
            check(IC::InstCtrl::registerForAlerts(onAlerts, paths, context), "alerts by path");
    }

    if (o.reloadSeconds > 0) {
        // The last unload stops, joins and deletes it.
        auto* loader = new IC::LoaderThread(0, o.reloadSeconds, IC::InstCtrl::TimedReload);
        {
            SD::MutexGuard guard(IC::InstCtrl::loadlock);
            IC::InstCtrl::lt = loader;
        }
        if (!loader->start())
            std::cerr << "icctl: the loader thread did not start; plug-ins stay as loaded\n";
    }
    if (g.verbose > 0 || isatty(STDERR_FILENO)) {
        std::cerr << "icctl: watching alerts";
        if (o.forSeconds > 0)
            std::cerr << " for " << o.forSeconds << " s";
        std::cerr << "; Ctrl-C ends\n";
    }

    auto const start = std::chrono::steady_clock::now();
    auto const limit = std::chrono::duration<double>(o.forSeconds);
    while (!gStop) {
        if (o.forSeconds > 0 && std::chrono::steady_clock::now() - start >= limit)
            break;
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }

    if (o.simple) {
        for (IC::Node::SensorType s : sensors)
            ic.deRegisterForSimpleAlerts(onSimple, s, context);
    } else {
        for (IC::Node::SensorType s : sensors)
            ic.deRegisterForAlerts(onAlerts, s, context);
        for (IC::Alert::ClassType c : classes)
            IC::InstCtrl::deRegisterForAlerts(onAlerts, c, context);
        if (!paths.empty())
            IC::InstCtrl::deRegisterForAlerts(onAlerts, paths, context);
    }
    return kExitOk;
}

} // namespace icctl
