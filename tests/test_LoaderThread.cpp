// The loader thread (IC::LoaderThread) on its own, and installed as the
// library's periodic reloader: its part in the unload, and unloads that meet
// a reload under way.
#include <IC/LoaderThread.h>

#include "PluginHarness.h"

namespace {

using namespace ictest;
namespace IST = IC::InstCtrl;

std::atomic<int> calls{0};
void count() { ++calls; }

std::string const kZeroDelay = "LoaderThread has zero delay. Setting 10 seconds instead";

// The delay is corrected when the thread runs, not before. A stop while it
// waits ends it at once.
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
    t.stop();
    EXPECT_TRUE(t.join() && t.stopped() && calls.load() == 0);
}

// A stopped object never calls its function; an exception from the function
// ends run(). (The periodic calls are the installed loader's tests.)
TEST(LoaderThreadAlone, AStoppedOneNeverCallsAndAnExceptionEndsRun)
{
    ictest::Watchdog dog(30, "loader thread");
    calls = 0;
    IC::LoaderThread stopped(1, 0, &count);
    stopped.stop();
    EXPECT_EQ(stopped.run(nullptr), nullptr);
    EXPECT_EQ(calls.load(), 0);
    IC::LoaderThread failing(0, 1, [] { throw std::runtime_error("reload broke"); });
    EXPECT_THROW(failing.run(nullptr), std::runtime_error) << "an exception from the function ends run()";
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
    static void openWithLoader(unsigned long delay)
    {
        IC::InstrumentationControl* c = nullptr;
        IC::Error* e = nullptr;
        EXPECT_EQ(Open(&c, &e), 0);
        IST::lt = new IC::LoaderThread(0, delay, &IST::TimedReload);
        EXPECT_TRUE(IST::lt->start());
    }
    // The last unload ended everything, the thread first.
    void expectAllGone()
    {
        EXPECT_TRUE(IST::ICloadCount == 0u && IST::unloaddone && IST::lt == nullptr);
        EXPECT_FALSE(ictest::isMapped(tree_.root()));
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
    auto const& m = cap.messages();
    auto const at = [&m](std::string const& s) { return std::find(m.begin(), m.end(), s) - m.begin(); };
    EXPECT_LT(at("doUnload: LoaderThread ended "), at("mi_alpha:release"));
}

// The thread's reload is inside the new plug-in's Initialize, with the load
// lock held: the load under way completes before the teardown.
TEST_F(InstalledLoader, AnUnloadDuringASlowReloadWaitsForItAndFinishes)
{
    ictest::LogCapture cap;
    openWithLoader(1);
    // Added after the first reload: a later one, a period on, finds it.
    ASSERT_TRUE(ictest::eventually([&] { return cap.count(kLogIC, 3000, "Instrumentation Control Timed Reload") >= 1; }));
    tree_.addMI("mi_slow");
    ASSERT_TRUE(ictest::eventually([&] { return ictest::calls(cap, "mi_slow").size() >= 3; }, 10000));
    Unloadlib();
    expectAllGone();
    auto const c = ictest::calls(cap, "mi_slow");
    auto const at = [&c](char const* s) { return std::find(c.begin(), c.end(), std::string(s)) - c.begin(); };
    EXPECT_TRUE(at("mi_slow:Initialize slept") < at("mi_slow:shutdown") && at("mi_slow:shutdown") < at("mi_slow:release") &&
                at("mi_slow:release") < static_cast<long>(c.size()));
}

// The loader thread waits for the load lock inside a timed reload while the
// last unload takes that lock: the unload must still end. Who gets the lock
// first is up to the scheduler, so the round is repeated.
TEST_F(InstalledLoader, AnUnloadWhileTheReloadWaitsForTheLockDoesNotDeadlock)
{
    for (int round = 0; round < 3; ++round) {
        openWithLoader(1);
        ictest::LogCapture cap;
        IST::loadlock.lock();
        EXPECT_TRUE(ictest::eventually(
            [&] { return cap.count(kLogIC, 3000, "Instrumentation Control Timed Reload") >= 1; }));
        ictest::JoinedThread unloader([] { Unloadlib(); });
        std::this_thread::sleep_for(std::chrono::milliseconds(200)); // the unload queues up too
        IST::loadlock.unlock();
        unloader.join();
        expectAllGone();
    }
}

} // namespace
