// icd: the host agent. Opens the library once, lets plug-ins come and go,
// and serves the hardware over HTTP: Prometheus metrics, a JSON API with an
// event stream, and one page.
#include "AlertFeed.h"
#include "Errors.h"
#include "EventRing.h"
#include "HttpService.h"
#include "Log.h"
#include "Plugins.h"
#include "Session.h"

#include <IC/InstCtrl.h>
#include <IC/LoaderThread.h>
#include <SD/Mutex.h>

#include <CLI/CLI.hpp>

#include <malloc.h>
#include <signal.h>
#ifdef ICD_SYSTEMD
#include <systemd/sd-daemon.h>
#endif

#include <iostream>
#include <memory>
#include <optional>

namespace icd {
namespace {

using namespace ictools;

constexpr std::size_t kEventRing = 4096; // events a reconnecting client can catch up on

// Tells systemd (Type=notify) that icd listens, reloads or stops; nothing
// outside a unit that asks for it.
void notifyService(char const* state)
{
#ifdef ICD_SYSTEMD
    sd_notify(0, state);
#else
    (void)state;
#endif
}

struct Options {
    GlobalOptions global;
    ServiceOptions service;
    std::string webConfig;
    bool insecure = false;
    unsigned int reloadSeconds = 10;
    double keepAliveSeconds = 15;
};

// Refuses what would expose the server without protection, before anything
// is loaded.
void checkListen(Options& o)
{
    if (!o.webConfig.empty()) {
        try {
            o.service.web = WebConfig::load(o.webConfig);
        } catch (WebConfigError const& e) {
            throw UsageError(e.what());
        }
    }
    for (std::string const& l : o.service.listen) {
        std::string host;
        int port = 0;
        try {
            splitListen(l, &host, &port);
        } catch (std::invalid_argument const& e) {
            throw UsageError(std::string("--listen ") + e.what());
        }
        if (!isLoopback(host) && o.webConfig.empty() && !o.insecure)
            throw UsageError("refusing to listen on " + l +
                             " without --web-config (TLS and passwords); give --insecure-listen "
                             "to serve the hardware unprotected to that network");
    }
}

int run(int argc, char** argv)
{
    CLI::App app{"Serves this server's hardware as instrumentation control sees it: Prometheus "
                 "metrics at /metrics, a JSON API under /api/v1/, live alerts at /api/v1/events "
                 "and a page at /.",
                 "icd"};
    Options o;
    std::vector<std::string> listen;
    app.add_option("--listen", listen,
                   "ADDR:PORT to serve on (repeatable; default 127.0.0.1:9847; port 0 picks one)")
        ->expected(1)
        ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll);
    app.add_option("--mi-dir", o.global.miDir,
                   "Directory of management-interface plug-ins (sets IC_MI_DIR)");
    app.add_option("--fp-dir", o.global.fpDir, "Directory of functional plug-ins (sets IC_FP_DIR)");
    app.add_option("--sysfs-root", o.global.sysfsRoot,
                   "Root of the sysfs tree the Linux hardware plug-in reads (sets IC_SYSFS_ROOT)");
    app.add_option("--web-config", o.webConfig, "TLS certificate and key, basic-auth users");
    app.add_flag("--insecure-listen", o.insecure,
                 "Allow a non-loopback --listen address without --web-config");
    app.add_option("--reload-interval", o.reloadSeconds,
                   "Seconds between looks for plug-ins added or removed; 0: never")
        ->capture_default_str()
        ->check(CLI::Range(0u, 86400u));
    app.add_option("--max-connections", o.service.maxConnections,
                   "Connections served at once per address")
        ->capture_default_str()
        ->check(CLI::Range(std::size_t{1}, std::size_t{4096}));
    app.add_option("--max-subscribers", o.service.maxSubscribers,
                   "Event-stream clients at once; more get 503")
        ->capture_default_str()
        ->check(CLI::Range(std::size_t{0}, std::size_t{4096}));
    app.add_option("--keep-alive", o.keepAliveSeconds,
                   "Seconds between keep-alive comments on an idle event stream")
        ->capture_default_str()
        ->check(CLI::Range(0.01, 3600.0));
    app.add_flag("-v,--verbose", o.global.verbose,
                 "The library's progress log on standard error; -vv for everything");
    app.set_version_flag("--version", "icd " ICD_VERSION);
    try {
        app.parse(argc, argv);
    } catch (CLI::ParseError const& e) {
        return app.exit(e) == 0 ? kExitOk : kExitUsage;
    }
    if (!listen.empty())
        o.service.listen = listen;
    o.service.keepAlive = std::chrono::milliseconds(static_cast<long>(o.keepAliveSeconds * 1000));
    checkListen(o);
    configureLogging(o.global.verbose, "Helmgard.IC.Icd");
    // Connection threads would each get an allocator arena of their own and
    // keep its memory; two arenas serve a daemon that mostly waits.
    mallopt(M_ARENA_MAX, 2);

    // Every thread started from here on (the library's, the plug-ins', the
    // servers') inherits the mask; only the loop below takes these signals.
    sigset_t signals;
    sigemptyset(&signals);
    for (int s : {SIGTERM, SIGINT, SIGHUP})
        sigaddset(&signals, s);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);

    // The ring and the feed outlive the library, on every way out: a
    // delivery may run until the unload has stopped the plug-ins.
    EventRing ring(kEventRing);
    std::optional<AlertFeed> feed;
    std::optional<Library> lib;
    lib.emplace(o.global);
    IC::InstrumentationControl& ic = lib->ic();
    Plugins::afterOpen();
    feed.emplace(ic, ring);
    if (o.reloadSeconds > 0) {
        auto* loader = new IC::LoaderThread(0, o.reloadSeconds, &Plugins::reload);
        {
            SD::MutexGuard guard(IC::InstCtrl::loadlock);
            IC::InstCtrl::lt = loader; // the last unload stops and deletes it
        }
        if (!loader->start())
            ICD_LOG(6000, "the loader thread did not start; plug-ins stay as loaded");
    }

    HttpService service(ic, *feed, ring, o.service);
    std::vector<std::string> urls;
    try {
        urls = service.start();
    } catch (std::runtime_error const& e) {
        throw Failure(e.what());
    }
    for (std::string const& url : urls)
        std::cout << "icd: listening on " << url << std::endl;
    ICD_LOG(3000, "serving on ", urls.size(), " address(es)");
    notifyService("READY=1");

    for (;;) {
        int sig = 0;
        if (sigwait(&signals, &sig) != 0)
            continue;
        if (sig == SIGHUP) {
            ICD_LOG(3000, "SIGHUP: looking for plug-ins added or removed");
            notifyService("RELOADING=1");
            Plugins::reload();
            notifyService("READY=1");
            continue;
        }
        ICD_LOG(3000, "signal ", sig, ": stopping");
        notifyService("STOPPING=1");
        break;
    }
    service.stop();
    lib.reset(); // Unloadlib: plug-ins stop, no delivery after this
    return kExitOk;
}

} // namespace
} // namespace icd

int main(int argc, char** argv)
{
    using namespace ictools;
    try {
        return icd::run(argc, argv);
    } catch (UsageError const& e) {
        std::cerr << "icd: " << e.what() << '\n';
        return kExitUsage;
    } catch (OpenError const& e) {
        std::cerr << "icd: " << e.what() << "; -v shows the loader's log\n";
        return kExitOpenFailed;
    } catch (std::exception const& e) {
        std::cerr << "icd: " << e.what() << '\n';
        return kExitFailure;
    }
}
