// `icctl tree` on the large example server, as a whole process: start,
// open the library, load the plug-ins, read the tree, print, unload, exit.
#include <benchmark/benchmark.h>

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

extern char** environ;

namespace {

int runOnce(std::vector<std::string> const& args)
{
    std::vector<char*> argv;
    for (std::string const& a : args)
        argv.push_back(const_cast<char*>(a.c_str()));
    argv.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
    pid_t pid = 0;
    int rc = posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (rc != 0)
        return -1;
    int status = 0;
    waitpid(pid, &status, 0);
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

} // namespace

BENCHMARK_MAIN();
