// `icctl tree` on the large example server, as a whole process: start,
// open the library, load the plug-ins, read the tree, print, unload, exit.
// And `icctl --json tree` on a generated tree of 100,000 hwmon sensors
// (examples/sysfs/make-huge.sh, written once to IC_HUGE_SYSFS or
// /tmp/ic-huge-sysfs), with the child's peak resident set.
#include <benchmark/benchmark.h>

#include <fcntl.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <string>
#include <vector>

extern char** environ;

namespace {

// Exit status of the child, -1 if it did not exit; *peakKiB its peak
// resident set when asked for.
int runOnce(std::vector<std::string> const& args, long* peakKiB = nullptr)
{
    std::vector<char*> argv;
    for (std::string const& a : args)
        argv.push_back(const_cast<char*>(a.c_str()));
    argv.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
    pid_t pid = 0;
    int rc = posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (rc != 0)
        return -1;
    int status = 0;
    struct rusage usage {};
    wait4(pid, &status, 0, &usage);
    if (peakKiB)
        *peakKiB = usage.ru_maxrss;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

void BM_IcctlTreeLargeServer(benchmark::State& state)
{
    std::vector<std::string> const args = {ICCTL_PATH,  "--mi-dir",      LINUXHW_DIR,
                                           "--fp-dir",  HEALTH_DIR,      "--sysfs-root",
                                           EXAMPLES_DIR "/large", "tree"};
    for (auto _ : state) {
        if (runOnce(args) != 0) {
            state.SkipWithError("icctl tree failed");
            break;
        }
    }
}
BENCHMARK(BM_IcctlTreeLargeServer)->Unit(benchmark::kMillisecond)->UseRealTime();

void BM_IcctlJsonTreeHugeServer(benchmark::State& state)
{
    char const* env = std::getenv("IC_HUGE_SYSFS");
    std::string const root = env && *env ? env : "/tmp/ic-huge-sysfs";
    struct stat st {};
    if (stat(root.c_str(), &st) != 0 &&
        runOnce({"/bin/sh", EXAMPLES_DIR "/make-huge.sh", root}) != 0) {
        state.SkipWithError("make-huge.sh failed");
        return;
    }
    std::vector<std::string> const args = {ICCTL_PATH, "--mi-dir", LINUXHW_DIR, "--fp-dir",
                                           HEALTH_DIR, "--sysfs-root", root, "--json", "tree"};
    long peak = 0;
    for (auto _ : state) {
        long p = 0;
        if (runOnce(args, &p) != 0) {
            state.SkipWithError("icctl --json tree failed");
            break;
        }
        peak = std::max(peak, p);
    }
    state.counters["peak_rss_MB"] = static_cast<double>(peak) / 1024.0;
}
BENCHMARK(BM_IcctlJsonTreeHugeServer)->Unit(benchmark::kSecond)->UseRealTime()->Iterations(1);

} // namespace

BENCHMARK_MAIN();
