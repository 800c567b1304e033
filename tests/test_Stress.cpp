// Stress, for the thread and address checkers: open/unload cycles with
// twenty plug-ins whose threads raise alerts into a client callback that
// calls the whole facade (registrations of every form, itself included,
// queries), and a loader thread reloading while plug-in files come and go.
// IC_SOAK_CYCLES sets the number of open/unload cycles (300 by default, 100
// under ThreadSanitizer; the soak-long test runs 10,000).
#include <IC/LoaderThread.h>

#include "PluginHarness.h"

#include <dirent.h>
#include <random>

namespace {

using IC::Alert;
using IC::Error;
using IC::Node;
using Paths = std::vector<std::string>;
namespace IST = IC::InstCtrl;
namespace fs = std::filesystem;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kSanitized = true;
#else
constexpr bool kSanitized = false;
#endif
#if defined(__SANITIZE_THREAD__)
constexpr unsigned long kDefaultCycles = 100; // loading libraries is slow there
#else
constexpr unsigned long kDefaultCycles = 300;
#endif

Error ok() { return Error(0, IC::Number(IC::Number::Generic), ""); }

// Keeps the library's output (thousands of warnings) off standard error and
// counts what it logs as an error.
struct QuietErrors {
    QuietErrors()
    {
        std::string const conf = testing::TempDir() + "stress_log.properties";
        std::ofstream(conf) << "log4j.rootLogger=OFF\n";
        HGLog::HGLogger::configure(conf);
        std::remove(conf.c_str());
        HGLog::HGLogger::setListener([this](HGLog::Record const& r) {
            if (r.channel == HGLog::Channel::Log && r.level >= HGLog::HGLogger::LEVEL_ERROR && ++count == 1)
                first = r.logger + ": " + r.message;
        });
    }
    ~QuietErrors()
    {
        HGLog::HGLogger::setListener(HGLog::Listener());
        HGLog::HGLogger::configureDefault();
    }
    std::atomic<unsigned long> count{0};
    std::string first;
};

// ---- open/unload cycles with a re-entering client ----

struct Usage {
    int descriptors = 0, threads = 0, pluginMappings = 0;
    long residentKb = 0;
    bool operator==(Usage const& o) const
    {
        return descriptors == o.descriptors && threads == o.threads && pluginMappings == o.pluginMappings;
    }
};
std::ostream& operator<<(std::ostream& os, Usage const& u)
{
    return os << u.descriptors << " descriptors, " << u.threads << " threads, " << u.pluginMappings
              << " plug-in mappings, " << u.residentKb << " kB resident";
}

int entries(char const* dir)
{
    DIR* d = opendir(dir);
    int n = -3; // ".", ".." and, for /proc/self/fd, opendir's own
    while (d && readdir(d))
        ++n;
    return d ? (closedir(d), n) : -1;
}

Usage usage()
{
    static std::string const root = fs::canonical(IC_STRESS_PLUGIN_ROOT).string() + "/";
    Usage u{entries("/proc/self/fd"), entries("/proc/self/task") + 1, 0, 0};
    std::ifstream maps("/proc/self/maps"), status("/proc/self/status");
    for (std::string line; std::getline(maps, line);)
        u.pluginMappings += line.find(root) != std::string::npos;
    for (std::string line; std::getline(status, line);)
        if (line.rfind("VmRSS:", 0) == 0)
            u.residentKb = std::atol(line.c_str() + 6);
    return u;
}

// Threads asked to end may take a moment to leave /proc.
Usage settled(Usage const& expected)
{
    Usage u;
    ictest::eventually([&] { return (u = usage()) == expected; });
    return u;
}

struct Findings {
    std::atomic<unsigned long> runs{0}, faults{0}, checkedNodes{0};
    std::mutex m;
    std::string first;
    void fault(std::string const& text)
    {
        std::lock_guard<std::mutex> g(m);
        if (faults++ == 0)
            first = text;
    }
} findings;
IC::InstrumentationControl* facade = nullptr;

Error other(std::vector<Alert> const&, void const*) { return ok(); }
void simple(unsigned int, SD::DateTime, std::string, void const*) {}
void check(Error const& e, char const* what)
{
    if (e.getStatus() != 0)
        findings.fault(std::string(what) + " gave status " + std::to_string(e.getStatus()));
}

// Every public operation of the facade, checked where the answer is known;
// context is the caller's own, so that its registrations are its own.
void exercise(Paths const& paths, void const* context, std::size_t minNodes)
{
    IC::InstrumentationControl& ic = *facade;
    auto const cls = static_cast<Alert::ClassType>(2);
    check(ic.registerForAlerts(other, Node::Fan, context), "registerForAlerts");
    check(ic.deRegisterForAlerts(other, Node::Fan, context), "deRegisterForAlerts");
    check(ic.registerForSimpleAlerts(simple, Node::PowerSupply, context), "registerForSimpleAlerts");
    check(ic.deRegisterForSimpleAlerts(simple, Node::PowerSupply, context), "deRegisterForSimpleAlerts");
    check(IST::registerForAlerts(other, cls, context), "register class");
    check(IST::deRegisterForAlerts(other, cls, context), "deregister class");
    if (!paths.empty()) {
        check(IST::registerForAlerts(other, paths, context), "register paths");
        check(IST::deRegisterForAlerts(other, paths, context), "deregister paths");
    }
    std::vector<Alert> asserted;
    std::vector<Node*> all, some;
    check(ic.getAssertedAlerts(asserted), "getAssertedAlerts");
    check(ic.getAllNodes(all), "getAllNodes");
    check(ic.getMap(some, Node::PowerSupply), "getMap");
    if (all.size() < minNodes || ic.getModuleVersion().toString().empty())
        findings.fault("getAllNodes gave " + std::to_string(all.size()) + " nodes");
    for (std::string const& path : paths) {
        Node *node = nullptr, *byId = nullptr;
        check(ic.getNode(path, &node), "getNode(path)");
        if (node == nullptr)
            continue;
        ++findings.checkedNodes;
        check(ic.getNode(node->getNodeId(), &byId), "getNode(id)");
        if (ic.getNodeUniqueId(node) != path || byId != node || node->getSensor() != Node::PowerSupply ||
            ic.getNodeHierarchy(node).empty() ||
            ic.printablePathToPath(ic.pathToPrintablePath(path)) != path)
            findings.fault("the node of an alert's path does not answer for it");
    }
}

// The paths of the functional plug-ins' supplies.
Paths supplyPaths()
{
    std::vector<Node*> supplies;
    facade->getMap(supplies, Node::PowerSupply);
    Paths paths;
    for (Node* n : supplies)
        paths.push_back(facade->getNodeUniqueId(n));
    return paths;
}

// The client's callback, on the plug-ins' threads: the whole facade, then
// itself deregistered and registered again (other threads do the same, so
// either may find the other's work done).
Error reenter(std::vector<Alert> const& alerts, void const* context)
{
    ++findings.runs;
    thread_local char tag;
    Paths paths;
    for (Alert const& a : alerts)
        paths.insert(paths.end(), a.nodePaths().begin(), a.nodePaths().end());
    exercise(paths, &tag, 0);
    facade->deRegisterForAlerts(reenter, Node::PowerSupply, context);
    check(facade->registerForAlerts(reenter, Node::PowerSupply, context), "registering itself again");
    return ok();
}

unsigned long fpReceived()
{
    std::lock_guard<std::mutex> g(ictest::Harness::get().m);
    unsigned long n = 0;
    for (auto const& s : ictest::Harness::get().seen)
        n += s.received;
    return n;
}

TEST(Stress, OpenUnloadCyclesWithAReenteringClientReturnToTheBaseline)
{
    ictest::EnvGuard mi("IC_MI_DIR", IC_STRESS_PLUGIN_ROOT "/mi"), fp("IC_FP_DIR", IC_STRESS_PLUGIN_ROOT "/fp");
    char const* env = std::getenv("IC_SOAK_CYCLES");
    unsigned long const cycles = env && std::atol(env) > 0 ? std::strtoul(env, nullptr, 10) : kDefaultCycles;
    // Memory is compared from after a warm-up: the first cycles grow the
    // allocator's arenas and the loader's caches once.
    unsigned long const warmUp = std::min(cycles, std::max(10ul, cycles / 20));
    ictest::Watchdog dog(kSanitized ? 3600 : 600 + static_cast<int>(cycles / 10), "open/unload cycles (deadlock?)");
    QuietErrors errors;
    std::thread([] {}).join(); // the thread checker's own helper thread starts with the first thread
    Usage const baseline = usage();
    ASSERT_EQ(baseline.pluginMappings, 0);
    Usage warm;
    bool fpAlertsSeen = false;
    int context = 0;
    char mainTag = 0;
    for (unsigned long cycle = 0; cycle < cycles; ++cycle) {
        IC::Error* error = nullptr;
        ASSERT_EQ(Open(&facade, &error), 0) << "cycle " << cycle;
        unsigned long const before = findings.runs;
        ASSERT_EQ(facade->registerForAlerts(reenter, Node::PowerSupply, &context).getStatus(), 0);
        // Ten interfaces of six nodes, ten functional plug-ins of two.
        exercise(supplyPaths(), &mainTag, 80);
        ASSERT_TRUE(ictest::eventually([&] { return findings.runs > before; })) << "no alert reached the client, cycle " << cycle;
        fpAlertsSeen = fpAlertsSeen || fpReceived() > 0;
        Unloadlib(); // while the callbacks are busy
        ictest::forgetPlugins();
        if (cycle + 1 == warmUp)
            warm = settled(baseline);
        if ((cycle + 1) % 1000 == 0)
            std::cout << "soak: " << cycle + 1 << " cycles, " << usage() << std::endl;
    }
    Usage const final = settled(baseline);
    std::cout << "soak: " << cycles << " cycles\n  baseline " << baseline << "\n  warm     " << warm
              << "\n  final    " << final << std::endl;
    EXPECT_TRUE(warm == baseline && final == baseline);
    EXPECT_TRUE(fpAlertsSeen) << "the functional plug-ins' own registrations never received an alert";
    EXPECT_GT(findings.checkedNodes.load(), 0u);
    EXPECT_EQ(findings.faults.load(), 0u) << findings.first;
    EXPECT_EQ(errors.count.load(), 0u) << errors.first;
    // Sanitizers keep freed memory aside; resident memory says nothing there.
    EXPECT_TRUE(kSanitized || final.residentKb <= warm.residentKb + warm.residentKb / 20)
        << "resident memory grew by more than 5 % after the warm-up";
}

// ---- reload under churn ----

std::atomic<long> clientAlerts{0};
Error client(std::vector<Alert> const& alerts, void const*)
{
    clientAlerts += static_cast<long>(alerts.size());
    return ok();
}

// A loader thread reloading every second while plug-in files come and go,
// interfaces raising alerts and reporting nodes from their own threads, and
// clients querying and (de)registering. After the last unload every plug-in
// is released and every library closed.
TEST(Stress, ReloadsAlertsQueriesAndRegistrationsTogether)
{
    ictest::fullyUnload();
    ictest::Watchdog dog(kSanitized ? 600 : 120, "reload under churn");
    ictest::TempTree tree;
    ictest::EnvGuard mi("IC_MI_DIR", tree.miDir()), fp("IC_FP_DIR", tree.fpDir());
    QuietErrors quiet;
    // Plug-ins that stay for the whole run (the relay hands interface alerts
    // on to clients), and some that come and go.
    tree.addMI("mi_thread");
    tree.addMI("mi_alpha");
    tree.addFP("fp_relay");
    tree.addFP("fp_one");
    IC::InstrumentationControl* ic = nullptr;
    IC::Error* err = nullptr;
    ASSERT_EQ(Open(&ic, &err), 0);
    int clientCtx = 0;
    ASSERT_EQ(ic->registerForAlerts(&client, Node::Fan, &clientCtx).getStatus(), 0);
    IST::lt = new IC::LoaderThread(0, 1, &IST::TimedReload);
    ASSERT_TRUE(IST::lt->start());

    std::atomic<bool> stop{false};
    std::atomic<long> queries{0};
    std::vector<ictest::JoinedThread> workers;
    // Copies appear under new names only, so a loaded image is never
    // overwritten in place.
    workers.emplace_back([&] {
        std::mt19937 rng(12345);
        std::vector<std::string> const modules[] = {{"mi_alpha", "mi_beta", "mi_gamma", "mi_thread"}, {"fp_one", "fp_two"}};
        std::vector<std::string> files[2];
        for (int serial = 0; !stop; ++serial, std::this_thread::sleep_for(std::chrono::milliseconds(150))) {
            unsigned const kind = rng() % 2, op = rng() % 3;
            std::string const dir = kind == 0 ? tree.miDir() : tree.fpDir();
            auto& mine = files[kind];
            std::size_t const i = mine.empty() ? 0 : rng() % mine.size();
            if ((op == 0 && mine.size() < 4) || mine.empty())
                mine.push_back(tree.install(dir, modules[kind][rng() % modules[kind].size()], "c" + std::to_string(serial) + ".so"));
            else if (op == 1) {
                fs::remove(mine[i]);
                mine.erase(mine.begin() + static_cast<long>(i));
            } else {
                std::string const to = dir + "/r" + std::to_string(serial) + ".so";
                fs::rename(mine[i], to);
                mine[i] = to;
            }
        }
    });
    // Clients on threads of their own: the whole facade on the supplies.
    facade = ic;
    for (int q = 0; q < 3; ++q)
        workers.emplace_back([&] {
            thread_local char tag;
            for (; !stop; ++queries, std::this_thread::sleep_for(std::chrono::milliseconds(2)))
                exercise(supplyPaths(), &tag, 0);
        });
    std::this_thread::sleep_for(std::chrono::seconds(6));
    stop = true;
    workers.clear();
    EXPECT_EQ(findings.faults.load(), 0u) << findings.first;
    EXPECT_GT(queries.load(), 0);
    EXPECT_GT(clientAlerts.load(), 0) << "alerts went from interface threads through the relay";
    Unloadlib();
    EXPECT_TRUE(IST::ICloadCount == 0u && IST::lt == nullptr && IST::mymis.empty() && IST::myfps.empty());
    {
        std::lock_guard<std::mutex> g(ictest::Harness::get().m);
        EXPECT_GT(ictest::Harness::get().seen.size(), 4u) << "the loader thread loaded plug-ins";
        for (auto const& s : ictest::Harness::get().seen)
            EXPECT_TRUE(s.released) << s.name;
    }
    EXPECT_FALSE(ictest::isMapped(tree.root()));
    ictest::forgetPlugins();
}

} // namespace
