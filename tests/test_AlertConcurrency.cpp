// Stress test of the alert subsystem: registrations of every form come and go
// while management-interface and functional plug-in batches are dispatched,
// nodes are removed and come back, simple subscriptions change and clients
// read the asserted alerts. Every callback checks that what it receives
// matches its own filter; at the end nothing may be left registered.
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include <HGLog/HGLogger.h>
#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/Node.h>
#include <SD/Mutex.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <future>
#include <memory>
#include <set>
#include <string>
#include <thread>
#include <vector>

namespace {

namespace ICC = IC::InstCtrl;
using IC::Alert;
using IC::Node;
using Paths = std::vector<std::string>;
using ST = Node::SensorType;

constexpr int kOps = 2000;               // operations per thread
constexpr unsigned char kFromMI = 1;     // severity marking management batches
constexpr unsigned char kFromFP = 2;     // severity marking plug-in batches
constexpr unsigned int kWatchedClass = 7;

Alert::ClassType cls(unsigned int n) { return static_cast<Alert::ClassType>(n); }

// The message of every alert raised here is its number of paths, so that a
// receiver can tell whether it got all of them.
Alert alertFrom(unsigned char source, unsigned int c, Paths paths, unsigned int status)
{
    std::string const n = std::to_string(paths.size());
    return Alert(source, cls(c), std::move(paths), status, n);
}

// Fixed after set-up, read by every thread.
std::set<std::string> gCpuPaths, gFanPaths;

std::set<std::string> const& pathsOfSensor(ST s) { return s == ST::CPU ? gCpuPaths : gFanPaths; }

enum class Form { ClientSensor, ClientClass, ClientPaths, PlugInSensor, PlugInPaths };

// One subscriber with a single, fixed filter.
struct Watch {
    Watch(Form form, IC::AlertCallBack cb, ST sensor = ST::CPU, Paths paths = {})
        : form(form), cb(cb), sensor(sensor), paths(std::move(paths))
    {
    }

    Form const form;
    IC::AlertCallBack const cb;
    ST const sensor;
    Paths const paths;

    std::atomic<long> calls{0}, alerts{0}, fromMI{0}, bad{0};

    bool client() const
    {
        return form == Form::ClientSensor || form == Form::ClientClass ||
               form == Form::ClientPaths;
    }

    void check(std::vector<Alert> const& batch)
    {
        ++calls;
        for (auto const& a : batch) {
            ++alerts;
            if (a.getSeverity() == kFromMI) {
                ++fromMI;
                if (client())
                    ++bad; // clients only see what plug-ins raise
            }
            Paths const got = a.getNodePaths();
            switch (form) {
            case Form::ClientClass:
                if (a.getClass() != cls(kWatchedClass) ||
                    std::to_string(got.size()) != a.getMessage())
                    ++bad;
                break;
            case Form::ClientSensor:
            case Form::PlugInSensor:
                if (got.empty())
                    ++bad;
                for (auto const& p : got)
                    if (!pathsOfSensor(sensor).count(p))
                        ++bad;
                break;
            case Form::ClientPaths:
            case Form::PlugInPaths:
                if (got.empty())
                    ++bad;
                for (auto const& p : got)
                    if (std::find(paths.begin(), paths.end(), p) == paths.end())
                        ++bad;
                break;
            }
        }
    }
};

IC::Error watchA(std::vector<Alert> const& a, void const* ctx)
{
    static_cast<Watch*>(const_cast<void*>(ctx))->check(a);
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

IC::Error watchB(std::vector<Alert> const& a, void const* ctx)
{
    static_cast<Watch*>(const_cast<void*>(ctx))->check(a);
    return IC::Error(1, IC::Number(IC::Number::Generic), "");
}

std::atomic<long> gSelfRemovals{0};

// Drops its own registration from inside the delivery.
IC::Error selfRemoving(std::vector<Alert> const& a, void const* ctx)
{
    auto* w = static_cast<Watch*>(const_cast<void*>(ctx));
    w->check(a);
    if (ICC::deRegFPsensorAlerts(selfRemoving, w->sensor, ctx).getStatus() == 0)
        ++gSelfRemovals;
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

IC::Error subscribe(IC::InstrumentationControl& ic, Watch& w)
{
    switch (w.form) {
    case Form::ClientSensor: return ic.registerForAlerts(w.cb, w.sensor, &w);
    case Form::ClientClass: return ICC::registerForAlerts(w.cb, cls(kWatchedClass), &w);
    case Form::ClientPaths: return ICC::registerForAlerts(w.cb, w.paths, &w);
    case Form::PlugInSensor: return ICC::regFPsensorAlerts(w.cb, w.sensor, &w);
    case Form::PlugInPaths: return ICC::regFPAlerts(w.cb, w.paths, &w);
    }
    return IC::Error(1, IC::Number(IC::Number::Generic), "");
}

IC::Error unsubscribe(IC::InstrumentationControl& ic, Watch& w)
{
    switch (w.form) {
    case Form::ClientSensor: return ic.deRegisterForAlerts(w.cb, w.sensor, &w);
    case Form::ClientClass: return ICC::deRegisterForAlerts(w.cb, cls(kWatchedClass), &w);
    case Form::ClientPaths: return ICC::deRegisterForAlerts(w.cb, w.paths, &w);
    case Form::PlugInSensor: return ICC::deRegFPsensorAlerts(w.cb, w.sensor, &w);
    case Form::PlugInPaths: return ICC::deRegFPAlerts(w.cb, w.paths, &w);
    }
    return IC::Error(1, IC::Number(IC::Number::Generic), "");
}

struct SimpleWatch {
    std::set<std::string> const* paths;
    std::atomic<long> calls{0}, bad{0};
};

void simpleWatch(unsigned int code, SD::DateTime, std::string path, void const* ctx)
{
    auto* w = static_cast<SimpleWatch*>(const_cast<void*>(ctx));
    ++w->calls;
    if (code > 2 || !w->paths->count(path))
        ++w->bad;
}

void resetAlertState()
{
    {
        SD::MutexGuard g(ICC::registerlock);
        for (auto& kv : ICC::callbacks)
            delete kv.second;
        ICC::callbacks.clear();
        ICC::nodepathTOalertregister.clear();
        ICC::sensortypeTOalertregister.clear();
        ICC::classtypeTOalertregister.clear();
        ICC::mysam.clear();
    }
    ICC::nodestore.clear();
    ICC::alertstore.clear();
}

class AlertStress : public ::testing::Test {
protected:
    void SetUp() override
    {
        // Thousands of warnings would otherwise go to standard error.
        std::string const conf = ::testing::TempDir() + "alert_stress_log.properties";
        std::ofstream(conf) << "log4j.rootLogger=OFF\n";
        ASSERT_TRUE(HGLog::HGLogger::configure(conf));
        std::remove(conf.c_str());

        resetAlertState();
        nodes.push_back(std::make_unique<Node>(ST::ROOT, 0, 1, 0, "root"));
        for (unsigned int i = 0; i < 8; ++i)
            nodes.push_back(std::make_unique<Node>(ST::CPU, i, 2 + i, 1, "cpu"));
        for (unsigned int i = 0; i < 4; ++i)
            nodes.push_back(std::make_unique<Node>(ST::Fan, i, 10 + i, 1, "fan"));
        for (auto& n : nodes) {
            Node* p = n.get();
            bool isNew = false;
            ASSERT_EQ(ICC::nodestore.addNodeIfNew(p, isNew).getStatus(), 0);
            ASSERT_TRUE(isNew);
            if (n->getSensor() == ST::CPU)
                cpu.push_back(n->getPath());
            else if (n->getSensor() == ST::Fan)
                fan.push_back(n->getPath());
        }
        gCpuPaths = std::set<std::string>(cpu.begin(), cpu.end());
        gFanPaths = std::set<std::string>(fan.begin(), fan.end());
        ASSERT_EQ(gCpuPaths.size(), 8u);
        ASSERT_EQ(gFanPaths.size(), 4u);
    }
    void TearDown() override
    {
        resetAlertState();
        HGLog::HGLogger::configureDefault();
    }

    std::vector<std::unique_ptr<Node> > nodes;
    Paths cpu, fan;
};

} // namespace

TEST_F(AlertStress, RegistrationsDispatchAndQueriesInterleaveSafely)
{
    IC::InstrumentationControl ic;
    // Nodes 7 and 8 (CPU 6 and 7) and 12 (fan 3) are removed and re-added.
    std::vector<Node*> const removable{nodes[7].get(), nodes[8].get(), nodes[12].get()};

    Watch longClient{Form::ClientSensor, watchA};
    Watch longPlugIn{Form::PlugInSensor, watchB};
    Watch self{Form::PlugInSensor, selfRemoving};
    Watch clientSensor{Form::ClientSensor, watchB};
    Watch clientClass{Form::ClientClass, watchA};
    Watch clientPaths{Form::ClientPaths, watchB, ST::CPU, {cpu[1], fan[0], cpu[7]}};
    Watch plugInSensor{Form::PlugInSensor, watchA, ST::Fan};
    Watch plugInPaths{Form::PlugInPaths, watchA, ST::CPU, {cpu[2], fan[3]}};
    SimpleWatch simpleLong{&gFanPaths}, simpleToggled{&gCpuPaths};

    ASSERT_EQ(subscribe(ic, longClient).getStatus(), 0);
    ASSERT_EQ(subscribe(ic, longPlugIn).getStatus(), 0);
    ASSERT_EQ(subscribe(ic, self).getStatus(), 0);
    ASSERT_EQ(ic.registerForSimpleAlerts(simpleWatch, ST::Fan, &simpleLong).getStatus(), 0);

    std::atomic<long> failures{0};
    std::atomic<bool> go{false};
    std::atomic<int> sourcesRunning{2};
    // Registration and query threads keep going while alerts still flow, so
    // that the two overlap however the threads are scheduled.
    auto more = [&sourcesRunning](int i) {
        return i < kOps || (sourcesRunning.load() > 0 && i < 20 * kOps);
    };
    auto waitForStart = [&go] {
        while (!go.load())
            std::this_thread::yield();
    };

    // Each toggles its subscriptions: on at one visit, off at the next.
    auto toggler = [&](std::vector<Watch*> mine, bool feedSelf) {
        return [&, mine, feedSelf] {
            waitForStart();
            std::vector<bool> on(mine.size(), false);
            for (int i = 0; more(i); ++i) {
                std::size_t const k = static_cast<std::size_t>(i) % mine.size();
                IC::Error const r = on[k] ? unsubscribe(ic, *mine[k]) : subscribe(ic, *mine[k]);
                failures += r.getStatus() != 0;
                on[k] = !on[k];
                if (feedSelf && i % 4 == 0)
                    failures += subscribe(ic, self).getStatus() != 0;
            }
            for (std::size_t k = 0; k < mine.size(); ++k)
                if (on[k])
                    failures += unsubscribe(ic, *mine[k]).getStatus() != 0;
        };
    };

    auto managementSource = [&] {
        waitForStart();
        for (int i = 0; i < kOps; ++i) {
            std::string const& c = cpu[static_cast<std::size_t>(i) % 8];
            std::string const& f = fan[static_cast<std::size_t>(i) % 4];
            std::vector<Alert> const batch{alertFrom(kFromMI, 0, {c}, 2),
                                           alertFrom(kFromMI, kWatchedClass, {c, f}, 3),
                                           alertFrom(kFromMI, 5, {f}, 2)};
            failures += ICC::AlertCallBackMI(batch, nullptr).getStatus() != 0;
        }
        --sourcesRunning;
    };

    std::atomic<long> removals{0};
    auto plugInSource = [&] {
        waitForStart();
        for (int i = 0; i < kOps; ++i) {
            std::string const& c = cpu[static_cast<std::size_t>(i) % 8];
            std::string const& c2 = cpu[static_cast<std::size_t>(i + 3) % 8];
            std::string const& f = fan[static_cast<std::size_t>(i) % 4];
            std::vector<Alert> const batch{alertFrom(kFromFP, 0, {c}, i % 2 ? 1u : 2u),
                                           alertFrom(kFromFP, kWatchedClass, {c2, f}, 2),
                                           alertFrom(kFromFP, 5, {f}, 0)};
            failures += ICC::AlertCallBackFP(batch).getStatus() != 0;
            if (i % 10 == 0)
                failures += ICC::AssertCallBackFP({alertFrom(kFromFP, 0, {c}, 3)}).getStatus() != 0;
            if (i % 16 == 0) {
                Node* n = removable[static_cast<std::size_t>(i / 16) % removable.size()];
                std::string const path = n->getPath();
                failures +=
                    ICC::AlertCallBackFP({alertFrom(kFromFP, 4, {path}, 2)}).getStatus() != 0;
                Node* found = nullptr;
                failures += ICC::nodestore.getNode(path, &found).getStatus() != 1;
                bool isNew = false;
                failures += ICC::nodestore.addNodeIfNew(n, isNew).getStatus() != 0;
                failures += !isNew;
                ++removals;
            }
        }
        --sourcesRunning;
    };

    auto reader = [&] {
        waitForStart();
        bool on = false;
        std::vector<Alert> out;
        for (int i = 0; more(i); ++i) {
            if (i % 2 == 0) {
                failures += ic.getAssertedAlerts(out).getStatus() != 0;
                for (auto const& a : out)
                    failures += a.getStatus() == 1 || a.getNodePaths().empty();
            }
            IC::Error const r =
                on ? ic.deRegisterForSimpleAlerts(simpleWatch, ST::CPU, &simpleToggled)
                   : ic.registerForSimpleAlerts(simpleWatch, ST::CPU, &simpleToggled);
            failures += r.getStatus() != 0;
            on = !on;
        }
        if (on)
            failures +=
                ic.deRegisterForSimpleAlerts(simpleWatch, ST::CPU, &simpleToggled).getStatus() !=
                0;
    };

    // A deadlock fails the run instead of hanging it.
    std::promise<void> finished;
    std::thread watchdog([f = finished.get_future()]() mutable {
        if (f.wait_for(std::chrono::seconds(240)) == std::future_status::timeout) {
            std::fprintf(stderr, "alert stress test did not finish: deadlock?\n");
            std::abort();
        }
    });

    std::vector<std::thread> threads;
    threads.emplace_back(toggler({&clientSensor, &clientClass, &clientPaths}, false));
    threads.emplace_back(toggler({&plugInSensor, &plugInPaths}, true));
    threads.emplace_back(managementSource);
    threads.emplace_back(plugInSource);
    threads.emplace_back(reader);
    go = true;
    for (auto& t : threads)
        t.join();
    finished.set_value();
    watchdog.join();

    EXPECT_EQ(failures.load(), 0);
    EXPECT_EQ(unsubscribe(ic, longClient).getStatus(), 0);
    EXPECT_EQ(unsubscribe(ic, longPlugIn).getStatus(), 0);
    unsubscribe(ic, self); // may already have removed itself
    EXPECT_EQ(ic.deRegisterForSimpleAlerts(simpleWatch, ST::Fan, &simpleLong).getStatus(), 0);
    {
        SD::MutexGuard g(ICC::registerlock);
        EXPECT_TRUE(ICC::callbacks.empty());
        EXPECT_TRUE(ICC::sensortypeTOalertregister.empty());
        EXPECT_TRUE(ICC::classtypeTOalertregister.empty());
        EXPECT_TRUE(ICC::nodepathTOalertregister.empty());
        EXPECT_TRUE(ICC::mysam.empty());
    }

    for (Watch* w : {&longClient, &longPlugIn, &self, &clientSensor, &clientClass, &clientPaths,
                     &plugInSensor, &plugInPaths})
        EXPECT_EQ(w->bad.load(), 0) << "a callback received alerts outside its filter";
    EXPECT_EQ(simpleLong.bad.load(), 0);
    EXPECT_EQ(simpleToggled.bad.load(), 0);

    // The long-lived subscriptions saw the traffic they asked for.
    EXPECT_GT(longClient.alerts.load(), 0);
    EXPECT_EQ(longClient.fromMI.load(), 0);
    EXPECT_GT(longPlugIn.fromMI.load(), 0);
    EXPECT_GT(longPlugIn.alerts.load() - longPlugIn.fromMI.load(), 0);
    EXPECT_GT(simpleLong.calls.load(), 0);
    EXPECT_EQ(removals.load(), (kOps + 15) / 16);
    EXPECT_GT(self.calls.load(), 0);
    EXPECT_GT(gSelfRemovals.load(), 0);

    std::vector<Alert> left;
    ic.getAssertedAlerts(left);
    for (auto const& a : left)
        EXPECT_NE(a.getStatus(), 1u);
}
