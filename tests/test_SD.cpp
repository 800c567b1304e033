// Tests of the SD system layer: locking, events, threads, time stamps and
// directory listings. The dynamic loader is tested with its trust policy
// (test_PluginTrust).
#include <SD/DateTime.h>
#include <SD/DirectoryReader.h>
#include <SD/Event.h>
#include <SD/Mutex.h>
#include <SD/PlatformUtilities.h>
#include <SD/Thread.h>

#include "TestSupport.h"

#include <climits>

#include <sys/stat.h>
#include <unistd.h>

namespace {

using Clock = std::chrono::steady_clock;
using ictest::JoinedThread;
using ictest::lockableFromAnotherThread;
using Names = std::vector<std::string>;

constexpr unsigned long NO_LIMIT = 0xFFFFFFFFUL;
// Long enough never to expire in a passing run; only a broken wake-up would
// reach it, and then the test fails instead of hanging.
constexpr unsigned long GENEROUS_MS = 5000;

long long elapsedMs(Clock::time_point since)
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - since).count();
}

// Recursive: the owner locks again, others wait until every level is
// released, and a timed lock gives up no earlier than its limit.
TEST(SDMutex, OwnerLocksAgainOthersWaitOrTimeOut)
{
    ictest::Watchdog dog(30, "mutex test");
    SD::Mutex m;
    ASSERT_EQ(m.lock(), 0);
    EXPECT_TRUE(m.lock(0) == 0 && m.try_lock()) << "the owner must not block on its own lock";
    m.unlock();
    m.unlock();
    EXPECT_FALSE(lockableFromAnotherThread(m)) << "one level is still held";
    std::atomic<int> timedOut{-1};
    auto const t0 = Clock::now();
    JoinedThread([&] { timedOut = m.lock(1050); }).join();
    EXPECT_EQ(timedOut.load(), 1);
    EXPECT_GE(elapsedMs(t0), 1050) << "a timed lock must not give up early";
    m.unlock();
    EXPECT_TRUE(lockableFromAnotherThread(m)) << "every level released";
}

TEST(SDEvent, ManualResetStaysSignalledAndAutoResetIsConsumedByOneWait)
{
    SD::Event manual; // manual reset by default
    EXPECT_FALSE(manual.test());
    EXPECT_EQ(manual.wait(0) + manual.waitMilliseconds(0), 2);
    manual.signal();
    manual.signal();
    EXPECT_EQ(manual.wait(0) + manual.waitMilliseconds(10) + manual.wait(0), 0);
    manual.reset();
    EXPECT_FALSE(manual.test()) << "signals do not count up";

    SD::Event automatic(false);
    automatic.signal();
    EXPECT_TRUE(automatic.test() && automatic.test()) << "test() must not consume the signal";
    EXPECT_EQ(automatic.wait(0), 0);
    EXPECT_FALSE(automatic.test());
    auto const t0 = Clock::now();
    EXPECT_EQ(automatic.waitMilliseconds(30), 1);
    EXPECT_GE(elapsedMs(t0), 30) << "a timed-out wait lasts at least its limit";
    automatic.signal();
    automatic.reset();
    EXPECT_EQ(automatic.waitMilliseconds(0), 1);

    // A signal from another thread ends every kind of wait before its limit.
    // Limits whose deadline the clock cannot express must still wait, not
    // overflow into a deadline in the past and time out at once.
    // Limits beyond a 32-bit unsigned long are cut to its largest value there.
    struct Case {
        bool manual, seconds;
        unsigned long long limit;
    } const cases[] = {{false, true, NO_LIMIT},   {true, false, NO_LIMIT},        {true, false, GENEROUS_MS},
                       {false, true, ULONG_MAX},  {false, true, 9000000000ULL},   {false, true, 0xFFFFFFFEUL},
                       {false, false, ULONG_MAX}, {false, false, ULONG_MAX / 2}, {false, false, 0x100000000ULL}};
    for (auto const& c : cases) {
        SD::Event e(c.manual);
        JoinedThread signaller([&] {
            SD::Thread::sleepMilliseconds(20);
            e.signal();
        });
        auto const limit = static_cast<unsigned long>(std::min<unsigned long long>(c.limit, ULONG_MAX));
        EXPECT_EQ(c.seconds ? e.wait(limit) : e.waitMilliseconds(limit), 0) << c.limit << " " << c.seconds;
        signaller.join();
        EXPECT_EQ(e.test(), c.manual);
    }
    // Of several waiters, an auto-reset event releases one, a manual one all.
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
    }
}

// A thread whose body records what it saw and holds until released.
class GatedThread : public SD::Thread {
public:
    void* run(void* arg) override
    {
        seenArg = arg;
        ++runs;
        entered.signal();
        released = release.waitMilliseconds(GENEROUS_MS) == 0;
        selfJoined = join(); // never from inside
        return nullptr;
    }
    SD::Event entered{false}, release{true};
    std::atomic<void*> seenArg{nullptr};
    std::atomic<int> runs{0};
    std::atomic<bool> released{false}, selfJoined{true};
};

TEST(SDThread, RunsTheBodyWithItsArgumentAndJoinWaitsForIt)
{
    GatedThread t;
    int token = 0;
    EXPECT_FALSE(t.isRunning() || t.stopped() || t.join());
    ASSERT_TRUE(t.start(&token));
    EXPECT_TRUE(t.isRunning());
    ASSERT_EQ(t.entered.waitMilliseconds(GENEROUS_MS), 0);
    EXPECT_EQ(t.seenArg.load(), &token);
    t.stop(); // the base does not end the body
    EXPECT_FALSE(t.stopped() || t.start()) << "still running";
    t.release.signal();
    ASSERT_TRUE(ictest::eventually([&] { return t.stopped(); })) << "join() from the body deadlocked";
    EXPECT_FALSE(t.start()) << "ended but not joined";
    EXPECT_TRUE(t.join());
    EXPECT_TRUE(t.released.load()) << "join returned before the body ended";
    EXPECT_FALSE(t.selfJoined.load());
    EXPECT_FALSE(t.isRunning() || t.join()) << "joined twice";
    // Joined, it starts again.
    ASSERT_TRUE(t.start(nullptr));
    EXPECT_TRUE(t.join() && t.seenArg.load() == nullptr && t.runs.load() == 2);
    // Destroying an ended thread that nobody joined must not end the process.
    GatedThread ended;
    ended.release.signal();
    ASSERT_TRUE(ended.start());
    ASSERT_TRUE(ictest::eventually([&] { return ended.stopped(); }));
}

// Seconds are rounded towards the past.
TEST(SDDateTime, IsoTextSecondsOrderAndNow)
{
    auto const at = &SD::DateTime::fromEpochMicroseconds;
    EXPECT_EQ(at(-1500000).toIso8601(), "1969-12-31T23:59:58.500000Z");
    EXPECT_EQ(at(951782400000007LL).toIso8601(), "2000-02-29T00:00:00.000007Z");
    EXPECT_EQ(at(999999).toIso8601(), "1970-01-01T00:00:00.999999Z");
    EXPECT_TRUE(at(-1500000).getEpochSeconds() == -2 && at(-1).getEpochSeconds() == -1);
    EXPECT_EQ(at(999999).getEpochSeconds(), 0);
    EXPECT_TRUE(at(-1) < at(0) && at(0) <= at(0) && at(1) > at(0) && at(1) >= at(1));
    EXPECT_TRUE(at(5) == at(5) && at(5) != at(6) && !(at(5) == at(6)) && !(at(5) != at(5)));
    EXPECT_FALSE(at(0) < at(-1) || at(0) < at(0) || at(1) <= at(0) || at(0) > at(1) || at(0) >= at(1));
    auto const micros = [] {
        using namespace std::chrono;
        return duration_cast<microseconds>(system_clock::now().time_since_epoch()).count();
    };
    auto const before = micros();
    SD::DateTime const now;
    EXPECT_TRUE(now.getEpochMicroseconds() >= before && now.getEpochMicroseconds() <= micros());
}

// Entries of every type whose name ends with the suffix, sorted byte-wise,
// each as the directory, one separator and the name; a snapshot.
TEST(SDDirectoryReader, ListsEntriesOfEveryTypeEndingWithTheSuffixSortedByteWise)
{
    ictest::TempDir d("test_SD");
    for (char const* f : {"c.txt", "b.so.1", "a.so", "B.so", "x.SO", "so", ".so", "a.so.so"})
        d.write(f);
    ASSERT_EQ(mkdir(d.path("d.so").c_str(), 0755) + mkfifo(d.path("f.so").c_str(), 0644) +
                  symlink("missing", d.path("z.so").c_str()),
              0);
    auto const names = [](SD::DirectoryReader const& r) {
        Names out;
        for (int i = 0; i < r.getNumberOfFiles(); ++i)
            out.push_back(r.getFileName(i));
        return out;
    };
    SD::DirectoryReader const r(d.root().c_str(), ".so");
    Names want;
    for (char const* n : {".so", "B.so", "a.so", "a.so.so", "d.so", "f.so", "z.so"})
        want.push_back(d.path(n));
    d.write("0.so");
    EXPECT_EQ(names(r), want);
    for (int bad : {7, -1, INT_MAX, INT_MIN})
        EXPECT_EQ(r.getFileName(bad), nullptr) << bad;
    // An empty or null suffix lists everything but the dot entries. (A
    // trailing separator is the plug-in discovery test's.)
    EXPECT_EQ(names(SD::DirectoryReader(d.root().c_str(), "")).size(), 12u);
    EXPECT_EQ(names(SD::DirectoryReader(d.root().c_str(), nullptr)).size(), 12u);
    for (char const* none : {"/nothing-here", "/a.so"})
        EXPECT_EQ(SD::DirectoryReader((d.root() + none).c_str(), "").getNumberOfFiles(), 0) << none;
    EXPECT_EQ(SD::DirectoryReader(nullptr, ".so").getFileName(0), nullptr);
}

// Read on every call; unset or empty means the installation's default.
TEST(SDPlatformUtilities, DirectoriesFromTheEnvironmentOnEveryCall)
{
    char const* const vars[] = {"IC_DATA_DIR", "IC_MI_DIR", "IC_FP_DIR"};
    std::string (*const get[])() = {&SD::PlatformUtilities::getBriscaDataDir,
                                    &SD::PlatformUtilities::getBriscaMIDir, &SD::PlatformUtilities::getBriscaFPDir};
    ictest::EnvGuard data(vars[0]), mi(vars[1]), fp(vars[2]);
    for (std::size_t i = 0; i < 3; ++i) {
        unsetenv(vars[i]);
        std::string const fallback = get[i]();
        EXPECT_TRUE(fallback[0] == '/' && fallback != get[(i + 1) % 3]()) << fallback;
        for (std::string const value : {"/srv/first", "/srv/second dir", ""}) {
            setenv(vars[i], value.c_str(), 1);
            EXPECT_EQ(get[i](), value.empty() ? fallback : value) << vars[i];
        }
    }
}

} // namespace
