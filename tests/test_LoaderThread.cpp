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

std::atomic<int> calls{0};
void count()
{
    ++calls;
}

std::string const kZeroDelay = "LoaderThread has zero delay. Setting 10 seconds instead";

// The delay is corrected when the thread runs, not before. A stop while it
// waits ends it at once; stop() itself then sleeps a second.
TEST(LoaderThreadAlone, AZeroDelayBecomesTenSecondsAndAStopWhileWaitingEndsIt)
{
    ictest::Watchdog dog(30, "loader thread");
    calls = 0;
    ictest::LogCapture cap;
    IC::LoaderThread t(77, 0, &count);
    EXPECT_TRUE(t.getHostValue() == 77u && t.getDelay() == 0u);
    ASSERT_TRUE(t.start());
    EXPECT_TRUE(ictest::eventually([&] { return cap.count(kLogLT, 6000, kZeroDelay) == 1; }));
    EXPECT_TRUE(t.getDelay() == 10u && !t.stopped());
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    EXPECT_EQ(calls.load(), 0) << "called before its period";
    auto const before = std::chrono::steady_clock::now();
    t.stop();
    EXPECT_GE(std::chrono::steady_clock::now() - before, std::chrono::milliseconds(950));
    EXPECT_TRUE(t.join() && t.stopped() && calls.load() == 0);
    ASSERT_EQ(cap.logs(kLogLT).size(), 1u);
    ictest::expectEvent(cap, {kLogLT, "LoaderThread"}, kZeroDelay, 6000, "run");
}

// Without a function it only waits. With the stop request already there, a
// run only corrects the delay and ends, and the next one does not even do
// that; an exception from the function ends run().
TEST(LoaderThreadAlone, CallsItsFunctionEveryPeriodUntilStopped)
{
    ictest::Watchdog dog(30, "loader thread");
    calls = 0;
    ictest::LogCapture cap;
    IC::LoaderThread t(0, 1, &count), idle(0, 1, nullptr);
    ASSERT_TRUE(t.start() && idle.start());
    EXPECT_TRUE(ictest::eventually([] { return calls.load() >= 2; }, 8000));
    EXPECT_FALSE(t.stopped() || idle.stopped());
    t.stop();
    idle.stop();
    EXPECT_TRUE(t.join() && idle.join() && t.stopped() && idle.stopped());
    int const seen = calls.load();
    EXPECT_TRUE(cap.logs(kLogLT).empty());

    IC::LoaderThread stopped(1, 0, &count);
    stopped.stop();
    EXPECT_EQ(stopped.run(nullptr), nullptr);
    EXPECT_EQ(stopped.run(nullptr), nullptr);
    EXPECT_EQ(cap.messages(kLogLT), std::vector<std::string>{kZeroDelay});
    EXPECT_EQ(calls.load(), seen) << "a stopped object never calls";
    IC::LoaderThread failing(0, 1, [] { throw std::runtime_error("reload broke"); });
    EXPECT_THROW(failing.run(nullptr), std::runtime_error);
    EXPECT_FALSE(failing.stopped()) << "run() did not get to its end";
}

// A host may derive its own loader thread from the class (or catch and cast
// it): the type's run-time information is part of the library's interface.
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
    void SetUp() override
    {
        PluginTest::SetUp();
        tree_.addMI("mi_alpha");
    }
    // Opens and installs a loader thread, as a host does.
    static IC::LoaderThread* openWithLoader(unsigned long delay)
    {
        IC::InstrumentationControl* c = nullptr;
        IC::Error* e = nullptr;
        EXPECT_EQ(Open(&c, &e), 0);
        IST::lt = new IC::LoaderThread(0, delay, &IST::TimedReload);
        EXPECT_TRUE(IST::lt->start());
        return IST::lt;
    }
    // The last unload ended everything, the thread first.
    static void expectAllGone()
    {
        EXPECT_TRUE(IST::ICloadCount == 0u && IST::unloaddone && IST::lt == nullptr);
        EXPECT_EQ(ictestprobe::liveImages(), 0);
    }
    ictest::Watchdog dog_{60, "installed loader thread"};
};

TEST_F(InstalledLoader, OnlyTheLastUnloadStopsJoinsAndDeletesItBeforeAnyPlugIn)
{
    openWithLoader(3600);
    IC::InstrumentationControl* c = nullptr;
    IC::Error* e = nullptr;
    ASSERT_EQ(Open(&c, &e), 0);
    IC::LoaderThread* const t = IST::lt;
    Unloadlib();
    EXPECT_TRUE(IST::lt == t && t->isRunning() && !t->stopped());
    ictest::LogCapture cap;
    Unloadlib(); // deletes it (the address checker reports it otherwise)
    expectAllGone();
    ictest::expectInOrder(ictest::timeline(cap), {"doUnload: waiting for LoaderThread Termination ",
                                                  "doUnload: LoaderThread ended ", "mi_alpha:release"});
    ictest::expectEvent(cap, {kLogIC, "InstrumentationControl"}, "doUnload: LoaderThread ended ", 3000, "doUnload");
}

// The thread's reload is inside the new plug-in's Initialize, with the load
// lock held: the load under way completes before the teardown.
TEST_F(InstalledLoader, AnUnloadDuringASlowReloadWaitsForItAndFinishes)
{
    openWithLoader(1);
    tree_.addMI("mi_slow");
    ASSERT_TRUE(ictest::eventually(
        [] { return !ictestprobe::eventsWithPrefix("mi_slow:Initialize base=").empty(); }, 10000));
    Unloadlib();
    expectAllGone();
    ictest::expectInOrder(ictestprobe::events(), {"mi_slow:Initialize slept", "mi_slow:shutdown", "mi_slow:release"});
}

// The loader thread has woken up and waits for the load lock inside a timed
// reload while the last unload takes that lock: the unload must still end.
// Who gets the lock first is up to the scheduler, so the round is repeated.
TEST_F(InstalledLoader, AnUnloadWhileTheReloadWaitsForTheLockDoesNotDeadlock)
{
    for (int round = 0; round < 3; ++round) {
        openWithLoader(1);
        ictest::LogCapture cap;
        IST::loadlock.lock();
        EXPECT_TRUE(ictest::eventually(
            [&] { return cap.count(kLogIC, 3000, "Instrumentation Control Timed Reload") >= 1; }));
        ictest::JoinedThread unloader([] { Unloadlib(); });
        // Let the unload queue up for the lock as well.
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
        IST::loadlock.unlock();
        unloader.join();
        expectAllGone();
    }
}

} // namespace
