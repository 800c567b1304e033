// icctl: the command-line host of instrumentation control.
#include "Commands.h"
#include "Errors.h"
#include "Session.h"

#include <CLI/CLI.hpp>

#include <exception>
#include <string>
#include <iostream>

namespace icctl {
namespace {

// "--for 0" or "--wait -1" get a message about seconds, not about ranges.
std::string seconds(std::string const& text, bool zeroAllowed)
{
    try {
        std::size_t used = 0;
        double const v = std::stod(text, &used);
        if (used == text.size() && (v > 0 || (zeroAllowed && v == 0)) && v < 1e9)
            return std::string();
    } catch (std::exception const&) {
    }
    return "'" + text + "' is not a " + (zeroAllowed ? "" : "positive ") + "number of seconds";
}

// The first argument that is neither an option nor the value of one.
char const* firstWord(int argc, char** argv)
{
    for (int i = 1; i < argc; ++i) {
        std::string const a = argv[i];
        if (a == "--mi-dir" || a == "--fp-dir" || a == "--sysfs-root") {
            ++i;
            continue;
        }
        if (!a.empty() && a[0] != '-')
            return argv[i];
    }
    return nullptr;
}

int run(int argc, char** argv)
{
    CLI::App app{"Shows the server's hardware as instrumentation control sees it: nodes, "
                 "readings and alerts, from the management-interface and functional plug-ins.",
                 "icctl"};
    // Global options may also follow the subcommand ("icctl tree --json").
    app.fallthrough();
    app.require_subcommand(1);
    app.set_version_flag("--version", "icctl " ICCTL_VERSION);

    GlobalOptions g;
    app.add_option("--mi-dir", g.miDir,
                   "Directory of management-interface plug-ins (sets IC_MI_DIR)");
    app.add_option("--fp-dir", g.fpDir, "Directory of functional plug-ins (sets IC_FP_DIR)");
    app.add_option("--sysfs-root", g.sysfsRoot,
                   "Root of the sysfs tree the Linux hardware plug-in reads (sets IC_SYSFS_ROOT)");
    app.add_flag("--json", g.json, "JSON output: one document; JSON lines for watch");
    app.add_flag("-v,--verbose", g.verbose,
                 "The library's progress log on standard error; -vv for everything");

    CLI::App* tree = app.add_subcommand("tree", "The hardware tree, each node under its parent");

    NodesOptions nodesOptions;
    CLI::App* nodes = app.add_subcommand("nodes", "Every node as a table");
    nodes->add_option("--sensor", nodesOptions.sensor,
                      "Only nodes of this sensor type (name such as \"Temperature Sensor\", or "
                      "number)");

    std::string showPath;
    CLI::App* show = app.add_subcommand(
        "show", "One node: its properties, hierarchy, children and asserted alerts");
    show->add_option("path", showPath, "The node's printable path (as 'icctl nodes' shows it)")
        ->required();

    AlertsOptions alertsOptions;
    CLI::App* alerts = app.add_subcommand("alerts", "The asserted alerts");
    alerts
        ->add_option("--wait", alertsOptions.waitSeconds,
                     "Seconds to wait after loading, so that the plug-ins' first readings arrive")
        ->check([](std::string const& v) { return seconds(v, true); });

    WatchOptions watchOptions;
    CLI::App* watch = app.add_subcommand(
        "watch", "Alerts as they arrive, one line each, while plug-ins may come and go");
    watch->add_option("--sensor", watchOptions.sensors,
                      "Alerts on nodes of this sensor type (repeatable)")
        ->expected(1)
        ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll);
    watch->add_option("--class", watchOptions.classes,
                      "Alerts of this class: name (threshold, link...) or number (repeatable)")
        ->expected(1)
        ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll);
    watch->add_option("--path", watchOptions.paths, "Alerts on this node path (repeatable)")
        ->expected(1)
        ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll);
    watch->add_flag("--simple", watchOptions.simple,
                    "Simple alerts (event code, time, path) of the --sensor types, or of all");
    watch
        ->add_option("--reload-interval", watchOptions.reloadSeconds,
                     "Seconds between looks for plug-ins added or removed; 0: never")
        ->capture_default_str()
        ->check(CLI::Range(0u, 86400u));
    watch->add_option("--for", watchOptions.forSeconds, "Stop after this many seconds")
        ->check([](std::string const& v) { return seconds(v, false); });

    PathOptions pathOptions;
    CLI::App* path = app.add_subcommand(
        "path", "A node path: its bytes and the (sensor type, instance) chain it encodes");
    path->add_option("printable", pathOptions.printable, "The printable (hexadecimal) path");
    path->add_option("--encode", pathOptions.encode,
                     "Encode a chain such as \"ROOT:0 -> Chassis:0 -> CPU:1\" (root first)");
    path->add_flag("--binary", pathOptions.toBinary,
                   "Write the binary path itself to standard output");
    path->add_flag("--from-binary", pathOptions.fromBinary,
                   "Read a binary path from standard input");

    CLI::App* sensors = app.add_subcommand("sensors", "The sensor type names and numbers");

    try {
        app.parse(argc, argv);
    } catch (CLI::ParseError const& e) {
        // A mistyped command reads better as such than as a missing one.
        if (app.get_subcommands().empty())
            if (char const* word = firstWord(argc, argv))
                throw UsageError(std::string("unknown command '") + word +
                                 "' (tree, nodes, show, alerts, watch, path, sensors)");
        // Help is a success; every other parse error is bad input.
        return app.exit(e) == 0 ? kExitOk : kExitUsage;
    }

    configureLogging(g.verbose);
    if (tree->parsed())
        return runTree(g);
    if (nodes->parsed())
        return runNodes(g, nodesOptions);
    if (show->parsed())
        return runShow(g, showPath);
    if (alerts->parsed())
        return runAlerts(g, alertsOptions);
    if (watch->parsed())
        return runWatch(g, watchOptions);
    if (path->parsed())
        return runPath(g, pathOptions);
    if (sensors->parsed())
        return runSensors(g);
    throw UsageError("no command given");
}

} // namespace
} // namespace icctl

int main(int argc, char** argv)
{
    using namespace icctl;
    try {
        return run(argc, argv);
    } catch (UsageError const& e) {
        std::cerr << "icctl: " << e.what() << '\n';
        return kExitUsage;
    } catch (Failure const& e) {
        std::cerr << "icctl: " << e.what() << '\n';
        return kExitFailure;
    } catch (OpenError const& e) {
        std::cerr << "icctl: " << e.what() << "; -v shows the loader's log\n";
        return kExitOpenFailed;
    } catch (std::exception const& e) {
        std::cerr << "icctl: " << e.what() << '\n';
        return kExitFailure;
    } catch (...) {
        std::cerr << "icctl: unexpected failure\n";
        return kExitFailure;
    }
}
