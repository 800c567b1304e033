// The first Open and its Unloadlib with 64 management interfaces, against
// what any loader must do at least: dlopen the same 64 files, find
// "OpenMI", call it, release the object and close the library. A second
// baseline adds the least that a check of the files which cannot be raced
// needs: the directory opened once, each file's status taken in it, the file
// opened and compared with that status, and loaded through its descriptor.
#include <IC/InstrumentationControl.h>
#include <IC/ManagementInterface.h>

#include <benchmark/benchmark.h>

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

namespace fs = std::filesystem;

namespace {

constexpr int kPlugins = 64;

// Plug-in directories with 64 copies of the benchmark MI (copies, so that
// each is a library of its own) and no functional plug-in.
struct Dirs {
    fs::path root;
    fs::path mi;
    fs::path fp;
    std::vector<std::string> files;

    Dirs()
    {
        char tmpl[] = "/tmp/ic-bench-open-XXXXXX";
        root = mkdtemp(tmpl);
        mi = root / "mi";
        fp = root / "fp";
        fs::create_directories(mi);
        fs::create_directories(fp);
        for (int i = 0; i < kPlugins; ++i) {
            fs::path const file = mi / ("bench" + std::to_string(100 + i) + ".so");
            fs::copy_file(BENCH_MI_PATH, file);
            files.push_back(file.string());
        }
        setenv("IC_MI_DIR", mi.c_str(), 1);
        setenv("IC_FP_DIR", fp.c_str(), 1);
    }
    ~Dirs() { fs::remove_all(root); }
};

Dirs& dirs()
{
    static Dirs d;
    return d;
}

void BM_OpenUnloadLibrary(benchmark::State& state)
{
    dirs();
    for (auto _ : state) {
        IC::InstrumentationControl* ic = nullptr;
        IC::Error* err = nullptr;
        if (Open(&ic, &err) != 0)
            state.SkipWithError("Open failed");
        Unloadlib();
    }
}
BENCHMARK(BM_OpenUnloadLibrary)->Unit(benchmark::kMillisecond);

void BM_OpenUnloadBaseline(benchmark::State& state)
{
    Dirs const& d = dirs();
    for (auto _ : state) {
        std::vector<void*> handles;
        std::vector<IC::ManagementInterface*> mis;
        for (std::string const& file : d.files) {
            void* handle = dlopen(file.c_str(), RTLD_NOW | RTLD_LOCAL);
            auto open = reinterpret_cast<IC::OpenMIFunction>(dlsym(handle, "OpenMI"));
            IC::ManagementInterface* mi = nullptr;
            IC::Error* err = nullptr;
            open(&mi, &err);
            handles.push_back(handle);
            mis.push_back(mi);
        }
        for (auto it = mis.rbegin(); it != mis.rend(); ++it)
            (*it)->release();
        for (auto it = handles.rbegin(); it != handles.rend(); ++it)
            dlclose(*it);
    }
}
BENCHMARK(BM_OpenUnloadBaseline)->Unit(benchmark::kMillisecond);

void BM_OpenUnloadCheckedBaseline(benchmark::State& state)
{
    Dirs const& d = dirs();
    for (auto _ : state) {
        int const dir = open(d.mi.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
        std::vector<void*> handles;
        std::vector<int> fds;
        std::vector<IC::ManagementInterface*> mis;
        for (std::string const& file : d.files) {
            std::string const name = fs::path(file).filename().string();
            struct stat before {}, after {};
            fstatat(dir, name.c_str(), &before, AT_SYMLINK_NOFOLLOW);
            int const fd = openat(dir, name.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
            fstat(fd, &after);
            if (before.st_ino != after.st_ino || !S_ISREG(after.st_mode))
                state.SkipWithError("file changed");
            std::string const proc = "/proc/self/fd/" + std::to_string(fd);
            void* handle = dlopen(proc.c_str(), RTLD_NOW | RTLD_LOCAL);
            auto open = reinterpret_cast<IC::OpenMIFunction>(dlsym(handle, "OpenMI"));
            IC::ManagementInterface* mi = nullptr;
            IC::Error* err = nullptr;
            open(&mi, &err);
            handles.push_back(handle);
            fds.push_back(fd);
            mis.push_back(mi);
        }
        for (auto it = mis.rbegin(); it != mis.rend(); ++it)
            (*it)->release();
        for (auto it = handles.rbegin(); it != handles.rend(); ++it)
            dlclose(*it);
        for (int fd : fds)
            close(fd);
        close(dir);
    }
}
BENCHMARK(BM_OpenUnloadCheckedBaseline)->Unit(benchmark::kMillisecond);

} // namespace

BENCHMARK_MAIN();
