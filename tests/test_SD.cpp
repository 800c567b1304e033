// Tests of the SD system layer: locking, events, threads, time stamps,
// directory listings and the dynamic loader.
#include <SD/DateTime.h>
#include <SD/DirectoryReader.h>
#include <SD/Event.h>
#include <SD/Mutex.h>
#include <SD/PlatformUtilities.h>
#include <SD/Thread.h>

#include "TestSupport.h"

#include <climits>
#include <iterator>

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

using Clock = std::chrono::steady_clock;
using ictest::JoinedThread;
using Names = std::vector<std::string>;

constexpr unsigned long NO_LIMIT = 0xFFFFFFFFUL;
// Long enough never to expire in a passing run; only a broken wake-up would
// reach it, and then the test fails instead of hanging.
constexpr unsigned long GENEROUS_MS = 5000;

long long elapsedMs(Clock::time_point since)
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - since).count();
}

bool lockableFromAnotherThread(SD::Mutex& m)
{
    bool taken = false;
    JoinedThread([&] {
        if ((taken = m.try_lock()))
            m.unlock();
    }).join();
    return taken;
}

// ---------------------------------------------------------------- Mutex

TEST(SDMutex, OwnerLocksAgainAndOthersWaitUntilEveryLevelIsReleased)
{
    SD::Mutex m;
    ASSERT_EQ(m.lock(), 0);
    EXPECT_EQ(m.lock(0), 0) << "the owner must not block on its own lock";
    EXPECT_TRUE(m.try_lock());
    EXPECT_FALSE(lockableFromAnotherThread(m));
    m.unlock();
    m.unlock();
    EXPECT_FALSE(lockableFromAnotherThread(m)) << "one level is still held";
    m.unlock();
    EXPECT_TRUE(lockableFromAnotherThread(m));
    try {
        SD::MutexGuard g(m);
        EXPECT_FALSE(lockableFromAnotherThread(m));
        throw std::runtime_error("leaving the scope early");
    } catch (std::runtime_error const&) {
    }
    EXPECT_TRUE(lockableFromAnotherThread(m)) << "the guard releases on an exception";
}

TEST(SDMutex, OthersTimeOutOrWaitWhileItIsHeld)
{
    SD::Mutex m;
    SD::Event held(true), release(true);
    std::atomic<bool> waiterGotIt{false};
    JoinedThread holder([&] {
        SD::MutexGuard g(m);
        held.signal();
        release.waitMilliseconds(GENEROUS_MS);
    });
    ASSERT_EQ(held.waitMilliseconds(GENEROUS_MS), 0);
    JoinedThread waiter([&] {
        SD::MutexGuard g(m);
        waiterGotIt = true;
    });
    auto const t0 = Clock::now();
    EXPECT_EQ(m.lock(50), 1);
    EXPECT_GE(elapsedMs(t0), 50) << "a timed lock must not give up early";
    EXPECT_FALSE(m.try_lock());
    EXPECT_FALSE(waiterGotIt.load()) << "the waiter entered while the lock was held";
    release.signal();
    holder.join();
    waiter.join();
    EXPECT_TRUE(waiterGotIt.load());
    ASSERT_EQ(m.lock(50), 0);
    m.unlock();
}

// ---------------------------------------------------------------- Event

TEST(SDEvent, ManualResetStaysSignalledUntilReset)
{
    SD::Event e; // manual reset by default
    EXPECT_FALSE(e.test());
    EXPECT_EQ(e.wait(0) + e.waitMilliseconds(0), 2);
    e.signal();
    e.signal();
    for (int i = 0; i < 2; ++i) {
        EXPECT_TRUE(e.test());
        EXPECT_EQ(e.wait(0) + e.waitMilliseconds(0) + e.waitMilliseconds(10), 0);
    }
    e.reset();
    EXPECT_FALSE(e.test()) << "signals do not count up";
    EXPECT_EQ(e.waitMilliseconds(10), 1);
}

TEST(SDEvent, AutoResetIsConsumedByTheWaitThatObservesIt)
{
    SD::Event e(false);
    EXPECT_EQ(e.waitMilliseconds(10), 1);
    e.signal();
    EXPECT_TRUE(e.test());
    EXPECT_TRUE(e.test()) << "test() must not consume the signal";
    EXPECT_EQ(e.waitMilliseconds(0), 0);
    EXPECT_FALSE(e.test());
    EXPECT_EQ(e.waitMilliseconds(10), 1);
    e.signal();
    EXPECT_EQ(e.wait(1), 0);
    EXPECT_EQ(e.wait(0), 1);
    e.signal();
    e.reset();
    EXPECT_EQ(e.waitMilliseconds(0), 1);
    auto const t0 = Clock::now();
    EXPECT_EQ(e.waitMilliseconds(30), 1);
    EXPECT_GE(elapsedMs(t0), 30) << "a timed-out wait lasts at least its limit";
}

// A signal from another thread ends every kind of wait before its limit.
// Limits whose deadline the clock cannot express must still wait, not
// overflow into a deadline in the past and time out at once.
TEST(SDEvent, SignalFromAnotherThreadWakesAWaiter)
{
    struct Case {
        bool manual, seconds;
        unsigned long limit;
    } const cases[] = {{false, true, NO_LIMIT},       {true, false, NO_LIMIT},      {true, false, GENEROUS_MS},
                       {false, true, ULONG_MAX},      {false, true, ULONG_MAX - 1}, {false, true, 9000000000UL},
                       {false, true, 0xFFFFFFFEUL},   {false, false, ULONG_MAX},    {false, false, ULONG_MAX / 2},
                       {false, false, 0x100000000UL}};
    for (auto const& c : cases) {
        SCOPED_TRACE(std::to_string(c.limit) + (c.seconds ? " s" : " ms"));
        SD::Event e(c.manual);
        JoinedThread signaller([&] {
            SD::Thread::sleepMilliseconds(20);
            e.signal();
        });
        EXPECT_EQ(c.seconds ? e.wait(c.limit) : e.waitMilliseconds(c.limit), 0);
        signaller.join();
        EXPECT_EQ(e.test(), c.manual);
    }
}

TEST(SDEvent, AutoResetReleasesOneWaiterManualResetAll)
{
    for (bool manual : {false, true}) {
        SD::Event e(manual);
        std::atomic<int> woken{0};
        {
            auto waiter = [&] { woken += e.waitMilliseconds(manual ? GENEROUS_MS : 200) == 0; };
            JoinedThread a(waiter), b(waiter), c(waiter);
            SD::Thread::sleepMilliseconds(20);
            e.signal();
        }
        EXPECT_EQ(woken.load(), manual ? 3 : 1) << manual;
        EXPECT_EQ(e.test(), manual);
    }
}

// ---------------------------------------------------------------- Thread

// A thread whose body records what it saw and holds until released.
class GatedThread : public SD::Thread {
public:
    void* run(void* arg) override
    {
        seenArg = arg;
        ++runs;
        entered.signal();
        released = release.waitMilliseconds(GENEROUS_MS) == 0;
        return nullptr;
    }
    SD::Event entered{false}, release{true};
    std::atomic<void*> seenArg{nullptr};
    std::atomic<int> runs{0};
    std::atomic<bool> released{false};
};

TEST(SDThread, RunsTheBodyWithItsArgumentAndJoinWaitsForIt)
{
    GatedThread t;
    int token = 0;
    EXPECT_FALSE(t.isRunning() || t.stopped());
    EXPECT_FALSE(t.join()) << "never started";
    ASSERT_TRUE(t.start(&token));
    EXPECT_TRUE(t.isRunning());
    ASSERT_EQ(t.entered.waitMilliseconds(GENEROUS_MS), 0);
    EXPECT_EQ(t.seenArg.load(), &token);
    t.stop(); // the base does not end the body
    EXPECT_FALSE(t.stopped());
    EXPECT_TRUE(t.isRunning());
    EXPECT_FALSE(t.start()) << "still running";
    t.release.signal();
    ASSERT_TRUE(ictest::eventually([&] { return t.stopped(); }));
    EXPECT_FALSE(t.start()) << "ended but not joined";
    EXPECT_TRUE(t.join());
    EXPECT_TRUE(t.released.load()) << "join returned before the body ended";
    EXPECT_FALSE(t.isRunning());
    EXPECT_FALSE(t.join()) << "joined twice";
    EXPECT_EQ(t.runs.load(), 1);

    // Joined, it starts again.
    t.release.reset();
    t.entered.reset();
    ASSERT_TRUE(t.start(nullptr));
    ASSERT_EQ(t.entered.waitMilliseconds(GENEROUS_MS), 0);
    EXPECT_FALSE(t.stopped()) << "a new run has not ended";
    EXPECT_EQ(t.seenArg.load(), nullptr);
    t.release.signal();
    EXPECT_TRUE(t.join());
    EXPECT_EQ(t.runs.load(), 2);
}

TEST(SDThread, JoinFromInsideRunFailsAndAnUnjoinedEndedThreadMayGo)
{
    struct SelfJoiner : SD::Thread {
        void* run(void*) override
        {
            result = join() ? 1 : 0;
            return nullptr;
        }
        std::atomic<int> result{-1};
    } t;
    ASSERT_TRUE(t.start());
    ASSERT_TRUE(ictest::eventually([&] { return t.stopped(); })) << "join() from the body deadlocked";
    EXPECT_EQ(t.result.load(), 0);
    EXPECT_TRUE(t.join());
    // Destroying an ended thread that nobody joined must not end the process.
    GatedThread ended;
    ended.release.signal();
    ASSERT_TRUE(ended.start());
    ASSERT_TRUE(ictest::eventually([&] { return ended.stopped(); }));
}

TEST(SDThread, SleepWaitsAtLeastTheGivenTime)
{
    auto const t0 = Clock::now();
    SD::Thread::sleepMilliseconds(20);
    EXPECT_GE(elapsedMs(t0), 20);
    auto const t1 = Clock::now();
    SD::Thread::sleep(0);
    EXPECT_LT(elapsedMs(t1), 1000) << "sleep(0) must not sleep a whole second";
}

// ---------------------------------------------------------------- DateTime

TEST(SDDateTime, IsoTextSecondsOrderAndNow)
{
    struct Case {
        long long us;
        char const* iso;
        long long seconds; // rounded towards the past
    } const cases[] = {{-1500000, "1969-12-31T23:59:58.500000Z", -2},
                       {-1000000, "1969-12-31T23:59:59.000000Z", -1},
                       {-1, "1969-12-31T23:59:59.999999Z", -1},
                       {0, "1970-01-01T00:00:00.000000Z", 0},
                       {999999, "1970-01-01T00:00:00.999999Z", 0},
                       {1000000, "1970-01-01T00:00:01.000000Z", 1},
                       {951782400000007LL, "2000-02-29T00:00:00.000007Z", 951782400},
                       {1700000000123456LL, "2023-11-14T22:13:20.123456Z", 1700000000}};
    for (std::size_t i = 0; i < std::size(cases); ++i) {
        auto const t = SD::DateTime::fromEpochMicroseconds(cases[i].us);
        EXPECT_EQ(t.toIso8601(), cases[i].iso);
        EXPECT_EQ(t.getEpochSeconds(), cases[i].seconds) << cases[i].us;
        EXPECT_EQ(t.getEpochMicroseconds(), cases[i].us);
        auto const prev = SD::DateTime::fromEpochMicroseconds(cases[i == 0 ? 0 : i - 1].us);
        bool const later = i != 0; // then prev is strictly earlier
        EXPECT_EQ(std::vector<bool>({prev == t, prev != t, prev < t, t > prev, prev <= t, t >= prev, t <= prev,
                                     prev >= t, t < prev, prev > t}),
                  std::vector<bool>({!later, later, later, later, true, true, !later, !later, false, false}));
    }
    auto micros = [] {
        auto const now = std::chrono::system_clock::now().time_since_epoch();
        return std::chrono::duration_cast<std::chrono::microseconds>(now).count();
    };
    auto const before = micros();
    SD::DateTime const now;
    auto const after = micros();
    EXPECT_GE(now.getEpochMicroseconds(), before);
    EXPECT_LE(now.getEpochMicroseconds(), after);
}

// ---------------------------------------------------------------- DirectoryReader

// What the reader lists, as names, checking that each entry is the
// directory, one separator and the name.
Names namesOf(SD::DirectoryReader const& r, std::string const& dir)
{
    Names out;
    for (int i = 0; i < r.getNumberOfFiles(); ++i) {
        std::string const full = r.getFileName(i) ? r.getFileName(i) : "<null>";
        EXPECT_EQ(full.compare(0, dir.size() + 1, dir + "/"), 0) << full;
        out.push_back(full.substr(dir.size() + 1));
    }
    return out;
}

class SDDirectoryReader : public testing::Test {
protected:
    void makeDir(std::string const& name) { ASSERT_EQ(mkdir(d_.path(name).c_str(), 0755), 0); }
    void makeLink(std::string const& target, std::string const& name)
    {
        ASSERT_EQ(symlink(target.c_str(), d_.path(name).c_str()), 0) << name;
    }
    ictest::TempDir d_{"test_SD"};
    std::string const dir_ = d_.root();
};

TEST_F(SDDirectoryReader, ListsEntriesOfEveryTypeEndingWithTheSuffixSortedByteWise)
{
    for (char const* f : {"c.txt", "b.so.1", "a.so", "B.so", "x.SO", "so", "e.so.txt", ".so", "a.so.so"})
        d_.write(f);
    makeDir("d.so");
    makeDir("sub");
    ASSERT_EQ(mkfifo(d_.path("f.so").c_str(), 0644), 0);
    makeLink("a.so", "l.so");
    makeLink("missing", "z.so");
    SD::DirectoryReader r(dir_.c_str(), ".so");
    EXPECT_EQ(r.getNumberOfFiles(), 8);
    EXPECT_EQ(namesOf(r, dir_), (Names{".so", "B.so", "a.so", "a.so.so", "d.so", "f.so", "l.so", "z.so"}));
    // An empty or null suffix lists everything but the dot entries.
    Names const all = {".so", "B.so", "a.so", "a.so.so", "b.so.1", "c.txt", "d.so",
                       "e.so.txt", "f.so", "l.so", "so", "sub", "x.SO", "z.so"};
    for (char const* suffix : {"", static_cast<char const*>(nullptr)})
        EXPECT_EQ(namesOf(SD::DirectoryReader(dir_.c_str(), suffix), dir_), all);
    // A trailing separator still gets one more.
    SD::DirectoryReader slash((dir_ + "/").c_str(), "so.1");
    EXPECT_EQ(namesOf(slash, dir_ + "/"), Names{"b.so.1"});
}

TEST_F(SDDirectoryReader, NothingToReadGivesNoEntries)
{
    d_.write("plain.so");
    makeDir("empty");
    Names unreadable = {d_.path("empty"), d_.path("nothing-here"), d_.path("plain.so")};
    if (geteuid() != 0) { // permissions do not restrict the superuser
        makeDir("closed");
        d_.write("closed/a.so");
        ASSERT_EQ(chmod(d_.path("closed").c_str(), 0), 0);
        unreadable.push_back(d_.path("closed"));
    }
    for (auto const& dir : unreadable) {
        SD::DirectoryReader r(dir.c_str(), "");
        EXPECT_EQ(r.getNumberOfFiles(), 0) << dir;
        EXPECT_EQ(r.getFileName(0), nullptr) << dir;
    }
    chmod(d_.path("closed").c_str(), 0755);
    SD::DirectoryReader null(nullptr, ".so");
    EXPECT_EQ(null.getNumberOfFiles(), 0);
    EXPECT_EQ(null.getFileName(0), nullptr);
}

TEST_F(SDDirectoryReader, IsACompleteSnapshotWithBoundedIndexes)
{
    Names expected;
    for (int i = 299; i >= 0; --i)
        expected.push_back(d_.write("m" + std::to_string(i) + ".so").substr(dir_.size() + 1));
    std::sort(expected.begin(), expected.end());
    SD::DirectoryReader r(dir_.c_str(), ".so");
    EXPECT_EQ(namesOf(r, dir_), expected);
    char const* first = r.getFileName(0);
    d_.write("a.so");
    ASSERT_EQ(std::remove(d_.path(expected[0]).c_str()), 0);
    EXPECT_EQ(r.getNumberOfFiles(), 300);
    EXPECT_EQ(r.getFileName(0), first);
    EXPECT_EQ(std::string(first), d_.path(expected[0]));
    EXPECT_NE(r.getFileName(299), nullptr);
    for (int bad : {300, -1, INT_MAX, INT_MIN})
        EXPECT_EQ(r.getFileName(bad), nullptr) << bad;
}

// ---------------------------------------------------------------- PlatformUtilities

TEST(SDPlatformUtilities, SeparatorAndDirectoriesFromTheEnvironmentOnEveryCall)
{
    EXPECT_EQ(SD::PlatformUtilities::getSeparator(), '/');
    char const* const vars[] = {"IC_DATA_DIR", "IC_MI_DIR", "IC_FP_DIR"};
    std::string (*const get[])() = {&SD::PlatformUtilities::getBriscaDataDir,
                                    &SD::PlatformUtilities::getBriscaMIDir, &SD::PlatformUtilities::getBriscaFPDir};
    ictest::EnvGuard data(vars[0]), mi(vars[1]), fp(vars[2]);
    Names defaults;
    for (std::size_t i = 0; i < 3; ++i) {
        unsetenv(vars[i]);
        defaults.push_back(get[i]());
        EXPECT_EQ(defaults.back().front(), '/') << "the default is an absolute path";
    }
    EXPECT_TRUE(defaults[0] != defaults[1] && defaults[0] != defaults[2] && defaults[1] != defaults[2]);
    for (std::size_t i = 0; i < 3; ++i) {
        SCOPED_TRACE(vars[i]);
        for (std::string const value : {"/srv/first", "/srv/second dir", ""}) {
            setenv(vars[i], value.c_str(), 1);
            for (std::size_t j = 0; j < 3; ++j) // empty means the default
                EXPECT_EQ(get[j](), i == j && !value.empty() ? value : defaults[j]);
        }
        unsetenv(vars[i]);
        EXPECT_EQ(get[i](), defaults[i]);
    }
}

class SDLoader : public testing::Test {
protected:
    bool markerExists() const { return access(marker_.c_str(), F_OK) == 0; }

    static int callAnswer(SD::_LibraryHandle* h)
    {
        char name[] = "sdprobe_answer";
        void* sym = SD::PlatformUtilities::loadSymbol(h, name);
        return sym == nullptr ? -1 : reinterpret_cast<int (*)()>(sym)();
    }

    // A refusal of file with exactly one error line naming it; returns the line.
    static std::string expectRefused(std::string const& file)
    {
        ictest::LogCapture cap;
        EXPECT_EQ(SD::PlatformUtilities::loadLibrary(file.c_str()), nullptr);
        auto const logs = cap.logs();
        EXPECT_EQ(logs.size(), 1u) << file;
        if (logs.empty())
            return std::string();
        EXPECT_NE(logs[0].message.find(file), std::string::npos) << logs[0].message;
        EXPECT_GE(logs[0].level, HGLog::HGLogger::LEVEL_ERROR);
        EXPECT_EQ(logs[0].logger, "Helmgard.SD.PlatformUtilities");
        return logs[0].message;
    }

    ictest::TempDir d_{"test_SD"};
    std::string const marker_ = d_.path("marker");
    ictest::EnvGuard markerEnv_{"SDPROBE_MARKER", marker_};
};

TEST_F(SDLoader, LoadsALibraryWithItsSymbolsKeptLocal)
{
    ictest::LogCapture cap;
    ASSERT_EQ(symlink(SDPROBE_PATH, d_.path("link.so").c_str()), 0);
    SD::_LibraryHandle* a = SD::PlatformUtilities::loadLibrary(SDPROBE_PATH);
    SD::_LibraryHandle* b = SD::PlatformUtilities::loadLibrary(d_.path("link.so").c_str());
    ASSERT_TRUE(a && b && a != b);
    EXPECT_EQ(callAnswer(a), 42);
    EXPECT_EQ(dlsym(RTLD_DEFAULT, "sdprobe_answer"), nullptr) << "a plug-in's symbols must not join the global scope";
    char missing[] = "sdprobe_no_such_function", name[] = "sdprobe_answer";
    EXPECT_EQ(SD::PlatformUtilities::loadSymbol(a, missing), nullptr);
    EXPECT_EQ(SD::PlatformUtilities::loadSymbol(a, nullptr), nullptr);
    EXPECT_EQ(SD::PlatformUtilities::loadSymbol(nullptr, name), nullptr);
    EXPECT_NE(SD::PlatformUtilities::loadSymbol(a, name), nullptr) << "a miss must not break later look-ups";
    SD::PlatformUtilities::unloadLibrary(a);
    EXPECT_EQ(callAnswer(b), 42) << "two handles of one library are independent";
    SD::PlatformUtilities::unloadLibrary(b);
    for (auto const& r : cap.logs())
        EXPECT_LT(r.level, HGLog::HGLogger::LEVEL_WARNING) << r.message;
    EXPECT_EQ(SD::PlatformUtilities::loadLibrary(nullptr), nullptr);
    SD::PlatformUtilities::unloadLibrary(nullptr);
}

TEST_F(SDLoader, RunsTheConstructorOfAFreshCopyAndUnloadCloses)
{
    // A copy has its own inode, so it is loaded afresh whatever else is open.
    std::string const copy = d_.path("copy.so");
    ASSERT_TRUE(std::filesystem::copy_file(SDPROBE_PATH, copy));
    ASSERT_FALSE(markerExists());
    SD::_LibraryHandle* h = SD::PlatformUtilities::loadLibrary(copy.c_str());
    ASSERT_NE(h, nullptr);
    EXPECT_TRUE(markerExists()) << "the marker check of the refusal tests relies on this";
    EXPECT_EQ(callAnswer(h), 42);
    void* still = dlopen(copy.c_str(), RTLD_NOW | RTLD_NOLOAD);
    EXPECT_NE(still, nullptr);
    if (still != nullptr)
        dlclose(still);
    SD::PlatformUtilities::unloadLibrary(h);
    EXPECT_EQ(dlopen(copy.c_str(), RTLD_NOW | RTLD_NOLOAD), nullptr) << "unloadLibrary must close the library";
}

TEST_F(SDLoader, RefusesWhatIsNotALoadableLibraryWithOneLogLine)
{
    ASSERT_EQ(symlink(d_.path("gone.so").c_str(), d_.path("dangling.so").c_str()), 0);
    ASSERT_EQ(mkdir(d_.path("x.so").c_str(), 0755), 0);
    ASSERT_TRUE(std::filesystem::copy_file(SDPROBE_PATH, d_.path("x.so/inner.so")));
    ASSERT_EQ(symlink(d_.path("x.so").c_str(), d_.path("dirlink.so").c_str()), 0);
    d_.write("empty.so");
    for (char const* name : {"absent.so", "dangling.so", "x.so", "dirlink.so", "empty.so"})
        expectRefused(d_.path(name));
    // A file that is not a library: the line carries the loader's own reason.
    std::string const bad = d_.write("bad.so", std::string(512, 'x') + "\nnot a shared object\n");
    ASSERT_EQ(dlopen(bad.c_str(), RTLD_NOW | RTLD_LOCAL), nullptr);
    std::string const why = dlerror();
    std::string const line = expectRefused(bad);
    EXPECT_NE(line.find(why), std::string::npos) << line << "\nexpected: " << why;
    EXPECT_FALSE(markerExists());
}

TEST_F(SDLoader, FifoIsRefusedWithoutBeingOpened)
{
    std::string const fifo = d_.path("f.so");
    ASSERT_EQ(mkfifo(fifo.c_str(), 0644), 0);
    ASSERT_EQ(symlink(fifo.c_str(), d_.path("fifolink.so").c_str()), 0);
    for (std::string const name : {"f.so", "fifolink.so"}) {
        // Opening a FIFO for reading blocks until a writer comes. Should the
        // loader try it, this writer unblocks it and records that it
        // happened, so the test fails instead of hanging.
        std::atomic<bool> done{false}, openedByLoader{false};
        JoinedThread writer([&] {
            for (auto end = Clock::now() + std::chrono::milliseconds(GENEROUS_MS); !done && Clock::now() < end;) {
                int const fd = open(fifo.c_str(), O_WRONLY | O_NONBLOCK);
                if (fd >= 0) {
                    openedByLoader = true;
                    close(fd);
                    return;
                }
                std::this_thread::sleep_for(std::chrono::milliseconds(1));
            }
        });
        expectRefused(d_.path(name));
        done = true;
        writer.join();
        EXPECT_FALSE(openedByLoader.load()) << name << ": the FIFO was opened";
        EXPECT_FALSE(markerExists());
    }
}

} // namespace
