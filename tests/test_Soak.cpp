// Soak: opens and unloads the library over and over with twenty well-behaved
// plug-ins (ten management interfaces and ten functional plug-ins, half of
// each raising alerts from threads of their own), then checks that open
// descriptors, threads, mapped plug-in libraries and resident memory are back
// where they were.
//
// IC_SOAK_CYCLES sets the number of cycles; CTest runs a short soak (label
// "soak") and the full one (label "soak-long", 10,000 cycles).
#include "SoakLog.h"

#include <IC/InstrumentationControl.h>
#include <IC/Node.h>

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <iostream>
#include <string>
#include <thread>
#include <vector>

#include <dirent.h>
#include <dlfcn.h>
#include <unistd.h>

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define SOAK_SANITIZED 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define SOAK_SANITIZED 1
#endif
#endif
#ifndef SOAK_SANITIZED
#define SOAK_SANITIZED 0
#endif

namespace {

using Clock = std::chrono::steady_clock;

constexpr unsigned int kPluginsPerKind = 10;
// Nodes every open holds at least: three per management interface, one per
// functional plug-in.
constexpr std::size_t kMinNodes = 3 * kPluginsPerKind + kPluginsPerKind;

unsigned long cyclesToRun()
{
    if (char const* v = std::getenv("IC_SOAK_CYCLES")) {
        char* end = nullptr;
        unsigned long const n = std::strtoul(v, &end, 10);
        if (end != v && *end == '\0' && n > 0)
            return n;
    }
    return 300;
}

// Entries of a /proc directory, without "." and "..".
int countEntries(char const* path)
{
    DIR* dir = opendir(path);
    if (dir == nullptr)
        return -1;
    int n = 0;
    while (dirent* e = readdir(dir))
        if (std::string(e->d_name) != "." && std::string(e->d_name) != "..")
            ++n;
    closedir(dir);
    return n;
}

struct Usage {
    int descriptors = 0;
    int threads = 0;
    int pluginMappings = 0;
    long residentKb = 0;
};

// Where the plug-ins lie, as /proc/self/maps names it: links resolved.
std::string const& pluginRoot()
{
    static std::string const root = [] {
        char* real = realpath(SOAK_PLUGIN_ROOT, nullptr);
        std::string const r = real != nullptr ? real : SOAK_PLUGIN_ROOT;
        std::free(real);
        return r + "/";
    }();
    return root;
}

Usage usage()
{
    Usage u;
    // Less the one opendir holds while counting.
    u.descriptors = countEntries("/proc/self/fd") - 1;
    u.threads = countEntries("/proc/self/task");
    std::ifstream maps("/proc/self/maps");
    std::string line;
    while (std::getline(maps, line))
        if (line.find(pluginRoot()) != std::string::npos)
            ++u.pluginMappings;
    std::ifstream status("/proc/self/status");
    while (std::getline(status, line))
        if (line.rfind("VmRSS:", 0) == 0)
            u.residentKb = std::atol(line.c_str() + 6);
    return u;
}

std::ostream& operator<<(std::ostream& os, Usage const& u)
{
    return os << u.descriptors << " descriptors, " << u.threads << " threads, "
              << u.pluginMappings << " plug-in mappings, " << u.residentKb << " kB resident";
}

// Threads that were asked to end may take a moment to leave /proc.
Usage settledUsage(Usage const& expected)
{
    auto const deadline = Clock::now() + std::chrono::seconds(5);
    Usage u = usage();
    while ((u.threads != expected.threads || u.descriptors != expected.descriptors ||
            u.pluginMappings != expected.pluginMappings) &&
           Clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
        u = usage();
    }
    return u;
}

std::atomic<unsigned long> delivered{0};

IC::Error clientAlerts(std::vector<IC::Alert> const& alerts, void const*)
{
    delivered += alerts.size();
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

// What the functional plug-ins' own registrations received so far, asked of
// the copies that are loaded now.
unsigned long fpReceived()
{
    unsigned long total = 0;
    for (unsigned int i = 0; i < kPluginsPerKind; ++i) {
        std::string const file = std::string(SOAK_FP_DIR) + "/soak_fp_" + std::to_string(i) + ".so";
        void* h = dlopen(file.c_str(), RTLD_NOW | RTLD_NOLOAD);
        if (h == nullptr)
            continue;
        if (auto fn = reinterpret_cast<unsigned long (*)()>(dlsym(h, "soak_fp_received")))
            total += fn();
        dlclose(h);
    }
    return total;
}

bool eventually(std::function<bool()> const& condition)
{
    auto const deadline = Clock::now() + std::chrono::seconds(5);
    while (!condition()) {
        if (Clock::now() > deadline)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
}

TEST(Soak, OpenAndUnloadCyclesReturnToTheBaseline)
{
    setenv("IC_MI_DIR", SOAK_MI_DIR, 1);
    setenv("IC_FP_DIR", SOAK_FP_DIR, 1);
    unsigned long const cycles = cyclesToRun();
    // Memory is compared from after a warm-up: the first cycles grow the
    // allocator's arenas and the loader's caches once.
    unsigned long const warmUp = std::min(cycles, std::max(10ul, cycles / 20));
    // Every so often a cycle also waits for alerts to come through.
    unsigned long const probeEvery = std::max(1ul, cycles / 20);

    soak::ErrorLog errors;
    // ThreadSanitizer's runtime starts a background thread of its own when
    // the process first creates one; that one is not the library's.
    std::thread([] {}).join();
    Usage const baseline = usage();
    ASSERT_EQ(baseline.pluginMappings, 0) << "plug-ins mapped before the first open";
    Usage warm;
    int token = 0;
    bool fpAlertsSeen = false;
    auto const started = Clock::now();

    for (unsigned long cycle = 0; cycle < cycles; ++cycle) {
        IC::InstrumentationControl* ic = nullptr;
        IC::Error* error = nullptr;
        unsigned char const code = Open(&ic, &error);
        ASSERT_EQ(code, 0) << "cycle " << cycle;
        ASSERT_NE(ic, nullptr);
        ASSERT_EQ(ic->registerForAlerts(clientAlerts, IC::Node::PowerSupply, &token).getStatus(), 0);
        std::vector<IC::Node*> nodes;
        ASSERT_EQ(ic->getAllNodes(nodes).getStatus(), 0);
        ASSERT_GE(nodes.size(), kMinNodes) << "cycle " << cycle;
        if (cycle % probeEvery == 0 || cycle + 1 == cycles) {
            unsigned long const before = delivered.load();
            EXPECT_TRUE(eventually([&] { return delivered.load() > before; }))
                << "no alert reached the client in cycle " << cycle;
            Usage const open = usage();
            EXPECT_GT(open.pluginMappings, 0) << "the plug-ins are not mapped while open";
            fpAlertsSeen = fpAlertsSeen || fpReceived() > 0;
        }
        Unloadlib();

        if (cycle + 1 == warmUp)
            warm = settledUsage(baseline);
        if (cycles >= 1000 && (cycle + 1) % 1000 == 0) {
            double const seconds =
                std::chrono::duration<double>(Clock::now() - started).count();
            std::cout << "soak: " << cycle + 1 << " cycles, " << seconds << " s, " << usage() << std::endl;
        }
    }

    Usage const final = settledUsage(baseline);
    std::cout << "soak: " << cycles << " cycles\n  baseline " << baseline << "\n  warm     " << warm
              << "\n  final    " << final << std::endl;
    EXPECT_GT(delivered.load(), 0u);
    EXPECT_EQ(errors.count(), 0u) << "the library logged errors";
    for (std::string const& e : errors.first())
        ADD_FAILURE() << e;
    EXPECT_TRUE(fpAlertsSeen) << "the functional plug-ins' own registrations never received an alert";
    EXPECT_EQ(final.descriptors, baseline.descriptors);
    EXPECT_EQ(final.threads, baseline.threads);
    EXPECT_EQ(final.pluginMappings, 0);
    EXPECT_EQ(warm.descriptors, baseline.descriptors);
    EXPECT_EQ(warm.threads, baseline.threads);
    EXPECT_EQ(warm.pluginMappings, 0);
#if SOAK_SANITIZED
    // The sanitizers' runtimes keep freed memory aside (ASan's quarantine)
    // or grow shadow memory as they go; resident memory says nothing there.
    // LeakSanitizer checks for leaks at exit instead.
    std::cout << "soak: resident memory not compared under a sanitizer" << std::endl;
#else
    EXPECT_LE(final.residentKb, warm.residentKb + warm.residentKb / 20)
        << "resident memory grew by more than 5 % after the warm-up";
#endif
}

} // namespace
