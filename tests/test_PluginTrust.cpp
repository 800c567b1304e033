// Tests of the loader's trust checks: which files SD::PlatformUtilities::
// loadLibrary refuses before any of their code runs, which it accepts, the
// switch that turns the checks off, and that what it loads is the file it
// checked.
//
// Every stand-in plug-in appends its name to the file named by TRUST_MARKER
// from its constructor, so a refusal that came after the loader had started
// running the library shows as a marker.
#include <SD/PlatformUtilities.h>

#include <HGLog/HGLogger.h>
#include <TestSupport.h>

#include <cerrno>
#include <cstring>

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

// A user id that owns nothing here; nobody on Debian.
constexpr uid_t kForeignUid = 65534;
constexpr int kError = HGLog::HGLogger::LEVEL_ERROR, kWarning = HGLog::HGLogger::LEVEL_WARNING;

struct HandleCloser {
    void operator()(SD::_LibraryHandle* h) const { SD::PlatformUtilities::unloadLibrary(h); }
};
using Handle = std::unique_ptr<SD::_LibraryHandle, HandleCloser>;
Handle load(std::string const& file)
{
    return Handle(SD::PlatformUtilities::loadLibrary(file.c_str()));
}

template <class T>
T symbol(SD::_LibraryHandle* h, std::string name)
{
    return reinterpret_cast<T>(SD::PlatformUtilities::loadSymbol(h, &name[0]));
}
std::string nameOf(SD::_LibraryHandle* h)
{
    auto const fn = symbol<char const* (*)()>(h, "trust_name");
    return fn ? fn() : "<no trust_name>";
}

// The file the library is, as the loader names it.
std::string fileOf(SD::_LibraryHandle* h)
{
    return symbol<char const* (*)()>(h, "trust_file")();
}

class PluginTrust : public ::testing::Test {
protected:
    void SetUp() override { unsetenv("IC_PLUGIN_TRUST"); }
    std::string path(std::string const& name) const { return dir_.path(name); }
    // "{root}" in text stands for the temporary directory.
    std::string expand(std::string text) const
    {
        for (std::size_t at; (at = text.find("{root}")) != std::string::npos;)
            text.replace(at, 6, dir_.root());
        return text;
    }

    // Sets up the tree from steps separated by ';': "dir <name> <mode>",
    // "copy <fixture> <name> [mode]", "link <target> <name>", "fifo <name>"
    // and "give <name>" (to the foreign user; skips the test where this
    // process may not).
    void build(std::string const& steps)
    {
        std::istringstream all(expand(steps));
        for (std::string step; std::getline(all, step, ';');) {
            std::istringstream in(step);
            std::string op, a, b, mode;
            in >> op >> a >> b >> mode;
            if (op == "dir")
                ASSERT_TRUE(mkdir(path(a).c_str(), 0700) == 0 &&
                            chmod(path(a).c_str(), std::stoul(b, nullptr, 8)) == 0);
            else if (op == "copy")
                ASSERT_TRUE(std::filesystem::copy_file(std::string(TRUST_FIXTURE_DIR) + "/" + a + ".so", path(b)) &&
                            chmod(path(b).c_str(), mode.empty() ? 0755 : std::stoul(mode, nullptr, 8)) == 0);
            else if (op == "link")
                ASSERT_EQ(symlink(a.c_str(), path(b).c_str()), 0) << b;
            else if (op == "fifo")
                ASSERT_EQ(mkfifo(path(a).c_str(), 0644), 0) << a;
            else if (op == "give" && lchown(path(a).c_str(), kForeignUid, kForeignUid) != 0)
                GTEST_SKIP() << "cannot give " << a << " away: " << std::strerror(errno);
        }
    }

    std::string markerText() const { return ictest::slurp(marker_); }

    // Refused with exactly one error line that names the file and contains
    // why, and none of the library's code ran.
    void expectRefused(std::string const& file, std::string const& why)
    {
        SCOPED_TRACE(file);
        ictest::LogCapture cap;
        EXPECT_EQ(load(file), nullptr) << "loaded although it should be refused";
        auto const logs = cap.logs();
        ASSERT_EQ(logs.size(), 1u);
        EXPECT_TRUE(logs[0].logger == "Helmgard.SD.PlatformUtilities" && logs[0].level == kError);
        EXPECT_EQ(logs[0].message.rfind("Cannot load library " + file + ": ", 0), 0u) << logs[0].message;
        EXPECT_NE(logs[0].message.find(why), std::string::npos) << logs[0].message << "\nexpected: " << why;
        EXPECT_EQ(markerText(), "") << "the library's constructor ran";
    }

    // Loaded without a warning, running the constructor of the build called
    // name and giving that build's symbols, known to the loader by the name
    // of the file links lead to; the marker is cleared.
    void expectAccepted(std::string const& file, std::string const& name)
    {
        SCOPED_TRACE(file);
        ictest::LogCapture cap;
        Handle const h = load(file);
        ASSERT_NE(h, nullptr);
        EXPECT_EQ(nameOf(h.get()), name);
        EXPECT_EQ(std::filesystem::path(fileOf(h.get())).lexically_normal(), std::filesystem::canonical(file));
        EXPECT_EQ(markerText(), name + "\n");
        for (auto const& r : cap.logs())
            EXPECT_LT(r.level, kWarning) << r.message;
        std::remove(marker_.c_str());
    }

    ictest::TempDir dir_{"ictrust"};
    std::string const marker_ = dir_.path("marker");
    ictest::EnvGuard markerEnv_{"TRUST_MARKER", marker_}, trustEnv_{"IC_PLUGIN_TRUST"};
};

// ------------------------------------------------------ accepted and refused

struct Case {
    char const* name;
    std::string steps, file;
    std::string outcome; // the build that loads, or a part of the refusal
    bool refused;
};

class TrustCase : public PluginTrust, public ::testing::WithParamInterface<Case> {};

TEST_P(TrustCase, LoadsOrIsRefusedBeforeItsCodeRuns)
{
    Case const& c = GetParam();
    ASSERT_NO_FATAL_FAILURE(build(c.steps));
    if (IsSkipped())
        return;
    if (c.refused)
        expectRefused(path(c.file), expand(c.outcome));
    else
        expectAccepted(path(c.file), c.outcome);
}

INSTANTIATE_TEST_SUITE_P(
    Trust, TrustCase,
    ::testing::Values(
        Case{"PrivateDirectory", "copy trust_probe plugin.so", "plugin.so", "trust_probe", false},
        Case{"OwnFileInStickyDirectory", "dir shared 1777; copy trust_probe shared/plugin.so", "shared/plugin.so",
             "trust_probe", false},
        // The checks apply to the file a link leads to, not to the link.
        Case{"LinkInOpenDirectory", "copy trust_probe plugin.so; dir open 0777; link {root}/plugin.so open/link.so",
             "open/link.so", "trust_probe", false},
        // Finds its dependency beside itself through its run path $ORIGIN.
        Case{"OriginLibrary", "copy libtrust_dep libtrust_dep.so; copy trust_origin plugin.so", "plugin.so",
             "trust_origin", false},
        Case{"ChainOfLinksToForeignFile",
             "copy trust_probe foreign.so; give foreign.so; link {root}/foreign.so first.so; link first.so second.so",
             "second.so", "not trusted: {root}/foreign.so is owned by uid 65534, not by root or the effective user",
             true},
        Case{"OthersWritableFile", "copy trust_probe plugin.so 0646", "plugin.so", "(mode 0646)", true},
        Case{"GroupWritableDirectory", "dir team 0770; copy trust_probe team/plugin.so", "team/plugin.so",
             "not trusted: directory {root}/team is writable by group or others without the sticky bit (mode 0770)",
             true},
        Case{"OthersWritableDirectory", "dir open 0707; copy trust_probe open/plugin.so", "open/plugin.so",
             "directory {root}/open is writable by group or others without the sticky bit (mode 0707)", true},
        Case{"OpenAncestor", "dir open 0777; dir open/lib 0755; copy trust_probe open/lib/plugin.so",
             "open/lib/plugin.so", "directory {root}/open is writable", true},
        Case{"ForeignDirectory", "dir theirs 0755; copy trust_probe theirs/plugin.so; give theirs",
             "theirs/plugin.so", "not trusted: directory {root}/theirs is owned by uid 65534", true},
        Case{"ForeignFileInStickyDirectory",
             "dir shared 1777; copy trust_probe shared/plugin.so; give shared/plugin.so", "shared/plugin.so",
             "not trusted: {root}/shared/plugin.so in the shared directory {root}/shared is owned by uid 65534", true},
        // Every symbol is bound before any constructor runs.
        Case{"UnresolvedSymbol", "copy trust_unresolved plugin.so", "plugin.so",
             "undefined symbol: trust_fixture_missing_symbol", true},
        Case{"UntrustedOriginLibrary", "copy libtrust_dep libtrust_dep.so; copy trust_origin plugin.so 0664",
             "plugin.so", "not trusted: {root}/plugin.so is writable by group or others (mode 0664)", true}),
    [](::testing::TestParamInfo<Case> const& info) { return std::string(info.param.name); });

// Read on every load; only "off", in any case, switches the owner and
// permission checks off, and never the one for regular files.
TEST_F(PluginTrust, OnlyOffSwitchesTheChecksOffWithAWarningOnEveryLoad)
{
    ASSERT_NO_FATAL_FAILURE(build("dir open 0777; copy trust_probe open/plugin.so 0666; fifo pipe.so"));
    std::string const file = path("open/plugin.so");
    for (char const* value : {"off", "OFF", "Off"}) {
        setenv("IC_PLUGIN_TRUST", value, 1);
        ictest::LogCapture cap;
        EXPECT_NE(load(file), nullptr) << value;
        EXPECT_EQ(markerText(), "trust_probe\n");
        std::remove(marker_.c_str());
        auto const logs = cap.logs();
        ASSERT_EQ(std::count_if(logs.begin(), logs.end(), [](auto const& r) { return r.level >= kWarning; }), 1);
        auto const warning = *std::find_if(logs.begin(), logs.end(), [](auto const& r) { return r.level >= kWarning; });
        EXPECT_TRUE(warning.level == kWarning && warning.logger == "Helmgard.SD.PlatformUtilities");
        EXPECT_EQ(warning.message, "Plug-in trust checks are off (IC_PLUGIN_TRUST=off): loading " + file +
                                       " without checking its owners and permissions");
        expectRefused(path("pipe.so"), "not a regular file");
    }
    for (char const* value : {"", "on", "0", "of", "offf"}) {
        setenv("IC_PLUGIN_TRUST", value, 1);
        expectRefused(file, "is writable by group or others");
    }
}

// A library built with -z nodelete stays mapped after its last close, still
// known to the loader by the name it was opened with: the next library must
// not be taken for it. Builds export the same names, and each handle gives
// the code of its own file (trust_whoami reaches trust_name through the
// dynamic linker, so a shared scope would answer with the first one's).
TEST_F(PluginTrust, EachHandleGivesTheCodeOfItsOwnFileEvenAfterALingeringOne)
{
    ASSERT_NO_FATAL_FAILURE(build("copy trust_lingering lingering.so; copy trust_probe a.so; copy trust_other b.so"));
    ASSERT_EQ(nameOf(load(path("lingering.so")).get()), "trust_lingering");
    for (int i = 0; i < 3; ++i) {
        Handle const a = load(path("a.so")), b = load(path("b.so"));
        ASSERT_TRUE(a && b);
        for (auto const& [h, name] : {std::pair{a.get(), "a.so"}, std::pair{b.get(), "b.so"}}) {
            EXPECT_EQ(fileOf(h), path(name));
            EXPECT_EQ(symbol<char const* (*)()>(h, "trust_whoami")(), nameOf(h));
        }
        EXPECT_EQ(nameOf(b.get()), "trust_other");
    }
    EXPECT_EQ(markerText(), "trust_lingering\n" + std::string("trust_probe\ntrust_other\n") +
                                "trust_probe\ntrust_other\ntrust_probe\ntrust_other\n");
    // Replaced on disk while the loader still holds the old one by its name:
    // the new file is the one loaded.
    std::remove(marker_.c_str());
    ASSERT_NO_FATAL_FAILURE(build("copy trust_other fresh.so"));
    ASSERT_EQ(rename(path("fresh.so").c_str(), path("lingering.so").c_str()), 0);
    expectAccepted(path("lingering.so"), "trust_other");
}

// A scan reuses the walk down to a directory, never the verdict on a file:
// in one pass, each file of the directory is still judged on its own, and a
// file elsewhere gets its own walk. The verdict on the directories lasts as
// long as the scan: a directory opened to others during a pass is refused
// from the next pass on. An inner scan keeps its own verdicts and leaves the
// outer one's alone.
TEST_F(PluginTrust, InAScanEachFileIsJudgedOnItsOwnAndEachDirectoryOnce)
{
    ASSERT_NO_FATAL_FAILURE(build("dir mi 0755; dir open 0777; dir fp 0755; copy trust_probe mi/a.so;"
                                  "copy trust_probe mi/b.so; copy trust_probe mi/w.so 0666; fifo mi/pipe.so;"
                                  "copy trust_other o.so; link {root}/o.so mi/link.so; copy trust_other open/a.so;"
                                  "copy trust_other fp/f.so"));
    {
        SD::PlatformUtilities::Scan const outer;
        expectAccepted(path("mi/a.so"), "trust_probe");
        expectRefused(path("mi/w.so"), "is writable by group or others (mode 0666)");
        expectRefused(path("mi/pipe.so"), "not a regular file");
        expectRefused(path("mi/missing.so"), "No such file or directory");
        expectRefused(path("open/a.so"), "directory " + path("open") + " is writable");
        expectRefused(path("mi/.."), "not a regular file");
        expectAccepted(path("mi/link.so"), "trust_other");
        {
            SD::PlatformUtilities::Scan const inner;
            expectAccepted(path("fp/f.so"), "trust_other");
            ASSERT_EQ(chmod(path("fp").c_str(), 0777), 0);
        }
        ASSERT_EQ(chmod(path("mi").c_str(), 0777), 0);
        expectAccepted(path("mi/b.so"), "trust_probe");
        expectRefused(path("fp/f.so"), "directory " + path("fp") + " is writable");
    }
    expectRefused(path("mi/b.so"), "directory " + path("mi") + " is writable");
}

// Another thread keeps exchanging a trusted library and a foreign-owned one
// under the name being loaded. Whichever is checked must be the one loaded:
// the foreign one is never handed out, nor left loaded. (Its constructor may
// run when an exchange falls between the check and the load; in a directory
// that passes the checks only root or this user can exchange files.)
class PluginTrustSwap : public PluginTrust, public ::testing::WithParamInterface<bool> {};

TEST_P(PluginTrustSwap, FileSwappedDuringTheLoadIsNeverLoadedUnchecked)
{
    std::optional<SD::PlatformUtilities::Scan> scan;
    if (GetParam())
        scan.emplace();
    ASSERT_NO_FATAL_FAILURE(build("copy trust_probe plugin.so; copy trust_other spare.so; give spare.so"));
    if (IsSkipped())
        return;
    // The refusals go to the listener only, not to standard error.
    std::ofstream(path("quiet.properties")) << "log4j.rootLogger=OFF\n";
    HGLog::HGLogger::configure(path("quiet.properties"));
    ictest::LogCapture cap;
    int const dir = open(dir_.root().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
    ASSERT_GE(dir, 0);
    std::atomic<bool> stop{false};
    std::atomic<long> swaps{0};
    std::thread swapper([&] {
        while (!stop.load())
            swaps += renameat2(dir, "plugin.so", dir, "spare.so", RENAME_EXCHANGE) == 0;
    });
    int loaded = 0, refused = 0;
    auto const deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    std::string const file = path("plugin.so");
    while ((loaded < 1000 || refused < 1000) && std::chrono::steady_clock::now() < deadline) {
        Handle const h = load(file);
        (h ? loaded : refused) += 1;
        EXPECT_TRUE(!h || nameOf(h.get()) == "trust_probe");
    }
    stop = true;
    swapper.join();
    close(dir);
    HGLog::HGLogger::configureDefault();
    EXPECT_GT(swaps.load(), 0);
    EXPECT_GE(loaded, 1000) << "the trusted file was hardly ever loaded; the test proves little";
    EXPECT_GE(refused, 1000) << "the foreign file was hardly ever checked; the test proves little";
    EXPECT_EQ(dlopen(file.c_str(), RTLD_LAZY | RTLD_NOLOAD), nullptr) << "a refused library stayed loaded";
    for (auto const& r : cap.logs())
        EXPECT_TRUE(r.level < kError || r.message.rfind("Cannot load library " + file + ": ", 0) == 0) << r.message;
}

INSTANTIATE_TEST_SUITE_P(AloneAndInAScan, PluginTrustSwap, ::testing::Bool(),
                         [](::testing::TestParamInfo<bool> const& info) { return info.param ? "InAScan" : "Alone"; });

} // namespace
