// The loader thread (IC::LoaderThread) on its own, and installed as the
// library's periodic reloader: its part in the unload, and unloads that meet
// a reload under way.
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>
#include <IC/LoaderThread.h>

#include "PluginTest.h"

#include <dlfcn.h>

namespace {

using ictest::kLogIC;
using ictest::kLogLT;
namespace IST = IC::InstCtrl;
using Clock = std::chrono::steady_clock;

std::atomic<int> calls{0};
void count()
{
    ++calls;
}

std::string const kZeroDelay = "LoaderThread has zero delay. Setting 10 seconds instead";

class LoaderThreadAlone : public testing::Test {
protected:
    void SetUp() override { calls = 0; }
    ictest::Watchdog dog_{30, "loader thread test"};
};

TEST_F(LoaderThreadAlone, AZeroDelayBecomesTenSecondsWithOneErrorLineWhenItRuns)
{
    ictest::LogCapture cap;
    IC::LoaderThread t(77, 0, &count);
    EXPECT_EQ(t.getHostValue(), 77u);
    EXPECT_EQ(t.getDelay(), 0u) << "corrected when the thread runs, not before";
    EXPECT_FALSE(t.stopped());
    ASSERT_TRUE(t.start());
    // The stop request waits for the correction, which is logged either way.
    EXPECT_TRUE(ictest::eventually([&] { return cap.count(kLogLT, 6000, kZeroDelay) == 1; }));
    t.stop();
    t.join();
    EXPECT_TRUE(t.stopped());
    EXPECT_EQ(t.getDelay(), 10u);
    EXPECT_EQ(calls.load(), 0);
    ASSERT_EQ(cap.logs(kLogLT).size(), 1u);
    ictest::expectEvent(cap, {kLogLT, "LoaderThread"}, kZeroDelay, 6000, "run");
}

TEST_F(LoaderThreadAlone, CallsItsFunctionEveryPeriodUntilStopped)
{
    ictest::LogCapture cap;
    IC::LoaderThread t(0, 1, &count);
    ASSERT_TRUE(t.start());
    EXPECT_TRUE(ictest::eventually([] { return calls.load() >= 2; }, 8000));
    EXPECT_FALSE(t.stopped());
    t.stop();
    t.join();
    EXPECT_TRUE(t.stopped());
    int const seen = calls.load();
    std::this_thread::sleep_for(std::chrono::milliseconds(1200));
    EXPECT_EQ(calls.load(), seen) << "called after it was stopped";
    EXPECT_EQ(t.getDelay(), 1u);

    // Without a function it only waits.
    IC::LoaderThread idle(0, 1, nullptr);
    ASSERT_TRUE(idle.start());
    std::this_thread::sleep_for(std::chrono::milliseconds(1500));
    EXPECT_FALSE(idle.stopped());
    idle.stop();
    idle.join();
    EXPECT_TRUE(idle.stopped());
    EXPECT_TRUE(cap.logs(kLogLT).empty());
}

TEST_F(LoaderThreadAlone, AStopWhileWaitingTakesItsSecondAndEndsTheThread)
{
    IC::LoaderThread t(0, 3600, &count);
    ASSERT_TRUE(t.start());
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_FALSE(t.stopped());
    auto const before = Clock::now();
    t.stop();
    // stop() sleeps one second after the signal.
    EXPECT_GE(Clock::now() - before, std::chrono::milliseconds(950));
    EXPECT_TRUE(t.join());
    EXPECT_TRUE(t.stopped());
    EXPECT_EQ(calls.load(), 0);
}

TEST_F(LoaderThreadAlone, RunOnAStoppedObjectReturnsAtOnceAndAnExceptionEndsIt)
{
    IC::LoaderThread t(1, 0, &count);
    t.stop();
    ictest::LogCapture cap;
    // The stop request is already there: the first run only corrects the
    // delay and ends; the second does not even do that.
    EXPECT_EQ(t.run(nullptr), nullptr);
    EXPECT_TRUE(t.stopped());
    EXPECT_EQ(cap.messages(kLogLT), std::vector<std::string>{kZeroDelay});
    EXPECT_EQ(t.run(nullptr), nullptr);
    EXPECT_EQ(cap.logs(kLogLT).size(), 1u);
    EXPECT_EQ(calls.load(), 0);

    IC::LoaderThread failing(0, 1, [] { throw std::runtime_error("reload broke"); });
    EXPECT_THROW(failing.run(nullptr), std::runtime_error);
    EXPECT_FALSE(failing.stopped()) << "run() did not get to its end";
}

// A host may derive its own loader thread from the class (or catch and cast
// it): the type's run-time information must be part of the library's
// interface, not only its member functions.
TEST(LoaderThreadExport, ItsTypeInformationIsExported)
{
    void* lib = dlopen(IC_LIBRARY_PATH, RTLD_NOW | RTLD_LOCAL);
    ASSERT_NE(lib, nullptr) << dlerror();
    EXPECT_NE(dlsym(lib, "_ZTIN2IC12LoaderThreadE"), nullptr) << "typeinfo for IC::LoaderThread";
    EXPECT_NE(dlsym(lib, "_ZTVN2IC12LoaderThreadE"), nullptr) << "vtable for IC::LoaderThread";
    dlclose(lib);
}

// ---- installed in the library ----

class InstalledLoader : public ictest::PluginTest {
protected:
    void TearDown() override
    {
        // Whatever a test left installed goes with the unload.
        ictest::Watchdog dog(30, "teardown");
        PluginTest::TearDown();
        EXPECT_EQ(IST::lt, nullptr);
    }
    static unsigned char open()
    {
        IC::InstrumentationControl* c = nullptr;
        IC::Error* e = nullptr;
        return Open(&c, &e);
    }
    static IC::LoaderThread* install(unsigned long delay)
    {
        auto* t = new IC::LoaderThread(0, delay, &IST::TimedReload);
        IST::lt = t;
        EXPECT_TRUE(t->start());
        return t;
    }
    // The last unload ended everything.
    static void expectAllGone()
    {
        EXPECT_EQ(IST::ICloadCount, 0u);
        EXPECT_TRUE(IST::unloaddone);
        EXPECT_EQ(IST::lt, nullptr);
        EXPECT_EQ(ictestprobe::liveImages(), 0);
    }
};

TEST_F(InstalledLoader, TheLastUnloadStopsJoinsAndDeletesItFirst)
{
    ictest::Watchdog dog(30, "unload with a loader thread");
    tree_.addMI("mi_alpha");
    ASSERT_EQ(open(), 0);
    ASSERT_EQ(open(), 0);
    IC::LoaderThread* const t = install(3600);
    Unloadlib();
    EXPECT_EQ(IST::lt, t);
    EXPECT_FALSE(t->stopped());
    EXPECT_TRUE(t->isRunning());

    ictest::LogCapture cap;
    Unloadlib(); // deletes it (the address checker reports it otherwise)
    expectAllGone();
    // The thread is gone before any plug-in is destroyed.
    ictest::expectInOrder(ictest::timeline(cap), {"doUnload: waiting for LoaderThread Termination ",
                                                  "doUnload: LoaderThread ended ", "mi_alpha:release"});
    EXPECT_EQ(cap.count(kLogIC, 3000, "doUnload: LoaderThread ended "), 1u);
}

TEST_F(InstalledLoader, ReloadsPeriodicallyWhileOpen)
{
    ictest::Watchdog dog(60, "periodic reload");
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    ASSERT_EQ(open(), 0);
    install(1);
    std::string const beta = tree_.addMI("mi_beta");
    EXPECT_TRUE(ictestprobe::waitFor("mi_beta:getMap", 10000));
    EXPECT_TRUE(ictestprobe::waitFor("fp_one:updatedMis added=1 removed=0", 10000));
    ictest::fs::remove(beta);
    EXPECT_TRUE(ictestprobe::waitFor("mi_beta:release", 10000));
    EXPECT_TRUE(ictestprobe::waitFor("fp_one:updatedMis added=0 removed=1", 10000));
    tree_.addFP("fp_two");
    EXPECT_TRUE(ictestprobe::waitFor("fp_two:OpenFP", 10000));
    Unloadlib();
    expectAllGone();
}

TEST_F(InstalledLoader, AnUnloadDuringASlowReloadWaitsForItAndFinishes)
{
    ictest::Watchdog dog(30, "unload during a slow reload");
    tree_.addMI("mi_alpha");
    ASSERT_EQ(open(), 0);
    install(1);
    tree_.addMI("mi_slow");
    // The reload is inside the plug-in's Initialize, with the load lock held.
    ASSERT_TRUE(ictest::eventually(
        [] { return !ictestprobe::eventsWithPrefix("mi_slow:Initialize base=").empty(); }, 10000));
    Unloadlib();
    expectAllGone();
    // The load that was under way completed before the teardown.
    ictest::expectInOrder(ictestprobe::events(), {"mi_slow:Initialize slept", "mi_slow:shutdown"});
    EXPECT_EQ(ictestprobe::count("mi_slow:release"), 1u);
}

// The loader thread has woken up and waits for the load lock inside a timed
// reload while the last unload takes that lock: the unload must still end.
// Who gets the lock first is up to the scheduler, so the round is repeated.
TEST_F(InstalledLoader, AnUnloadWhileTheReloadWaitsForTheLockDoesNotDeadlock)
{
    tree_.addMI("mi_alpha");
    for (int round = 0; round < 3; ++round) {
        SCOPED_TRACE(round);
        ictest::Watchdog dog(30, "unload against a waiting reload");
        ASSERT_EQ(open(), 0);
        install(1);
        ictest::LogCapture cap;
        IST::loadlock.lock();
        bool const waiting = ictest::eventually(
            [&] { return cap.count(kLogIC, 3000, "Instrumentation Control Timed Reload") >= 1; });
        std::thread unloader([] { Unloadlib(); });
        // Let the unload queue up for the lock as well.
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
        IST::loadlock.unlock();
        unloader.join();
        EXPECT_TRUE(waiting);
        expectAllGone();
    }
}

} // namespace
