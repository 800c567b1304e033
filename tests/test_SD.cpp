// Tests of the SD system layer: locking, events, threads, time stamps,
// directory listings and the dynamic loader.
#include <SD/DateTime.h>
#include <SD/DirectoryReader.h>
#include <SD/Event.h>
#include <SD/Mutex.h>
#include <SD/PlatformUtilities.h>
#include <SD/Thread.h>

#include <HGLog/HGLogger.h>
#include <LogCapture.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

constexpr unsigned long NO_LIMIT = 0xFFFFFFFFUL;
// Long enough never to expire in a passing run; only a broken wake-up would
// reach it, and then the test fails instead of hanging.
constexpr unsigned long GENEROUS_MS = 5000;

long long elapsedMs(Clock::time_point since)
{
    return std::chrono::duration_cast<milliseconds>(Clock::now() - since).count();
}

// Runs a function on another thread and joins it when leaving scope.
class Helper {
public:
    explicit Helper(std::function<void()> f) : t_(std::move(f)) {}
    ~Helper()
    {
        if (t_.joinable())
            t_.join();
    }
    void join() { t_.join(); }

private:
    std::thread t_;
};

// Whether another thread can take the mutex right now.
bool lockableFromAnotherThread(SD::Mutex& m)
{
    bool taken = false;
    std::thread t([&] {
        taken = m.try_lock();
        if (taken)
            m.unlock();
    });
    t.join();
    return taken;
}

// A fresh directory under /tmp, removed with everything in it afterwards.
class TempDirTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        char templ[] = "/tmp/test_SD.XXXXXX";
        ASSERT_NE(mkdtemp(templ), nullptr) << std::strerror(errno);
        dir_ = templ;
    }
    void TearDown() override
    {
        std::error_code ec;
        if (!dir_.empty())
            std::filesystem::remove_all(dir_, ec);
    }
    std::string path(std::string const& name) const { return dir_ + "/" + name; }
    void touch(std::string const& name, std::string const& content = "")
    {
        std::ofstream out(path(name), std::ios::binary);
        out << content;
        ASSERT_TRUE(out.good()) << path(name);
    }
    void makeDir(std::string const& name)
    {
        ASSERT_EQ(mkdir(path(name).c_str(), 0755), 0) << name;
    }
    void makeFifo(std::string const& name)
    {
        ASSERT_EQ(mkfifo(path(name).c_str(), 0644), 0) << name;
    }
    void makeLink(std::string const& target, std::string const& name)
    {
        ASSERT_EQ(symlink(target.c_str(), path(name).c_str()), 0) << name;
    }
    void copyFile(std::string const& from, std::string const& name)
    {
        ASSERT_TRUE(std::filesystem::copy_file(from, path(name))) << from;
    }

    std::string dir_;
};

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
}

TEST(SDMutex, TimedLockFailsWhileAnotherThreadHoldsItAndSucceedsAfterRelease)
{
    SD::Mutex m;
    SD::Event held(true);
    SD::Event release(true);
    Helper holder([&] {
        SD::MutexGuard g(m);
        held.signal();
        release.waitMilliseconds(GENEROUS_MS);
    });
    ASSERT_EQ(held.waitMilliseconds(GENEROUS_MS), 0);

    auto const t0 = Clock::now();
    EXPECT_EQ(m.lock(50), 1);
    EXPECT_GE(elapsedMs(t0), 50) << "a timed lock must not give up early";
    EXPECT_FALSE(m.try_lock());

    release.signal();
    holder.join();
    ASSERT_EQ(m.lock(50), 0);
    m.unlock();
}

TEST(SDMutex, WaiterWithoutLimitGetsTheLockWhenReleased)
{
    SD::Mutex m;
    std::atomic<bool> got{false};
    std::optional<Helper> waiter;
    {
        SD::MutexGuard g(m);
        waiter.emplace([&] {
            SD::MutexGuard inner(m);
            got = true;
        });
        SD::Thread::sleepMilliseconds(20);
        EXPECT_FALSE(got.load()) << "the waiter entered while the lock was held";
    }
    waiter.reset();
    EXPECT_TRUE(got.load());
}

TEST(SDMutex, GuardReleasesOnException)
{
    SD::Mutex m;
    try {
        SD::MutexGuard g(m);
        EXPECT_FALSE(lockableFromAnotherThread(m));
        throw std::runtime_error("leaving the scope early");
    } catch (std::runtime_error const&) {
    }
    EXPECT_TRUE(lockableFromAnotherThread(m));
}

// ---------------------------------------------------------------- Event

TEST(SDEvent, NewEventIsNotSignalledAndWaitsTimeOut)
{
    SD::Event manual(true);
    SD::Event automatic(false);
    EXPECT_FALSE(manual.test());
    EXPECT_FALSE(automatic.test());
    EXPECT_EQ(manual.wait(0), 1);
    EXPECT_EQ(manual.waitMilliseconds(0), 1);
    EXPECT_EQ(automatic.waitMilliseconds(10), 1);
}

TEST(SDEvent, DefaultIsManualReset)
{
    SD::Event e;
    e.signal();
    EXPECT_EQ(e.waitMilliseconds(0), 0);
    EXPECT_EQ(e.waitMilliseconds(0), 0);
    EXPECT_TRUE(e.test());
}

TEST(SDEvent, ManualResetStaysSignalledUntilReset)
{
    SD::Event e(true);
    e.signal();
    EXPECT_TRUE(e.test());
    EXPECT_TRUE(e.test());
    EXPECT_EQ(e.wait(0), 0);
    EXPECT_EQ(e.waitMilliseconds(0), 0);
    EXPECT_EQ(e.waitMilliseconds(10), 0);
    EXPECT_TRUE(e.test());
    e.reset();
    EXPECT_FALSE(e.test());
    EXPECT_EQ(e.waitMilliseconds(10), 1);
    e.signal();
    e.signal();
    e.reset();
    EXPECT_FALSE(e.test()) << "signals do not count up";
}

TEST(SDEvent, AutoResetIsConsumedByTheWaitThatObservesIt)
{
    SD::Event e(false);
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
}

TEST(SDEvent, TimedOutWaitLastsAtLeastTheLimit)
{
    SD::Event e(true);
    auto const t0 = Clock::now();
    EXPECT_EQ(e.waitMilliseconds(30), 1);
    EXPECT_GE(elapsedMs(t0), 30);
}

TEST(SDEvent, SignalFromAnotherThreadWakesAWaiterWithoutLimit)
{
    SD::Event e(false);
    Helper signaller([&] {
        SD::Thread::sleepMilliseconds(20);
        e.signal();
    });
    EXPECT_EQ(e.wait(NO_LIMIT), 0);
    EXPECT_FALSE(e.test());
}

TEST(SDEvent, SignalFromAnotherThreadWakesAMillisecondWaiterWithoutLimit)
{
    SD::Event e(true);
    Helper signaller([&] {
        SD::Thread::sleepMilliseconds(20);
        e.signal();
    });
    EXPECT_EQ(e.waitMilliseconds(NO_LIMIT), 0);
}

TEST(SDEvent, SignalWakesABoundedWaiterBeforeItsLimit)
{
    SD::Event e(true);
    Helper signaller([&] {
        SD::Thread::sleepMilliseconds(20);
        e.signal();
    });
    EXPECT_EQ(e.waitMilliseconds(GENEROUS_MS), 0);
}

// Limits whose deadline cannot be expressed by the clock must still wait,
// not overflow into a deadline in the past and time out at once.
TEST(SDEvent, HugeLimitsDoNotOverflow)
{
    for (unsigned long seconds : {ULONG_MAX, ULONG_MAX - 1, 9000000000UL, 0xFFFFFFFEUL}) {
        SD::Event e(false);
        Helper signaller([&] {
            SD::Thread::sleepMilliseconds(20);
            e.signal();
        });
        EXPECT_EQ(e.wait(seconds), 0) << seconds << " s";
    }
    for (unsigned long ms : {ULONG_MAX, ULONG_MAX / 2, 0x100000000UL}) {
        SD::Event e(false);
        Helper signaller([&] {
            SD::Thread::sleepMilliseconds(20);
            e.signal();
        });
        EXPECT_EQ(e.waitMilliseconds(ms), 0) << ms << " ms";
    }
}

TEST(SDEvent, AutoResetReleasesOnlyOneOfTwoWaiters)
{
    SD::Event e(false);
    std::atomic<int> woken{0};
    std::atomic<int> timedOut{0};
    auto waiter = [&] {
        if (e.waitMilliseconds(200) == 0)
            ++woken;
        else
            ++timedOut;
    };
    {
        Helper a(waiter);
        Helper b(waiter);
        SD::Thread::sleepMilliseconds(20);
        e.signal();
    }
    EXPECT_EQ(woken.load(), 1);
    EXPECT_EQ(timedOut.load(), 1);
    EXPECT_FALSE(e.test());
}

TEST(SDEvent, ManualResetReleasesEveryWaiter)
{
    SD::Event e(true);
    std::atomic<int> woken{0};
    auto waiter = [&] {
        if (e.waitMilliseconds(GENEROUS_MS) == 0)
            ++woken;
    };
    {
        Helper a(waiter);
        Helper b(waiter);
        Helper c(waiter);
        SD::Thread::sleepMilliseconds(20);
        e.signal();
    }
    EXPECT_EQ(woken.load(), 3);
    EXPECT_TRUE(e.test());
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

    SD::Event entered{false};
    SD::Event release{true};
    std::atomic<void*> seenArg{nullptr};
    std::atomic<int> runs{0};
    std::atomic<bool> released{false};
};

// Polls a condition for a bounded time.
bool eventually(std::function<bool()> const& condition)
{
    auto const deadline = Clock::now() + milliseconds(GENEROUS_MS);
    while (!condition()) {
        if (Clock::now() > deadline)
            return false;
        std::this_thread::sleep_for(milliseconds(1));
    }
    return true;
}

TEST(SDThread, RunsTheBodyWithItsArgumentAndJoins)
{
    GatedThread t;
    int token = 0;
    EXPECT_FALSE(t.isRunning());
    EXPECT_FALSE(t.stopped());
    ASSERT_TRUE(t.start(&token));
    EXPECT_TRUE(t.isRunning());
    ASSERT_EQ(t.entered.waitMilliseconds(GENEROUS_MS), 0);
    EXPECT_EQ(t.seenArg.load(), &token);
    EXPECT_TRUE(t.isRunning());
    EXPECT_FALSE(t.stopped());

    t.release.signal();
    EXPECT_TRUE(t.join());
    EXPECT_TRUE(t.released.load());
    EXPECT_TRUE(t.stopped());
    EXPECT_FALSE(t.isRunning());
    EXPECT_EQ(t.runs.load(), 1);
}

TEST(SDThread, JoinWaitsUntilTheBodyHasReturned)
{
    struct Slow : SD::Thread {
        void* run(void*) override
        {
            SD::Thread::sleepMilliseconds(30);
            done = true;
            return nullptr;
        }
        std::atomic<bool> done{false};
    } t;
    ASSERT_TRUE(t.start());
    EXPECT_TRUE(t.join());
    EXPECT_TRUE(t.done.load());
    EXPECT_TRUE(t.stopped());
}

TEST(SDThread, SecondStartWhileStartedFails)
{
    GatedThread t;
    ASSERT_TRUE(t.start());
    EXPECT_FALSE(t.start());
    t.release.signal();
    ASSERT_TRUE(t.join());
    EXPECT_EQ(t.runs.load(), 1);
}

TEST(SDThread, SecondStartAfterTheBodyEndedButBeforeJoinFails)
{
    GatedThread t;
    t.release.signal();
    ASSERT_TRUE(t.start());
    ASSERT_TRUE(eventually([&] { return t.stopped(); }));
    EXPECT_FALSE(t.start()) << "the previous thread has not been joined";
    EXPECT_TRUE(t.join());
    EXPECT_EQ(t.runs.load(), 1);
}

TEST(SDThread, CanStartAgainAfterJoin)
{
    GatedThread t;
    t.release.signal();
    ASSERT_TRUE(t.start());
    ASSERT_TRUE(t.join());
    ASSERT_TRUE(t.stopped());

    t.release.reset();
    t.entered.reset(); // the first run's entry was never waited for
    int token = 0;
    ASSERT_TRUE(t.start(&token));
    ASSERT_EQ(t.entered.waitMilliseconds(GENEROUS_MS), 0);
    EXPECT_FALSE(t.stopped()) << "a new run has not ended";
    EXPECT_TRUE(t.isRunning());
    EXPECT_EQ(t.seenArg.load(), &token);
    t.release.signal();
    EXPECT_TRUE(t.join());
    EXPECT_EQ(t.runs.load(), 2);
}

TEST(SDThread, JoinOfANeverStartedThreadFails)
{
    GatedThread t;
    EXPECT_FALSE(t.join());
    EXPECT_FALSE(t.isRunning());
    EXPECT_FALSE(t.stopped());
    EXPECT_EQ(t.runs.load(), 0);
}

TEST(SDThread, SecondJoinFails)
{
    GatedThread t;
    t.release.signal();
    ASSERT_TRUE(t.start());
    EXPECT_TRUE(t.join());
    EXPECT_FALSE(t.join());
}

TEST(SDThread, JoinFromInsideRunFailsWithoutDeadlock)
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
    ASSERT_TRUE(eventually([&] { return t.stopped(); })) << "join() from the body deadlocked";
    EXPECT_EQ(t.result.load(), 0);
    EXPECT_TRUE(t.join());
}

TEST(SDThread, BaseStopDoesNotEndTheBody)
{
    GatedThread t;
    ASSERT_TRUE(t.start());
    ASSERT_EQ(t.entered.waitMilliseconds(GENEROUS_MS), 0);
    t.stop();
    EXPECT_FALSE(t.stopped());
    EXPECT_TRUE(t.isRunning());
    t.release.signal();
    EXPECT_TRUE(t.join());
    EXPECT_TRUE(t.released.load()) << "the body ended by being released, not stopped";
}

TEST(SDThread, DestroyingAnEndedButUnjoinedThreadDoesNotTerminate)
{
    std::atomic<int> runs{0};
    {
        GatedThread t;
        t.release.signal();
        ASSERT_TRUE(t.start());
        ASSERT_TRUE(eventually([&] { return t.stopped(); }));
        runs = t.runs.load();
    }
    EXPECT_EQ(runs.load(), 1);
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

TEST(SDDateTime, EpochAndKnownInstantsAsIsoText)
{
    EXPECT_EQ(SD::DateTime::fromEpochMicroseconds(0).toIso8601(), "1970-01-01T00:00:00.000000Z");
    EXPECT_EQ(SD::DateTime::fromEpochMicroseconds(1700000000123456LL).toIso8601(),
              "2023-11-14T22:13:20.123456Z");
    EXPECT_EQ(SD::DateTime::fromEpochMicroseconds(951782400000007LL).toIso8601(),
              "2000-02-29T00:00:00.000007Z");
}

TEST(SDDateTime, NegativeInstantsRoundTowardsThePast)
{
    auto const justBefore = SD::DateTime::fromEpochMicroseconds(-1);
    EXPECT_EQ(justBefore.getEpochSeconds(), -1);
    EXPECT_EQ(justBefore.getEpochMicroseconds(), -1);
    EXPECT_EQ(justBefore.toIso8601(), "1969-12-31T23:59:59.999999Z");

    auto const oneSecond = SD::DateTime::fromEpochMicroseconds(-1000000);
    EXPECT_EQ(oneSecond.getEpochSeconds(), -1);
    EXPECT_EQ(oneSecond.toIso8601(), "1969-12-31T23:59:59.000000Z");

    auto const oneAndAHalf = SD::DateTime::fromEpochMicroseconds(-1500000);
    EXPECT_EQ(oneAndAHalf.getEpochSeconds(), -2);
    EXPECT_EQ(oneAndAHalf.toIso8601(), "1969-12-31T23:59:58.500000Z");
}

TEST(SDDateTime, SecondsOfPositiveInstants)
{
    EXPECT_EQ(SD::DateTime::fromEpochMicroseconds(999999).getEpochSeconds(), 0);
    EXPECT_EQ(SD::DateTime::fromEpochMicroseconds(1000000).getEpochSeconds(), 1);
    EXPECT_EQ(SD::DateTime::fromEpochMicroseconds(1700000000123456LL).getEpochSeconds(),
              1700000000);
}

TEST(SDDateTime, Ordering)
{
    auto const a = SD::DateTime::fromEpochMicroseconds(-5);
    auto const b = SD::DateTime::fromEpochMicroseconds(7);
    auto const b2 = SD::DateTime::fromEpochMicroseconds(7);
    EXPECT_TRUE(a < b);
    EXPECT_TRUE(a <= b);
    EXPECT_FALSE(b < a);
    EXPECT_TRUE(b > a);
    EXPECT_TRUE(b >= a);
    EXPECT_FALSE(a > b);
    EXPECT_TRUE(b == b2);
    EXPECT_FALSE(b != b2);
    EXPECT_TRUE(a != b);
    EXPECT_TRUE(b <= b2);
    EXPECT_TRUE(b >= b2);
    EXPECT_FALSE(b < b2);
}

TEST(SDDateTime, NowLiesBetweenTwoReadingsOfTheSystemClock)
{
    auto micros = [] {
        return std::chrono::duration_cast<std::chrono::microseconds>(
                   std::chrono::system_clock::now().time_since_epoch())
            .count();
    };
    auto const before = micros();
    SD::DateTime const now;
    auto const after = micros();
    EXPECT_GE(now.getEpochMicroseconds(), before);
    EXPECT_LE(now.getEpochMicroseconds(), after);
}

// ---------------------------------------------------------------- DirectoryReader

class SDDirectoryReader : public TempDirTest {
protected:
    static std::vector<std::string> namesOf(SD::DirectoryReader const& r, std::string const& dir)
    {
        std::vector<std::string> out;
        for (int i = 0; i < r.getNumberOfFiles(); ++i) {
            char const* p = r.getFileName(i);
            EXPECT_NE(p, nullptr) << i;
            if (p == nullptr)
                continue;
            std::string const full = p;
            EXPECT_EQ(full.compare(0, dir.size() + 1, dir + "/"), 0) << full;
            out.push_back(full.substr(dir.size() + 1));
        }
        return out;
    }
};

TEST_F(SDDirectoryReader, ListsEntriesOfEveryTypeEndingWithTheSuffixSortedByteWise)
{
    touch("c.txt");
    touch("b.so.1");
    touch("a.so");
    touch("B.so");
    touch("x.SO");
    touch("so");
    touch("e.so.txt");
    touch(".so");
    touch("a.so.so");
    makeDir("d.so");
    makeDir("sub");
    makeFifo("f.so");
    makeLink("a.so", "l.so");
    makeLink("missing", "z.so");

    SD::DirectoryReader r(dir_.c_str(), ".so");
    std::vector<std::string> const expected = {".so", "B.so", "a.so", "a.so.so", "d.so",
                                               "f.so", "l.so", "z.so"};
    EXPECT_EQ(r.getNumberOfFiles(), static_cast<int>(expected.size()));
    EXPECT_EQ(namesOf(r, dir_), expected);
}

TEST_F(SDDirectoryReader, FileNameIsTheDirectoryOneSeparatorAndTheName)
{
    touch("a.so");
    SD::DirectoryReader r(dir_.c_str(), ".so");
    ASSERT_EQ(r.getNumberOfFiles(), 1);
    ASSERT_NE(r.getFileName(0), nullptr);
    EXPECT_EQ(std::string(r.getFileName(0)), dir_ + "/a.so");
}

TEST_F(SDDirectoryReader, TrailingSeparatorStillGetsOneMore)
{
    touch("a.so");
    touch("b.so");
    std::string const given = dir_ + "/";
    SD::DirectoryReader r(given.c_str(), ".so");
    ASSERT_EQ(r.getNumberOfFiles(), 2);
    ASSERT_NE(r.getFileName(0), nullptr);
    EXPECT_EQ(std::string(r.getFileName(0)), given + "/a.so");
    EXPECT_EQ(std::string(r.getFileName(1) + given.size() + 1), "b.so");
}

TEST_F(SDDirectoryReader, EmptyOrNullSuffixListsEverythingButDotEntries)
{
    touch("a.so");
    touch("c.txt");
    makeDir("sub");
    std::vector<std::string> const expected = {"a.so", "c.txt", "sub"};
    SD::DirectoryReader empty(dir_.c_str(), "");
    EXPECT_EQ(namesOf(empty, dir_), expected);
    SD::DirectoryReader null(dir_.c_str(), nullptr);
    EXPECT_EQ(namesOf(null, dir_), expected);
}

TEST_F(SDDirectoryReader, EmptyDirectoryHasNoEntries)
{
    SD::DirectoryReader r(dir_.c_str(), "");
    EXPECT_EQ(r.getNumberOfFiles(), 0);
    EXPECT_EQ(r.getFileName(0), nullptr);
}

TEST_F(SDDirectoryReader, MissingDirectoryOrNotADirectoryHasNoEntries)
{
    touch("plain.so");
    SD::DirectoryReader missing(path("nothing-here").c_str(), "");
    EXPECT_EQ(missing.getNumberOfFiles(), 0);
    EXPECT_EQ(missing.getFileName(0), nullptr);
    SD::DirectoryReader file(path("plain.so").c_str(), "");
    EXPECT_EQ(file.getNumberOfFiles(), 0);
    SD::DirectoryReader null(nullptr, ".so");
    EXPECT_EQ(null.getNumberOfFiles(), 0);
    EXPECT_EQ(null.getFileName(0), nullptr);
}

TEST_F(SDDirectoryReader, UnreadableDirectoryHasNoEntries)
{
    if (geteuid() == 0)
        GTEST_SKIP() << "permissions do not restrict the superuser";
    makeDir("closed");
    touch("closed/a.so");
    ASSERT_EQ(chmod(path("closed").c_str(), 0), 0);
    SD::DirectoryReader r(path("closed").c_str(), ".so");
    chmod(path("closed").c_str(), 0755);
    EXPECT_EQ(r.getNumberOfFiles(), 0);
}

TEST_F(SDDirectoryReader, IndexOutOfRangeGivesNull)
{
    touch("a.so");
    touch("b.so");
    SD::DirectoryReader r(dir_.c_str(), ".so");
    ASSERT_EQ(r.getNumberOfFiles(), 2);
    EXPECT_NE(r.getFileName(1), nullptr);
    EXPECT_EQ(r.getFileName(2), nullptr);
    EXPECT_EQ(r.getFileName(-1), nullptr);
    EXPECT_EQ(r.getFileName(INT_MAX), nullptr);
    EXPECT_EQ(r.getFileName(INT_MIN), nullptr);
}

TEST_F(SDDirectoryReader, IsASnapshot)
{
    touch("a.so");
    SD::DirectoryReader r(dir_.c_str(), ".so");
    char const* first = r.getFileName(0);
    touch("b.so");
    ASSERT_EQ(std::remove(path("a.so").c_str()), 0);
    EXPECT_EQ(r.getNumberOfFiles(), 1);
    EXPECT_EQ(r.getFileName(0), first);
    EXPECT_EQ(std::string(r.getFileName(0)), dir_ + "/a.so");
}

TEST_F(SDDirectoryReader, ManyEntriesAreAllListedInOrder)
{
    std::vector<std::string> expected;
    for (int i = 299; i >= 0; --i) {
        std::string const name = "m" + std::to_string(i) + ".so";
        touch(name);
        expected.push_back(name);
    }
    std::sort(expected.begin(), expected.end());
    SD::DirectoryReader r(dir_.c_str(), ".so");
    EXPECT_EQ(namesOf(r, dir_), expected);
}

// ---------------------------------------------------------------- PlatformUtilities

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

struct DirAccessor {
    char const* variable;
    std::string (*get)();
};

TEST(SDPlatformUtilities, SeparatorIsSlash)
{
    EXPECT_EQ(SD::PlatformUtilities::getSeparator(), '/');
}

TEST(SDPlatformUtilities, EnvironmentIsReadOnEveryCallAndEmptyMeansDefault)
{
    EnvGuard data("IC_DATA_DIR"), mi("IC_MI_DIR"), fp("IC_FP_DIR");
    DirAccessor const accessors[] = {
        {"IC_DATA_DIR", &SD::PlatformUtilities::getBriscaDataDir},
        {"IC_MI_DIR", &SD::PlatformUtilities::getBriscaMIDir},
        {"IC_FP_DIR", &SD::PlatformUtilities::getBriscaFPDir},
    };
    for (auto const& a : accessors) {
        SCOPED_TRACE(a.variable);
        unsetenv(a.variable);
        std::string const fallback = a.get();
        EXPECT_FALSE(fallback.empty());
        EXPECT_EQ(fallback.front(), '/') << "the default is an absolute path";

        ASSERT_EQ(setenv(a.variable, "/srv/first", 1), 0);
        EXPECT_EQ(a.get(), "/srv/first");
        ASSERT_EQ(setenv(a.variable, "/srv/second dir", 1), 0);
        EXPECT_EQ(a.get(), "/srv/second dir");
        ASSERT_EQ(setenv(a.variable, "", 1), 0);
        EXPECT_EQ(a.get(), fallback);
        unsetenv(a.variable);
        EXPECT_EQ(a.get(), fallback);
    }
}

TEST(SDPlatformUtilities, EachDirectoryHasItsOwnVariableAndDefault)
{
    EnvGuard data("IC_DATA_DIR"), mi("IC_MI_DIR"), fp("IC_FP_DIR");
    unsetenv("IC_DATA_DIR");
    unsetenv("IC_MI_DIR");
    unsetenv("IC_FP_DIR");
    std::string const dataDefault = SD::PlatformUtilities::getBriscaDataDir();
    std::string const miDefault = SD::PlatformUtilities::getBriscaMIDir();
    std::string const fpDefault = SD::PlatformUtilities::getBriscaFPDir();
    EXPECT_NE(miDefault, fpDefault);
    EXPECT_NE(miDefault, dataDefault);
    EXPECT_NE(fpDefault, dataDefault);

    setenv("IC_MI_DIR", "/only/mi", 1);
    EXPECT_EQ(SD::PlatformUtilities::getBriscaMIDir(), "/only/mi");
    EXPECT_EQ(SD::PlatformUtilities::getBriscaFPDir(), fpDefault);
    EXPECT_EQ(SD::PlatformUtilities::getBriscaDataDir(), dataDefault);
    unsetenv("IC_MI_DIR");

    setenv("IC_FP_DIR", "/only/fp", 1);
    EXPECT_EQ(SD::PlatformUtilities::getBriscaFPDir(), "/only/fp");
    EXPECT_EQ(SD::PlatformUtilities::getBriscaMIDir(), miDefault);
    EXPECT_EQ(SD::PlatformUtilities::getBriscaDataDir(), dataDefault);
    unsetenv("IC_FP_DIR");

    setenv("IC_DATA_DIR", "/only/data", 1);
    EXPECT_EQ(SD::PlatformUtilities::getBriscaDataDir(), "/only/data");
    EXPECT_EQ(SD::PlatformUtilities::getBriscaMIDir(), miDefault);
    EXPECT_EQ(SD::PlatformUtilities::getBriscaFPDir(), fpDefault);
}

class SDLoader : public TempDirTest {
protected:
    void SetUp() override
    {
        TempDirTest::SetUp();
        marker_ = path("marker");
        setenv("SDPROBE_MARKER", marker_.c_str(), 1);
    }
    void TearDown() override
    {
        unsetenv("SDPROBE_MARKER");
        TempDirTest::TearDown();
    }

    bool markerExists() const { return access(marker_.c_str(), F_OK) == 0; }

    static int callAnswer(SD::_LibraryHandle* h)
    {
        char name[] = "sdprobe_answer";
        void* sym = SD::PlatformUtilities::loadSymbol(h, name);
        if (sym == nullptr)
            return -1;
        auto fn = reinterpret_cast<int (*)()>(sym);
        return fn();
    }

    // Expects a refusal of path and exactly one log line about it.
    void expectRefused(std::string const& file, char const* why)
    {
        SCOPED_TRACE(why);
        ictest::LogCapture cap;
        SD::_LibraryHandle* h = SD::PlatformUtilities::loadLibrary(file.c_str());
        EXPECT_EQ(h, nullptr);
        SD::PlatformUtilities::unloadLibrary(h);
        auto const logs = cap.logs();
        ASSERT_EQ(logs.size(), 1u);
        EXPECT_NE(logs[0].message.find(file), std::string::npos) << logs[0].message;
        EXPECT_GE(logs[0].level, HGLog::HGLogger::LEVEL_ERROR);
        EXPECT_EQ(logs[0].logger.rfind("Helmgard.SD", 0), 0u) << logs[0].logger;
        lastLog_ = logs[0].message;
    }

    std::string marker_;
    std::string lastLog_;
};

TEST_F(SDLoader, LoadsTheProbeAndFindsItsSymbol)
{
    ictest::LogCapture cap;
    SD::_LibraryHandle* h = SD::PlatformUtilities::loadLibrary(SDPROBE_PATH);
    ASSERT_NE(h, nullptr);
    EXPECT_EQ(callAnswer(h), 42);
    SD::PlatformUtilities::unloadLibrary(h);
    for (auto const& r : cap.logs())
        EXPECT_LT(r.level, HGLog::HGLogger::LEVEL_WARNING) << r.message;
}

TEST_F(SDLoader, MissingSymbolAndNullArgumentsGiveNull)
{
    SD::_LibraryHandle* h = SD::PlatformUtilities::loadLibrary(SDPROBE_PATH);
    ASSERT_NE(h, nullptr);
    char missing[] = "sdprobe_no_such_function";
    EXPECT_EQ(SD::PlatformUtilities::loadSymbol(h, missing), nullptr);
    EXPECT_EQ(SD::PlatformUtilities::loadSymbol(h, nullptr), nullptr);
    char name[] = "sdprobe_answer";
    EXPECT_EQ(SD::PlatformUtilities::loadSymbol(nullptr, name), nullptr);
    EXPECT_NE(SD::PlatformUtilities::loadSymbol(h, name), nullptr)
        << "a miss must not break later look-ups";
    SD::PlatformUtilities::unloadLibrary(h);

    EXPECT_EQ(SD::PlatformUtilities::loadLibrary(nullptr), nullptr);
    SD::PlatformUtilities::unloadLibrary(nullptr);
}

TEST_F(SDLoader, SymbolsStayLocalToTheLibrary)
{
    SD::_LibraryHandle* h = SD::PlatformUtilities::loadLibrary(SDPROBE_PATH);
    ASSERT_NE(h, nullptr);
    EXPECT_EQ(dlsym(RTLD_DEFAULT, "sdprobe_answer"), nullptr)
        << "a plug-in's symbols must not join the global scope";
    SD::PlatformUtilities::unloadLibrary(h);
}

TEST_F(SDLoader, RunsTheConstructorOfAFreshCopyAndUnloadCloses)
{
    // A copy has its own inode, so it is loaded afresh whatever else is open.
    copyFile(SDPROBE_PATH, "copy.so");
    ASSERT_FALSE(markerExists());
    SD::_LibraryHandle* h = SD::PlatformUtilities::loadLibrary(path("copy.so").c_str());
    ASSERT_NE(h, nullptr);
    EXPECT_TRUE(markerExists()) << "the marker check of the refusal tests relies on this";
    EXPECT_EQ(callAnswer(h), 42);
    void* still = dlopen(path("copy.so").c_str(), RTLD_NOW | RTLD_NOLOAD);
    EXPECT_NE(still, nullptr);
    if (still != nullptr)
        dlclose(still);
    SD::PlatformUtilities::unloadLibrary(h);
    EXPECT_EQ(dlopen(path("copy.so").c_str(), RTLD_NOW | RTLD_NOLOAD), nullptr)
        << "unloadLibrary must close the library";
}

TEST_F(SDLoader, TwoHandlesOfOneLibraryAreIndependent)
{
    SD::_LibraryHandle* a = SD::PlatformUtilities::loadLibrary(SDPROBE_PATH);
    SD::_LibraryHandle* b = SD::PlatformUtilities::loadLibrary(SDPROBE_PATH);
    ASSERT_NE(a, nullptr);
    ASSERT_NE(b, nullptr);
    EXPECT_NE(a, b);
    SD::PlatformUtilities::unloadLibrary(a);
    EXPECT_EQ(callAnswer(b), 42);
    SD::PlatformUtilities::unloadLibrary(b);
}

TEST_F(SDLoader, SymlinkToTheLibraryLoads)
{
    makeLink(SDPROBE_PATH, "link.so");
    SD::_LibraryHandle* h = SD::PlatformUtilities::loadLibrary(path("link.so").c_str());
    ASSERT_NE(h, nullptr);
    EXPECT_EQ(callAnswer(h), 42);
    SD::PlatformUtilities::unloadLibrary(h);
}

TEST_F(SDLoader, NonexistentFileIsRefusedWithOneLogLine)
{
    expectRefused(path("absent.so"), "missing file");
    EXPECT_FALSE(markerExists());
}

TEST_F(SDLoader, DanglingSymlinkIsRefused)
{
    makeLink(path("gone.so"), "dangling.so");
    expectRefused(path("dangling.so"), "dangling link");
}

TEST_F(SDLoader, DirectoryIsRefused)
{
    makeDir("x.so");
    copyFile(SDPROBE_PATH, "x.so/inner.so");
    expectRefused(path("x.so"), "directory");
    makeLink(path("x.so"), "dirlink.so");
    expectRefused(path("dirlink.so"), "link to a directory");
    EXPECT_FALSE(markerExists());
}

TEST_F(SDLoader, FifoIsRefusedWithoutBeingOpened)
{
    makeFifo("f.so");
    makeLink(path("f.so"), "fifolink.so");
    for (std::string const name : {"f.so", "fifolink.so"}) {
        SCOPED_TRACE(name);
        // Opening a FIFO for reading blocks until a writer comes. Should the
        // loader try it, this writer unblocks it (feeding it the probe) and
        // records that it happened, so the test fails instead of hanging.
        std::atomic<bool> done{false};
        std::atomic<bool> openedByLoader{false};
        std::string const fifo = path("f.so");
        Helper writer([&] {
            auto const deadline = Clock::now() + milliseconds(GENEROUS_MS);
            while (!done && Clock::now() < deadline) {
                int fd = open(fifo.c_str(), O_WRONLY | O_NONBLOCK);
                if (fd >= 0) {
                    openedByLoader = true;
                    std::ifstream in(SDPROBE_PATH, std::ios::binary);
                    std::vector<char> bytes((std::istreambuf_iterator<char>(in)),
                                            std::istreambuf_iterator<char>());
                    fcntl(fd, F_SETFL, 0);
                    ssize_t const n = write(fd, bytes.data(), bytes.size());
                    (void)n;
                    close(fd);
                    return;
                }
                std::this_thread::sleep_for(milliseconds(1));
            }
        });
        expectRefused(path(name), "FIFO");
        done = true;
        writer.join();
        EXPECT_FALSE(openedByLoader.load()) << "the FIFO was opened";
        EXPECT_FALSE(markerExists());
    }
}

TEST_F(SDLoader, FileThatIsNotALibraryIsRefusedWithTheLoaderReason)
{
    touch("bad.so", std::string(512, 'x') + "\nnot a shared object\n");
    // What the loader itself says about this file.
    void* direct = dlopen(path("bad.so").c_str(), RTLD_NOW | RTLD_LOCAL);
    ASSERT_EQ(direct, nullptr);
    char const* reasonText = dlerror();
    ASSERT_NE(reasonText, nullptr);
    std::string const reason = reasonText;

    expectRefused(path("bad.so"), "not ELF");
    EXPECT_NE(lastLog_.find(reason), std::string::npos) << lastLog_ << "\nexpected: " << reason;
}

TEST_F(SDLoader, EmptyFileIsRefused)
{
    touch("empty.so");
    expectRefused(path("empty.so"), "empty file");
}

} // namespace
