// The first Open and its Unloadlib with 64 management interfaces, against
// what any loader must do at least: dlopen the same 64 files, find
// "OpenMI", call it, release the object and close the library. A second
// baseline adds the least that the plug-in trust check needs: the directory
// opened once, each file's status taken in it before the load, and the
// kernel asked once per file which inode the loader mapped.
#include <IC/InstrumentationControl.h>
#include <IC/ManagementInterface.h>

#include <benchmark/benchmark.h>

#include <dlfcn.h>
#include <fcntl.h>
#include <link.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
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

// struct procmap_query of Linux 6.11, which the system headers may predate.
struct MappingQuery {
    std::uint64_t size, flags, address, start, end, vmaFlags, pageSize, offset, inode;
    std::uint32_t devMajor, devMinor, nameSize, buildIdSize;
    std::uint64_t nameAddress, buildIdAddress;
};

void BM_OpenUnloadCheckedBaseline(benchmark::State& state)
{
    Dirs const& d = dirs();
    for (auto _ : state) {
        int const dir = open(d.mi.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
        int const maps = open("/proc/self/maps", O_RDONLY | O_CLOEXEC);
        std::vector<void*> handles;
        std::vector<IC::ManagementInterface*> mis;
        for (std::string const& file : d.files) {
            struct stat st {};
            fstatat(dir, fs::path(file).filename().c_str(), &st, AT_SYMLINK_NOFOLLOW);
            void* handle = dlopen(file.c_str(), RTLD_NOW | RTLD_LOCAL);
            struct link_map* map = nullptr;
            dlinfo(handle, RTLD_DI_LINKMAP, &map);
            MappingQuery query{};
            query.size = sizeof query;
            query.address = reinterpret_cast<std::uintptr_t>(map->l_ld);
            if (ioctl(maps, _IOWR('f', 17, MappingQuery), &query) != 0 || query.inode != st.st_ino)
                state.SkipWithError("mapped inode unknown or changed");
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
        close(maps);
        close(dir);
    }
}
BENCHMARK(BM_OpenUnloadCheckedBaseline)->Unit(benchmark::kMillisecond);

} // namespace

BENCHMARK_MAIN();
