// The loader thread (IC::LoaderThread) on its own, and installed as the
// library's periodic reloader: its part in the unload, and unloads that meet
// a reload under way.
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>
#include <IC/LoaderThread.h>

#include "PluginTest.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include <dlfcn.h>

namespace {

using ictest::countLog;
using ictest::kLogIC;
using ictest::kLogLT;
namespace IST = IC::InstCtrl;
using Clock = std::chrono::steady_clock;

std::atomic<int> calls{0};
void count()
{
    ++calls;
}

void fail()
{
    throw std::runtime_error("reload broke");
}

std::string const kZeroDelay = "LoaderThread has zero delay. Setting 10 seconds instead";

// Polls until pred holds or ms have passed.
template <class Pred>
bool eventually(Pred pred, int ms)
{
    auto const end = Clock::now() + std::chrono::milliseconds(ms);
    while (!pred()) {
        if (Clock::now() > end)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return true;
}

class LoaderThreadAlone : public testing::Test {
protected:
    void SetUp() override { calls = 0; }
};

TEST_F(LoaderThreadAlone, KeepsWhatItWasGiven)
{
    IC::LoaderThread t(77, 5, &count);
    EXPECT_EQ(t.getHostValue(), 77u);
    EXPECT_EQ(t.getDelay(), 5u);
    EXPECT_FALSE(t.stopped());
}

TEST_F(LoaderThreadAlone, AZeroDelayBecomesTenSecondsWithOneErrorLine)
{
    ictest::Watchdog dog(30, "zero delay");
    ictest::LogCapture cap;
    IC::LoaderThread t(3, 0, &count);
    // Corrected when the thread runs, not before.
    EXPECT_EQ(t.getDelay(), 0u);
    ASSERT_TRUE(t.start());
    // Give run() the chance to start before the stop request; it logs the
    // correction either way.
    ASSERT_TRUE(eventually([&] { return countLog(cap, kLogLT, 6000, kZeroDelay) == 1; }, 5000));
    t.stop();
    t.join();
    EXPECT_TRUE(t.stopped());
    EXPECT_EQ(t.getDelay(), 10u);
    EXPECT_EQ(calls.load(), 0);
    auto const logs = ictest::logsOf(cap, kLogLT);
    ASSERT_EQ(logs.size(), 1u);
    EXPECT_EQ(logs[0].message, kZeroDelay);
    EXPECT_EQ(logs[0].level, 6000);
    EXPECT_EQ(logs[0].function, "run");
    EXPECT_EQ(logs[0].file, "LoaderThread");
}

TEST_F(LoaderThreadAlone, CallsItsFunctionEveryPeriodUntilStopped)
{
    ictest::Watchdog dog(30, "periodic calls");
    ictest::LogCapture cap;
    IC::LoaderThread t(0, 1, &count);
    ASSERT_TRUE(t.start());
    EXPECT_TRUE(eventually([] { return calls.load() >= 2; }, 8000));
    EXPECT_FALSE(t.stopped());
    t.stop();
    t.join();
    EXPECT_TRUE(t.stopped());
    int const seen = calls.load();
    std::this_thread::sleep_for(std::chrono::milliseconds(1200));
    EXPECT_EQ(calls.load(), seen);
    EXPECT_EQ(t.getDelay(), 1u);
    EXPECT_TRUE(ictest::logsOf(cap, kLogLT).empty());
}

TEST_F(LoaderThreadAlone, WithoutAFunctionItOnlyWaits)
{
    ictest::Watchdog dog(30, "null function");
    ictest::LogCapture cap;
    IC::LoaderThread t(0, 1, nullptr);
    ASSERT_TRUE(t.start());
    std::this_thread::sleep_for(std::chrono::milliseconds(1500));
    EXPECT_FALSE(t.stopped());
    t.stop();
    t.join();
    EXPECT_TRUE(t.stopped());
    EXPECT_TRUE(ictest::logsOf(cap, kLogLT).empty());
}

TEST_F(LoaderThreadAlone, AStopWhileWaitingTakesItsSecondAndEndsTheThread)
{
    ictest::Watchdog dog(30, "stop while waiting");
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

TEST_F(LoaderThreadAlone, RunOnAStoppedObjectReturnsAtOnce)
{
    ictest::Watchdog dog(30, "run twice");
    IC::LoaderThread t(1, 0, &count);
    t.stop();
    ictest::LogCapture cap;
    // The stop request is already there: the first run only corrects the
    // delay and ends.
    EXPECT_EQ(t.run(nullptr), nullptr);
    EXPECT_TRUE(t.stopped());
    EXPECT_EQ(countLog(cap, kLogLT, 6000, kZeroDelay), 1u);
    EXPECT_EQ(ictest::logsOf(cap, kLogLT).size(), 1u);
    cap.clear();
    EXPECT_EQ(t.run(nullptr), nullptr);
    EXPECT_TRUE(t.stopped());
    EXPECT_TRUE(ictest::logsOf(cap, kLogLT).empty());
    EXPECT_EQ(calls.load(), 0);
}

TEST_F(LoaderThreadAlone, AnExceptionFromTheFunctionEndsRun)
{
    ictest::Watchdog dog(30, "throwing function");
    IC::LoaderThread t(0, 1, &fail);
    EXPECT_THROW(t.run(nullptr), std::runtime_error);
    // run() did not get to its end.
    EXPECT_FALSE(t.stopped());
}

// ---- installed in the library ----

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

class InstalledLoader : public ictest::PluginTest {
protected:
    void TearDown() override
    {
        // Whatever a test left installed goes with the unload.
        ictest::Watchdog dog(30, "teardown");
        PluginTest::TearDown();
        EXPECT_EQ(IST::lt, nullptr);
    }
    unsigned char open()
    {
        IC::InstrumentationControl* c = nullptr;
        IC::Error* e = nullptr;
        return Open(&c, &e);
    }
    void install(unsigned long delay, void (*function)())
    {
        auto* t = new IC::LoaderThread(0, delay, function);
        IST::lt = t;
        ASSERT_TRUE(t->start());
    }
};

TEST_F(InstalledLoader, TheLastUnloadStopsJoinsAndDeletesIt)
{
    ictest::Watchdog dog(30, "unload with a loader thread");
    tree_.addMI("mi_alpha");
    ASSERT_EQ(open(), 0);
    ASSERT_EQ(open(), 0);
    install(3600, &IST::TimedReload);
    IC::LoaderThread* const t = IST::lt;

    Unloadlib();
    EXPECT_EQ(IST::lt, t);
    EXPECT_FALSE(t->stopped());
    EXPECT_TRUE(t->isRunning());

    ictest::LogCapture cap;
    // Deleted by the unload (the address checker reports it otherwise).
    Unloadlib();
    EXPECT_EQ(IST::lt, nullptr);
    auto const tl = ictest::timeline(cap);
    long const waiting = ictest::indexOf(tl, "doUnload: waiting for LoaderThread Termination ");
    long const ended = ictest::indexOf(tl, "doUnload: LoaderThread ended ");
    long const released = ictest::indexOf(tl, "mi_alpha:release");
    EXPECT_GE(waiting, 0);
    EXPECT_LT(waiting, ended);
    // The thread is gone before any plug-in is destroyed.
    EXPECT_LT(ended, released);
    EXPECT_EQ(countLog(cap, kLogIC, 3000, "doUnload: LoaderThread ended "), 1u);
}

TEST_F(InstalledLoader, ReloadsPeriodicallyWhileOpen)
{
    ictest::Watchdog dog(60, "periodic reload");
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    ASSERT_EQ(open(), 0);
    install(1, &IST::TimedReload);

    std::string const beta = tree_.addMI("mi_beta");
    EXPECT_TRUE(ictestprobe::waitFor("mi_beta:getMap", 10000));
    EXPECT_TRUE(ictestprobe::waitFor("fp_one:updatedMis added=1 removed=0", 10000));
    ictest::TempTree::remove(beta);
    EXPECT_TRUE(ictestprobe::waitFor("mi_beta:release", 10000));
    EXPECT_TRUE(ictestprobe::waitFor("fp_one:updatedMis added=0 removed=1", 10000));
    tree_.addFP("fp_two");
    EXPECT_TRUE(ictestprobe::waitFor("fp_two:OpenFP", 10000));

    Unloadlib();
    EXPECT_EQ(IST::lt, nullptr);
    EXPECT_EQ(IST::ICloadCount, 0u);
    EXPECT_EQ(ictestprobe::liveImages(), 0);
}

TEST_F(InstalledLoader, AnUnloadDuringASlowReloadWaitsForItAndFinishes)
{
    ictest::Watchdog dog(30, "unload during a slow reload");
    tree_.addMI("mi_alpha");
    ASSERT_EQ(open(), 0);
    install(1, &IST::TimedReload);
    tree_.addMI("mi_slow");
    // The reload is inside the plug-in's Initialize, with the load lock held.
    ASSERT_TRUE(eventually(
        [] { return !ictestprobe::eventsWithPrefix("mi_slow:Initialize base=").empty(); }, 10000));

    Unloadlib();
    EXPECT_EQ(IST::ICloadCount, 0u);
    EXPECT_TRUE(IST::unloaddone);
    EXPECT_EQ(IST::lt, nullptr);
    // The load that was under way completed before the teardown.
    auto const ev = ictestprobe::events();
    long const slept = ictest::indexOf(ev, "mi_slow:Initialize slept");
    long const down = ictest::indexOf(ev, "mi_slow:shutdown");
    EXPECT_GE(slept, 0);
    EXPECT_LT(slept, down);
    EXPECT_EQ(ictestprobe::count("mi_slow:release"), 1u);
    EXPECT_EQ(ictestprobe::liveImages(), 0);
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
        install(1, &IST::TimedReload);

        ictest::LogCapture cap;
        IST::loadlock.lock();
        bool const waiting = eventually(
            [&] { return countLog(cap, kLogIC, 3000, "Instrumentation Control Timed Reload") >= 1; },
            5000);
        std::thread unloader([] { Unloadlib(); });
        // Let the unload queue up for the lock as well.
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
        IST::loadlock.unlock();
        unloader.join();

        EXPECT_TRUE(waiting);
        EXPECT_EQ(IST::ICloadCount, 0u);
        EXPECT_TRUE(IST::unloaddone);
        EXPECT_EQ(IST::lt, nullptr);
        EXPECT_EQ(ictestprobe::liveImages(), 0);
    }
}

} // namespace
