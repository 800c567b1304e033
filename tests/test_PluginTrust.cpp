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
#include <LogCapture.h>

#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

namespace fs = std::filesystem;

// A user id that owns nothing here; nobody on Debian.
constexpr uid_t kForeignUid = 65534;
constexpr gid_t kForeignGid = 65534;

std::string fixture(std::string const& name)
{
    return std::string(TRUST_FIXTURE_DIR) + "/" + name + ".so";
}

// Keeps an environment variable as it was before the test.
class EnvGuard {
public:
    explicit EnvGuard(char const* name) : name_(name)
    {
        if (char const* v = std::getenv(name))
            saved_ = v;
    }
    ~EnvGuard()
    {
        if (saved_)
            setenv(name_, saved_->c_str(), 1);
        else
            unsetenv(name_);
    }
    EnvGuard(EnvGuard const&) = delete;
    EnvGuard& operator=(EnvGuard const&) = delete;

private:
    char const* name_;
    std::optional<std::string> saved_;
};

// Closes a handle when leaving scope.
struct HandleCloser {
    void operator()(SD::_LibraryHandle* h) const { SD::PlatformUtilities::unloadLibrary(h); }
};
using Handle = std::unique_ptr<SD::_LibraryHandle, HandleCloser>;

template <class T>
T symbol(SD::_LibraryHandle* h, char const* name)
{
    std::string copy(name);
    return reinterpret_cast<T>(SD::PlatformUtilities::loadSymbol(h, &copy[0]));
}

std::string nameOf(SD::_LibraryHandle* h)
{
    auto const fn = symbol<char const* (*)()>(h, "trust_name");
    return fn ? fn() : std::string("<no trust_name>");
}

// The file mapped at address, from /proc/self/maps; "" when none is.
std::string fileAt(void const* address)
{
    auto const a = reinterpret_cast<unsigned long long>(address);
    std::ifstream maps("/proc/self/maps");
    std::string line;
    while (std::getline(maps, line)) {
        unsigned long long start = 0, end = 0;
        if (std::sscanf(line.c_str(), "%llx-%llx", &start, &end) != 2 || a < start || a >= end)
            continue;
        std::size_t const slash = line.find('/');
        return slash == std::string::npos ? std::string() : line.substr(slash);
    }
    return std::string();
}

class PluginTrust : public ::testing::Test {
protected:
    void SetUp() override
    {
        char templ[] = "/tmp/ictrust.XXXXXX";
        ASSERT_NE(mkdtemp(templ), nullptr) << std::strerror(errno);
        root_ = templ;
        marker_ = root_ + "/marker";
        setenv("TRUST_MARKER", marker_.c_str(), 1);
        unsetenv("IC_PLUGIN_TRUST");
    }
    void TearDown() override
    {
        unsetenv("TRUST_MARKER");
        std::error_code ec;
        if (!root_.empty())
            fs::remove_all(root_, ec);
    }

    std::string path(std::string const& name) const { return root_ + "/" + name; }

    // A directory of the temporary tree with exactly that mode.
    void makeDir(std::string const& name, mode_t mode)
    {
        ASSERT_EQ(mkdir(path(name).c_str(), 0700), 0) << name << ": " << std::strerror(errno);
        ASSERT_EQ(chmod(path(name).c_str(), mode), 0) << name;
    }
    // A copy of a built stand-in with exactly that mode.
    void copyFixture(std::string const& which, std::string const& name, mode_t mode = 0755)
    {
        ASSERT_TRUE(fs::copy_file(fixture(which), path(name))) << name;
        ASSERT_EQ(chmod(path(name).c_str(), mode), 0) << name;
    }
    void link(std::string const& target, std::string const& name)
    {
        ASSERT_EQ(symlink(target.c_str(), path(name).c_str()), 0) << name;
    }
    // Gives a file or directory to another user; false (and the test is
    // skipped by the caller) where this process may not.
    bool giveAway(std::string const& name)
    {
        if (lchown(path(name).c_str(), kForeignUid, kForeignGid) == 0)
            return true;
        return false;
    }

    std::string markerText() const
    {
        std::ifstream in(marker_);
        std::stringstream text;
        text << in.rdbuf();
        return text.str();
    }
    bool markerExists() const { return access(marker_.c_str(), F_OK) == 0; }

    // The load of file is refused with exactly one error line that names the
    // file and contains why, and none of the library's code ran.
    void expectRefused(std::string const& file, std::string const& why)
    {
        SCOPED_TRACE(file);
        ictest::LogCapture cap;
        Handle h(SD::PlatformUtilities::loadLibrary(file.c_str()));
        EXPECT_EQ(h.get(), nullptr) << "loaded although it should be refused";
        h.reset();
        auto const logs = cap.logs();
        ASSERT_EQ(logs.size(), 1u);
        EXPECT_EQ(logs[0].logger, "Helmgard.SD.PlatformUtilities");
        EXPECT_GE(logs[0].level, HGLog::HGLogger::LEVEL_ERROR);
        EXPECT_NE(logs[0].message.find("Cannot load library " + file + ": "), std::string::npos)
            << logs[0].message;
        EXPECT_NE(logs[0].message.find(why), std::string::npos)
            << logs[0].message << "\nexpected to contain: " << why;
        EXPECT_FALSE(markerExists()) << "the library's constructor ran: " << markerText();
    }

    // The load of file succeeds without a warning, runs the constructor of
    // the build called name and gives that build's symbols.
    void expectAccepted(std::string const& file, std::string const& name)
    {
        SCOPED_TRACE(file);
        ictest::LogCapture cap;
        Handle h(SD::PlatformUtilities::loadLibrary(file.c_str()));
        ASSERT_NE(h.get(), nullptr);
        EXPECT_EQ(nameOf(h.get()), name);
        EXPECT_EQ(markerText(), name + "\n");
        for (auto const& r : cap.logs())
            EXPECT_LT(r.level, HGLog::HGLogger::LEVEL_WARNING) << r.message;
    }

    std::string root_;
    std::string marker_;
};

#define NEED_FOREIGN_OWNER(name)                                                            \
    do {                                                                                    \
        if (!giveAway(name))                                                                \
            GTEST_SKIP() << "cannot give " << (name) << " to uid " << kForeignUid << ": "   \
                         << std::strerror(errno);                                           \
    } while (0)

// ------------------------------------------------------------------ accepted

TEST_F(PluginTrust, TheBuiltFixtureLoadsFromTheBuildTree)
{
    expectAccepted(fixture("trust_probe"), "trust_probe");
}

TEST_F(PluginTrust, FileInAPrivateTemporaryDirectoryLoads)
{
    copyFixture("trust_probe", "plugin.so");
    expectAccepted(path("plugin.so"), "trust_probe");
}

TEST_F(PluginTrust, ReadOnlyFileLoads)
{
    copyFixture("trust_probe", "plugin.so", 0444);
    expectAccepted(path("plugin.so"), "trust_probe");
}

TEST_F(PluginTrust, OwnFileInAStickyWorldWritableDirectoryLoads)
{
    makeDir("shared", 01777);
    copyFixture("trust_probe", "shared/plugin.so");
    expectAccepted(path("shared/plugin.so"), "trust_probe");
}

// The checks apply to the file the links lead to; where the link itself
// lies does not matter.
TEST_F(PluginTrust, LinkInAnOpenDirectoryToATrustedFileLoads)
{
    copyFixture("trust_probe", "plugin.so");
    makeDir("open", 0777);
    link(path("plugin.so"), "open/link.so");
    expectAccepted(path("open/link.so"), "trust_probe");
}

// The loader works $ORIGIN out from the name it opens; a library that finds
// its dependencies through it must still find them beside itself.
TEST_F(PluginTrust, LibraryFindingItsDependencyThroughOriginLoads)
{
    ASSERT_TRUE(fs::copy_file(std::string(TRUST_FIXTURE_DIR) + "/libtrust_dep.so", path("libtrust_dep.so")));
    copyFixture("trust_origin", "plugin.so");
    ictest::LogCapture cap;
    Handle h(SD::PlatformUtilities::loadLibrary(path("plugin.so").c_str()));
    ASSERT_NE(h.get(), nullptr) << (cap.logs().empty() ? std::string() : cap.logs()[0].message);
    auto const viaDep = symbol<int (*)()>(h.get(), "trust_through_dep");
    ASSERT_NE(viaDep, nullptr);
    EXPECT_EQ(viaDep(), 7);
    void* const depCode = dlsym(RTLD_DEFAULT, "trust_dep_value");
    EXPECT_EQ(depCode, nullptr) << "the dependency joined the global scope";
    EXPECT_EQ(markerText(), "trust_origin\n");
}

// The library mapped is the file checked also when it is loaded by its path
// for the sake of $ORIGIN.
TEST_F(PluginTrust, LibraryUsingOriginIsRefusedWhenUntrusted)
{
    ASSERT_TRUE(fs::copy_file(std::string(TRUST_FIXTURE_DIR) + "/libtrust_dep.so", path("libtrust_dep.so")));
    copyFixture("trust_origin", "plugin.so", 0664);
    expectRefused(path("plugin.so"), "is writable by group or others (mode 0664)");
}

// ------------------------------------------------------------------- refused

TEST_F(PluginTrust, ForeignOwnedFileIsRefused)
{
    copyFixture("trust_probe", "plugin.so");
    NEED_FOREIGN_OWNER("plugin.so");
    expectRefused(path("plugin.so"), "not trusted: " + path("plugin.so") + " is owned by uid 65534");
}

TEST_F(PluginTrust, SymlinkToAForeignOwnedFileIsRefused)
{
    copyFixture("trust_probe", "foreign.so");
    NEED_FOREIGN_OWNER("foreign.so");
    link(path("foreign.so"), "link.so");
    expectRefused(path("link.so"), path("foreign.so") + " is owned by uid 65534");
}

TEST_F(PluginTrust, ChainOfLinksToAForeignOwnedFileIsRefused)
{
    copyFixture("trust_probe", "foreign.so");
    NEED_FOREIGN_OWNER("foreign.so");
    link(path("foreign.so"), "first.so");
    link("first.so", "second.so");
    expectRefused(path("second.so"), path("foreign.so") + " is owned by uid 65534");
}

TEST_F(PluginTrust, GroupWritableFileIsRefused)
{
    copyFixture("trust_probe", "plugin.so", 0775);
    expectRefused(path("plugin.so"), "is writable by group or others (mode 0775)");
}

TEST_F(PluginTrust, WorldWritableFileIsRefused)
{
    copyFixture("trust_probe", "plugin.so", 0646);
    expectRefused(path("plugin.so"), "is writable by group or others (mode 0646)");
}

TEST_F(PluginTrust, FileInAGroupWritableDirectoryIsRefused)
{
    makeDir("team", 0775);
    copyFixture("trust_probe", "team/plugin.so");
    expectRefused(path("team/plugin.so"),
                  "directory " + path("team") + " is writable by group or others without the sticky bit");
}

TEST_F(PluginTrust, WorldWritableParentWithoutStickyBitIsRefused)
{
    makeDir("open", 0777);
    copyFixture("trust_probe", "open/plugin.so");
    expectRefused(path("open/plugin.so"),
                  "directory " + path("open") + " is writable by group or others without the sticky bit (mode 0777)");
}

TEST_F(PluginTrust, WorldWritableAncestorFurtherUpIsRefused)
{
    makeDir("open", 0777);
    makeDir("open/lib", 0755);
    makeDir("open/lib/mi", 0755);
    copyFixture("trust_probe", "open/lib/mi/plugin.so");
    expectRefused(path("open/lib/mi/plugin.so"), "directory " + path("open") + " is writable");
}

TEST_F(PluginTrust, ForeignOwnedParentDirectoryIsRefused)
{
    makeDir("theirs", 0755);
    copyFixture("trust_probe", "theirs/plugin.so");
    NEED_FOREIGN_OWNER("theirs");
    expectRefused(path("theirs/plugin.so"),
                  "not trusted: directory " + path("theirs") + " is owned by uid 65534");
}

TEST_F(PluginTrust, ForeignOwnedFileInAStickyDirectoryIsRefused)
{
    makeDir("shared", 01777);
    copyFixture("trust_probe", "shared/plugin.so");
    NEED_FOREIGN_OWNER("shared/plugin.so");
    expectRefused(path("shared/plugin.so"), path("shared/plugin.so") + " in the shared directory " +
                                                path("shared") + " is owned by uid 65534");
}

TEST_F(PluginTrust, ForeignOwnedDirectoryInAStickyDirectoryIsRefused)
{
    makeDir("shared", 01777);
    makeDir("shared/theirs", 0755);
    copyFixture("trust_probe", "shared/theirs/plugin.so");
    NEED_FOREIGN_OWNER("shared/theirs");
    expectRefused(path("shared/theirs/plugin.so"),
                  path("shared/theirs") + " in the shared directory " + path("shared"));
}

TEST_F(PluginTrust, LinkIntoAnOpenDirectoryIsRefused)
{
    makeDir("open", 0777);
    copyFixture("trust_probe", "open/plugin.so");
    link(path("open/plugin.so"), "link.so");
    expectRefused(path("link.so"), "directory " + path("open") + " is writable");
}

TEST_F(PluginTrust, FifoIsRefused)
{
    ASSERT_EQ(mkfifo(path("pipe.so").c_str(), 0644), 0);
    expectRefused(path("pipe.so"), "not a regular file");
}

TEST_F(PluginTrust, DirectoryNamedLikeALibraryIsRefused)
{
    makeDir("x.so", 0755);
    copyFixture("trust_probe", "x.so/inner.so");
    expectRefused(path("x.so"), "not a regular file");
}

TEST_F(PluginTrust, LinkToADeviceIsRefused)
{
    link("/dev/null", "null.so");
    expectRefused(path("null.so"), "not a regular file");
}

TEST_F(PluginTrust, DanglingLinkIsRefused)
{
    link(path("gone.so"), "dangling.so");
    expectRefused(path("dangling.so"), "No such file or directory");
}

TEST_F(PluginTrust, LibraryWithAnUnresolvedSymbolIsRefusedBeforeItsConstructorRuns)
{
    copyFixture("trust_unresolved", "plugin.so");
    expectRefused(path("plugin.so"), "undefined symbol: trust_fixture_missing_symbol");
}

// ------------------------------------------------------------------- the switch

TEST_F(PluginTrust, SwitchOffLoadsAnUntrustedFileWithOneWarningNamingIt)
{
    EnvGuard guard("IC_PLUGIN_TRUST");
    makeDir("open", 0777);
    copyFixture("trust_probe", "open/plugin.so", 0666);
    for (char const* value : {"off", "OFF", "Off"}) {
        SCOPED_TRACE(value);
        std::remove(marker_.c_str());
        setenv("IC_PLUGIN_TRUST", value, 1);
        ictest::LogCapture cap;
        Handle h(SD::PlatformUtilities::loadLibrary(path("open/plugin.so").c_str()));
        ASSERT_NE(h.get(), nullptr);
        EXPECT_EQ(nameOf(h.get()), "trust_probe");
        EXPECT_EQ(markerText(), "trust_probe\n");
        std::vector<HGLog::Record> warnings;
        for (auto const& r : cap.logs())
            if (r.level >= HGLog::HGLogger::LEVEL_WARNING)
                warnings.push_back(r);
        ASSERT_EQ(warnings.size(), 1u);
        EXPECT_EQ(warnings[0].level, HGLog::HGLogger::LEVEL_WARNING);
        EXPECT_EQ(warnings[0].logger, "Helmgard.SD.PlatformUtilities");
        EXPECT_NE(warnings[0].message.find(path("open/plugin.so")), std::string::npos)
            << warnings[0].message;
        EXPECT_NE(warnings[0].message.find("IC_PLUGIN_TRUST=off"), std::string::npos)
            << warnings[0].message;
    }
}

TEST_F(PluginTrust, OnlyOffSwitchesTheChecksOff)
{
    EnvGuard guard("IC_PLUGIN_TRUST");
    copyFixture("trust_probe", "plugin.so", 0664);
    for (char const* value : {"", "on", "0", "no", "false", "of", "offf"}) {
        SCOPED_TRACE(value);
        setenv("IC_PLUGIN_TRUST", value, 1);
        expectRefused(path("plugin.so"), "is writable by group or others");
    }
}

TEST_F(PluginTrust, SwitchOffStillRefusesWhatIsNotARegularFile)
{
    EnvGuard guard("IC_PLUGIN_TRUST");
    setenv("IC_PLUGIN_TRUST", "off", 1);
    ASSERT_EQ(mkfifo(path("pipe.so").c_str(), 0644), 0);
    expectRefused(path("pipe.so"), "not a regular file");
    makeDir("x.so", 0755);
    expectRefused(path("x.so"), "not a regular file");
}

TEST_F(PluginTrust, TheSwitchIsReadOnEveryLoad)
{
    EnvGuard guard("IC_PLUGIN_TRUST");
    copyFixture("trust_probe", "plugin.so", 0664);
    setenv("IC_PLUGIN_TRUST", "off", 1);
    {
        Handle h(SD::PlatformUtilities::loadLibrary(path("plugin.so").c_str()));
        EXPECT_NE(h.get(), nullptr);
    }
    std::remove(marker_.c_str());
    unsetenv("IC_PLUGIN_TRUST");
    expectRefused(path("plugin.so"), "is writable by group or others");
}

// ----------------------------------------------------- names and identities

// Every build exports trust_name, trust_counter and trust_whoami; each must
// keep its own when both are loaded.
TEST_F(PluginTrust, TwoLibrariesWithTheSameGlobalNamesEachSeeTheirOwn)
{
    copyFixture("trust_probe", "a.so");
    copyFixture("trust_other", "b.so");
    Handle a(SD::PlatformUtilities::loadLibrary(path("a.so").c_str()));
    Handle b(SD::PlatformUtilities::loadLibrary(path("b.so").c_str()));
    ASSERT_NE(a.get(), nullptr);
    ASSERT_NE(b.get(), nullptr);
    auto const whoA = symbol<char const* (*)()>(a.get(), "trust_whoami");
    auto const whoB = symbol<char const* (*)()>(b.get(), "trust_whoami");
    auto const countA = symbol<int (*)()>(a.get(), "trust_count");
    auto const countB = symbol<int (*)()>(b.get(), "trust_count");
    ASSERT_TRUE(whoA && whoB && countA && countB);
    EXPECT_NE(reinterpret_cast<void*>(whoA), reinterpret_cast<void*>(whoB));
    EXPECT_STREQ(whoB(), "trust_other");
    EXPECT_STREQ(whoA(), "trust_probe");
    EXPECT_STREQ(whoA(), "trust_probe");
    EXPECT_EQ(countA(), 2);
    EXPECT_EQ(countB(), 1);
    EXPECT_EQ(dlsym(RTLD_DEFAULT, "trust_whoami"), nullptr)
        << "a plug-in's names must not join the global scope";
    EXPECT_EQ(markerText(), "trust_probe\ntrust_other\n");
}

// Many libraries open at once: each handle gives the code of its own file.
TEST_F(PluginTrust, EachOpenHandleGivesTheCodeOfItsOwnFile)
{
    constexpr int kCopies = 12;
    std::vector<Handle> handles;
    for (int i = 0; i < kCopies; ++i) {
        std::string const name = "copy" + std::to_string(i) + ".so";
        copyFixture(i % 2 ? "trust_other" : "trust_probe", name);
        handles.emplace_back(SD::PlatformUtilities::loadLibrary(path(name).c_str()));
        ASSERT_NE(handles.back().get(), nullptr) << name;
    }
    for (int i = 0; i < kCopies; ++i) {
        std::string const name = "copy" + std::to_string(i) + ".so";
        void* const fn = SD::PlatformUtilities::loadSymbol(handles[i].get(),
                                                           std::string("trust_name").data());
        ASSERT_NE(fn, nullptr);
        EXPECT_EQ(fileAt(fn), path(name));
        EXPECT_EQ(nameOf(handles[i].get()), i % 2 ? "trust_other" : "trust_probe");
    }
}

// A library built with -z nodelete stays mapped after its last close, still
// known to the loader by the name it was opened with. The next library must
// not be taken for it.
TEST_F(PluginTrust, ALibraryThatStaysMappedAfterCloseIsNotMistakenForTheNextOne)
{
    copyFixture("trust_lingering", "lingering.so");
    copyFixture("trust_probe", "plugin.so");
    {
        Handle h(SD::PlatformUtilities::loadLibrary(path("lingering.so").c_str()));
        ASSERT_NE(h.get(), nullptr);
        ASSERT_EQ(nameOf(h.get()), "trust_lingering");
    }
    for (int i = 0; i < 3; ++i) {
        Handle h(SD::PlatformUtilities::loadLibrary(path("plugin.so").c_str()));
        ASSERT_NE(h.get(), nullptr);
        EXPECT_EQ(nameOf(h.get()), "trust_probe");
        void* const fn = SD::PlatformUtilities::loadSymbol(h.get(), std::string("trust_name").data());
        EXPECT_EQ(fileAt(fn), path("plugin.so"));
    }
    EXPECT_EQ(markerText(), "trust_lingering\ntrust_probe\ntrust_probe\ntrust_probe\n");
}

// ------------------------------------------------------------------- scans

// A scan reuses the walk down to a directory, never the verdict on a file:
// in one pass, each file of the directory is still judged on its own, and a
// file elsewhere gets its own walk.
TEST_F(PluginTrust, InAScanEachFileIsStillJudgedOnItsOwn)
{
    makeDir("mi", 0755);
    makeDir("open", 0777);
    copyFixture("trust_probe", "mi/a.so");
    copyFixture("trust_probe", "mi/writable.so", 0666);
    ASSERT_EQ(mkfifo(path("mi/pipe.so").c_str(), 0644), 0);
    copyFixture("trust_other", "other.so");
    link(path("other.so"), "mi/link.so");
    copyFixture("trust_probe", "open/c.so");

    SD::PlatformUtilities::Scan const scan;
    expectAccepted(path("mi/a.so"), "trust_probe");
    std::remove(marker_.c_str());
    expectRefused(path("mi/writable.so"), "is writable by group or others (mode 0666)");
    expectRefused(path("mi/pipe.so"), "not a regular file");
    expectRefused(path("mi/missing.so"), "No such file or directory");
    expectRefused(path("open/c.so"), "directory " + path("open") + " is writable");
    expectRefused(path("mi/.."), "not a regular file");
    expectAccepted(path("mi/link.so"), "trust_other");
    std::remove(marker_.c_str());
    expectAccepted(path("mi/a.so"), "trust_probe");
}

// The verdict on the directories lasts as long as the scan: a directory
// opened to others during a pass is refused from the next pass on. An
// inner scan keeps its own verdicts and leaves the outer one's alone.
TEST_F(PluginTrust, DirectoriesAreJudgedOncePerScan)
{
    makeDir("mi", 0755);
    makeDir("fp", 0755);
    copyFixture("trust_probe", "mi/a.so");
    copyFixture("trust_probe", "mi/b.so");
    copyFixture("trust_other", "fp/f.so");
    {
        SD::PlatformUtilities::Scan const outer;
        expectAccepted(path("mi/a.so"), "trust_probe");
        std::remove(marker_.c_str());
        {
            SD::PlatformUtilities::Scan const inner;
            expectAccepted(path("fp/f.so"), "trust_other");
            std::remove(marker_.c_str());
            ASSERT_EQ(chmod(path("fp").c_str(), 0777), 0);
        }
        ASSERT_EQ(chmod(path("mi").c_str(), 0777), 0);
        expectAccepted(path("mi/b.so"), "trust_probe");
        std::remove(marker_.c_str());
        expectRefused(path("fp/f.so"), "directory " + path("fp") + " is writable");
    }
    expectRefused(path("mi/b.so"), "directory " + path("mi") + " is writable");
}

// Sends the library's log output nowhere while it lives; a listener still
// sees everything.
class QuietLogs {
public:
    explicit QuietLogs(std::string const& dir) : file_(dir + "/quiet.properties")
    {
        std::ofstream(file_) << "log4j.rootLogger=OFF\n";
        HGLog::HGLogger::configure(file_);
    }
    ~QuietLogs() { HGLog::HGLogger::configureDefault(); }
    QuietLogs(QuietLogs const&) = delete;
    QuietLogs& operator=(QuietLogs const&) = delete;

private:
    std::string file_;
};

// Another thread keeps exchanging a trusted library and a foreign-owned one
// under the name being loaded. Whichever is checked must be the one loaded:
// the foreign one's constructor never runs.
class PluginTrustSwap : public PluginTrust, public ::testing::WithParamInterface<bool> {};

TEST_P(PluginTrustSwap, FileSwappedDuringTheLoadIsNeverLoadedUnchecked)
{
    std::optional<SD::PlatformUtilities::Scan> scan;
    if (GetParam())
        scan.emplace();
    copyFixture("trust_probe", "plugin.so");
    copyFixture("trust_other", "spare.so");
    NEED_FOREIGN_OWNER("spare.so");
    QuietLogs quiet(root_);
    ictest::LogCapture cap;

    int dir = open(root_.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
    ASSERT_GE(dir, 0);
    std::atomic<bool> stop{false};
    std::atomic<long> swaps{0};
    std::thread swapper([&] {
        while (!stop.load()) {
            if (renameat2(dir, "plugin.so", dir, "spare.so", RENAME_EXCHANGE) == 0)
                ++swaps;
        }
    });

    int loaded = 0;
    int refused = 0;
    auto const deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    std::string const file = path("plugin.so");
    while ((loaded < 1000 || refused < 1000) && std::chrono::steady_clock::now() < deadline) {
        Handle h(SD::PlatformUtilities::loadLibrary(file.c_str()));
        if (h) {
            ++loaded;
            EXPECT_EQ(nameOf(h.get()), "trust_probe");
        } else {
            ++refused;
        }
    }
    stop = true;
    swapper.join();
    close(dir);

    EXPECT_GT(swaps.load(), 0);
    EXPECT_GE(loaded, 1000) << "the trusted file was hardly ever loaded; the test proves little";
    EXPECT_GE(refused, 1000) << "the foreign file was hardly ever checked; the test proves little";
    std::string const marks = markerText();
    EXPECT_EQ(marks.find("trust_other"), std::string::npos) << "the foreign library's code ran";
    EXPECT_NE(marks.find("trust_probe"), std::string::npos);
    for (auto const& r : cap.logs()) {
        if (r.level >= HGLog::HGLogger::LEVEL_ERROR) {
            EXPECT_NE(r.message.find("Cannot load library " + file + ": "), std::string::npos)
                << r.message;
        }
    }
}

INSTANTIATE_TEST_SUITE_P(AloneAndInAScan, PluginTrustSwap, ::testing::Bool(),
                         [](::testing::TestParamInfo<bool> const& info) {
                             return info.param ? std::string("InAScan") : std::string("Alone");
                         });

} // namespace
