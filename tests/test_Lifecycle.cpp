// The library's life through its entry points, with real plug-ins: open and
// load codes, repeated opens, unload order, timed reload, the node queries of
// the facade and the node entries handed to plug-ins.
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include "PluginTest.h"
#include "Recorders.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include <dlfcn.h>
#include <unistd.h>

namespace {

using ictest::countLog;
using ictest::errText;
using ictest::findLog;
using ictest::kLogFP;
using ictest::kLogIC;
using ictest::kLogMI;
using ictestprobe::FPRecord;
using ictestprobe::MIRecord;
namespace IST = IC::InstCtrl;

MIRecord mi(std::string const& name)
{
    MIRecord r;
    EXPECT_TRUE(ictestprobe::findMI(name, &r)) << name;
    return r;
}

FPRecord fp(std::string const& name)
{
    FPRecord r;
    EXPECT_TRUE(ictestprobe::findFP(name, &r)) << name;
    return r;
}

// The probe's events that show the end of plug-ins and their libraries.
std::vector<std::string> endings()
{
    std::vector<std::string> out;
    for (auto const& e : ictestprobe::events())
        if (e.find(":release") != std::string::npos || e.find(":shutdown") != std::string::npos ||
            e.find(":image unloaded") != std::string::npos)
            out.push_back(e);
    return out;
}

// What a client callback received.
struct ClientLog {
    std::mutex m;
    std::vector<ictest::AlertCall> calls;
};
ClientLog clientLog;

IC::Error clientCallback(std::vector<IC::Alert> const& alerts, void const* context)
{
    std::lock_guard<std::mutex> g(clientLog.m);
    clientLog.calls.push_back(ictest::AlertCall{alerts, context});
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

std::vector<ictest::AlertCall> clientCalls()
{
    std::lock_guard<std::mutex> g(clientLog.m);
    return clientLog.calls;
}

class Lifecycle : public ictest::PluginTest {
protected:
    void SetUp() override
    {
        PluginTest::SetUp();
        ictest::Recorder::get().reset();
        std::lock_guard<std::mutex> g(clientLog.m);
        clientLog.calls.clear();
    }

    unsigned char open()
    {
        control_ = &sentinel_;
        error_ = nullptr;
        return Open(&control_, &error_);
    }

    // A facade method's single line on the library logger, checked in full.
    static void expectQueryLog(ictest::LogCapture const& cap, std::string const& function,
                               std::string const& message)
    {
        auto const logs = ictest::logsOf(cap, kLogIC);
        ASSERT_EQ(logs.size(), 1u) << message;
        EXPECT_EQ(logs[0].message, message);
        EXPECT_EQ(logs[0].function, function);
        EXPECT_EQ(logs[0].file, "InstrumentationControl");
        EXPECT_EQ(logs[0].level, 3000);
    }

    IC::InstrumentationControl sentinel_;
    IC::InstrumentationControl* control_ = nullptr;
    IC::Error* error_ = nullptr;
};

// ---- opening ----

TEST_F(Lifecycle, AFirstOpenLoadsInterfacesThenFPsAndHandsOutTheFacade)
{
    tree_.addMI("mi_alpha");
    tree_.addMI("mi_beta");
    tree_.addFP("fp_one");
    tree_.addFP("fp_two");
    unsigned int const c = IST::mymifpctr;

    ictest::LogCapture cap;
    ASSERT_EQ(open(), 0);
    ASSERT_NE(control_, &sentinel_);
    ASSERT_NE(control_, nullptr);
    ASSERT_NE(error_, nullptr);
    EXPECT_EQ(error_->getStatus(), 0);
    EXPECT_EQ(error_->getCode(), IC::Number(0u));
    EXPECT_EQ(error_->getText(), "");
    EXPECT_EQ(IST::ICloadCount, 1u);
    EXPECT_FALSE(IST::unloaddone);
    EXPECT_EQ(IST::mymilibs.size(), 2u);
    EXPECT_EQ(IST::mymis.size(), 2u);
    EXPECT_EQ(IST::myfplibs.size(), 2u);
    EXPECT_EQ(IST::myfps.size(), 2u);
    EXPECT_EQ(IST::mymifpctr, c + 4);

    // Interfaces first, in name order, then the FPs.
    EXPECT_EQ(ictestprobe::eventsWithPrefix("mi_alpha:Initialize"),
              std::vector<std::string>{"mi_alpha:Initialize base=" + std::to_string(c << 16) +
                                       " iv=1.0 mv=1.0"});
    EXPECT_EQ(mi("mi_beta").base, (c + 1) << 16);
    EXPECT_EQ(fp("fp_one").base, (c + 2) << 16);
    EXPECT_EQ(fp("fp_two").base, (c + 3) << 16);
    auto const ev = ictestprobe::events();
    EXPECT_LT(ictest::indexOf(ev, "mi_beta:getMap"), ictest::indexOf(ev, "fp_one:OpenFP"));

    // What an interface was given.
    MIRecord const a = mi("mi_alpha");
    EXPECT_EQ(a.arrival, &IST::LoadCallBackMI);
    EXPECT_EQ(a.arrivalContext, control_);
    EXPECT_EQ(a.lookup, &IST::getNodeCallBackMI);
    EXPECT_EQ(a.alert, &IST::AlertCallBackMI);
    EXPECT_EQ(a.alertContext, a.object);

    // What an FP was given: the live interfaces and the library's services.
    FPRecord const f = fp("fp_one");
    ASSERT_TRUE(f.services);
    IC::ICforFP const& s = *f.services;
    EXPECT_EQ(s.getMIs(), IST::mymis);
    EXPECT_EQ(s.getRegFPAlerts(), &IST::regFPAlerts);
    EXPECT_EQ(s.getDeRegFPAlerts(), &IST::deRegFPAlerts);
    EXPECT_EQ(s.getAlertCallBackFP(), &IST::AlertCallBackFP);
    EXPECT_EQ(s.getAssertCallBackFP(), &IST::AssertCallBackFP);
    EXPECT_EQ(s.getInterfaceVersion(), IC::Number(IC::Version2{1, 0}));
    EXPECT_EQ(s.getModuleVersion(), IC::Number(IC::Version2{1, 0}));
    EXPECT_EQ(s.getMapNewFPNode(), &IST::MapNewFPNode);
    EXPECT_EQ(s.getInstrumentationControl(), control_);
    EXPECT_EQ(s.getRegFPsensorAlerts(), &IST::regFPsensorAlerts);
    EXPECT_EQ(s.getDeRegFPsensorAlerts(), &IST::deRegFPsensorAlerts);

    auto const t = ictest::timeline(cap);
    long const entry = ictest::indexOf(t, "InstrumentationControl: entry Open count=1");
    long const mis = ictest::indexOf(t, " MIControl reLoadMIs:");
    long const fps = ictest::indexOf(t, " reLoadFPs:");
    long const exit = ictest::indexOf(t, "InstrumentationControl: Open count=1 exit code=0");
    EXPECT_GE(entry, 0);
    EXPECT_LT(entry, mis);
    EXPECT_LT(mis, fps);
    EXPECT_LT(fps, exit);
    auto const rec = findLog(cap, kLogIC, "InstrumentationControl: Open count=1 exit code=0");
    EXPECT_EQ(rec.level, 3000);
    EXPECT_EQ(rec.file, "InstrumentationControl");
}

TEST_F(Lifecycle, ARepeatedOpenOnlyCounts)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    ASSERT_EQ(open(), 0);
    IC::InstrumentationControl* const first = control_;
    IC::Error* const firstError = error_;
    ictestprobe::reset();

    ictest::LogCapture cap;
    ASSERT_EQ(open(), 0);
    EXPECT_EQ(control_, first);
    EXPECT_EQ(error_, firstError);
    EXPECT_EQ(IST::ICloadCount, 2u);
    auto const logs = ictest::libraryLogs(cap);
    ASSERT_EQ(logs.size(), 1u);
    EXPECT_EQ(logs[0].message, "InstrumentationControl: Open count=2 exit code=0");
    EXPECT_TRUE(ictestprobe::events().empty());

    // One unload of two: everything stays.
    cap.clear();
    Unloadlib();
    EXPECT_EQ(IST::ICloadCount, 1u);
    EXPECT_FALSE(IST::unloaddone);
    EXPECT_EQ(IST::mymis.size(), 1u);
    EXPECT_EQ(IST::myfps.size(), 1u);
    EXPECT_TRUE(endings().empty());
    EXPECT_EQ(countLog(cap, kLogIC, 3000, "InstrumentationControl unload done"), 0u);

    Unloadlib();
    EXPECT_EQ(IST::ICloadCount, 0u);
    EXPECT_TRUE(IST::unloaddone);
    EXPECT_EQ(countLog(cap, kLogIC, 3000, "InstrumentationControl unload done"), 1u);
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    EXPECT_EQ(ictestprobe::count("fp_one:release"), 1u);
}

TEST_F(Lifecycle, BasePathsAreKeptWithASeparatorOnEveryOpen)
{
    tree_.addMI("mi_alpha");
    std::string const base = "/tmp/ictest-base-" + std::to_string(getpid()) + "-" +
                             std::to_string(std::chrono::steady_clock::now().time_since_epoch().count());
    std::size_t const before = IST::icbaselibpath.size();

    ASSERT_EQ(Openlib(&control_, &error_, base + "-a"), 0);
    EXPECT_EQ(IST::icbaselibpath.count(base + "-a/"), 1u);
    EXPECT_EQ(IST::icbaselibpath.count(base + "-a"), 0u);
    // Later opens add theirs too; one that ends with a separator is kept
    // as it is.
    ASSERT_EQ(Openlib(&control_, &error_, base + "-b/"), 0);
    EXPECT_EQ(IST::icbaselibpath.count(base + "-b/"), 1u);
    EXPECT_EQ(IST::icbaselibpath.count(base + "-b//"), 0u);
    ASSERT_EQ(Openlib(&control_, &error_, base + "-a"), 0);
    ASSERT_EQ(Open(&control_, &error_), 0);
    ASSERT_EQ(Openlib(&control_, &error_, ""), 0);
    EXPECT_EQ(IST::icbaselibpath.size(), before + 2);
    // The log directory's trailing separator makes no difference.
    ASSERT_EQ(Openliblog(&control_, &error_, base + "-c", tree_.root()), 0);
    ASSERT_EQ(Openliblog(&control_, &error_, base + "-c", tree_.root() + "/"), 0);
    EXPECT_EQ(IST::icbaselibpath.size(), before + 3);
    EXPECT_EQ(IST::ICloadCount, 7u);

    // Never emptied, not even by the teardown.
    ictest::fullyUnload();
    EXPECT_EQ(IST::icbaselibpath.count(base + "-a/"), 1u);
    EXPECT_EQ(IST::icbaselibpath.count(base + "-c/"), 1u);
}

TEST_F(Lifecycle, OpenliblogLoadsLikeOpen)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    EXPECT_EQ(Openliblog(&control_, &error_, "", tree_.root() + "/no-logs-here"), 0);
    EXPECT_EQ(IST::ICloadCount, 1u);
    EXPECT_TRUE(ictestprobe::findMI("mi_alpha", nullptr));
    EXPECT_TRUE(ictestprobe::findFP("fp_one", nullptr));
    EXPECT_EQ(error_->getStatus(), 0);
}

TEST_F(Lifecycle, WhenNoInterfaceLoadsTheOpenFailsWith15AndUndoesItself)
{
    tree_.addMI("mi_initfails");
    tree_.addFP("fp_one");
    ictest::LogCapture cap;
    EXPECT_EQ(open(), 15);
    EXPECT_EQ(control_, &sentinel_);
    ASSERT_NE(error_, nullptr);
    EXPECT_EQ(error_->getStatus(), 5);
    EXPECT_EQ(error_->getCode(), IC::Number(1u));
    EXPECT_EQ(error_->getText(), "Load Library");
    EXPECT_EQ(IST::ICloadCount, 0u);
    EXPECT_TRUE(IST::unloaddone);
    // The FPs were not even looked at.
    EXPECT_TRUE(ictestprobe::eventsWithPrefix("fp_one:").empty());
    EXPECT_EQ(ictestprobe::liveImages(), 0);
    EXPECT_EQ(countLog(cap, kLogIC, 3000, "InstrumentationControl: Open count=0 exit code=15"), 1u);
    // The unload ran before the exit line.
    auto const t = ictest::timeline(cap);
    EXPECT_LT(ictest::indexOf(t, "InstrumentationControl unload done"),
              ictest::indexOf(t, "InstrumentationControl: Open count=0 exit code=15"));

    // The next open is a first open again.
    IC::Error* const failed = error_;
    ictest::TempTree::remove(tree_.miDir() + "/mi_initfails.so");
    tree_.addMI("mi_alpha");
    ASSERT_EQ(open(), 0);
    EXPECT_NE(error_, failed);
    EXPECT_EQ(IST::ICloadCount, 1u);
    EXPECT_TRUE(ictestprobe::findMI("mi_alpha", nullptr));
    EXPECT_TRUE(ictestprobe::findFP("fp_one", nullptr));
}

TEST_F(Lifecycle, AnEmptyInterfaceDirectoryIsNotAFailure)
{
    tree_.addFP("fp_one");
    EXPECT_EQ(open(), 0);
    EXPECT_TRUE(IST::mymis.empty());
    EXPECT_EQ(IST::myfps.size(), 1u);
}

TEST_F(Lifecycle, WhenEveryFPFailsTheOpenFailsWith31AndUnloadsTheInterfaces)
{
    std::string const alpha = tree_.addMI("mi_alpha");
    tree_.addFP("fp_initfails");
    tree_.addFP("fp_code");
    ictest::LogCapture cap;
    EXPECT_EQ(open(), 31);
    EXPECT_EQ(control_, &sentinel_);
    ASSERT_NE(error_, nullptr);
    EXPECT_EQ(error_->getStatus(), 5);
    EXPECT_EQ(error_->getCode(), IC::Number(1u));
    EXPECT_EQ(error_->getText(), "Load Library");
    EXPECT_EQ(IST::ICloadCount, 0u);
    EXPECT_TRUE(IST::unloaddone);
    EXPECT_EQ(ictestprobe::count("mi_alpha:shutdown"), 1u);
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    EXPECT_FALSE(ictest::isMapped(alpha));
    EXPECT_EQ(ictestprobe::liveImages(), 0);
    EXPECT_TRUE(IST::mymis.empty());
    EXPECT_TRUE(IST::mymilibs.empty());
    EXPECT_EQ(countLog(cap, kLogIC, 3000, "InstrumentationControl: Open count=0 exit code=31"), 1u);

    // Every failed open hands out the same error object.
    IC::Error* const first = error_;
    EXPECT_EQ(open(), 31);
    EXPECT_EQ(error_, first);
}

// ---- unloading ----

TEST_F(Lifecycle, TheLastUnloadEndsFPsThenInterfacesLastLoadedFirst)
{
    tree_.addMI("mi_alpha");
    tree_.addMI("mi_beta");
    tree_.addMI("mi_gamma");
    tree_.addFP("fp_one");
    tree_.addFP("fp_two");
    ASSERT_EQ(open(), 0);
    ictestprobe::reset();

    ictest::LogCapture cap;
    Unloadlib();
    EXPECT_EQ(endings(), (std::vector<std::string>{
                             "fp_two:release", "fp_one:release", "fp_two:image unloaded",
                             "fp_one:image unloaded", "mi_gamma:shutdown", "mi_gamma:release",
                             "mi_beta:shutdown", "mi_beta:release", "mi_alpha:shutdown",
                             "mi_alpha:release", "mi_gamma:image unloaded",
                             "mi_beta:image unloaded", "mi_alpha:image unloaded"}));
    auto const t = ictest::timeline(cap);
    EXPECT_EQ(t.back(), "InstrumentationControl unload done");
    auto const rec = findLog(cap, kLogIC, "InstrumentationControl unload done");
    EXPECT_EQ(rec.level, 3000);
    EXPECT_EQ(rec.function, "doUnload");
    // No loader thread was installed.
    EXPECT_EQ(countLog(cap, kLogIC, 3000, "doUnload: waiting for LoaderThread Termination "), 0u);
    EXPECT_EQ(countLog(cap, kLogIC, 3000, "doUnload: LoaderThread ended "), 0u);

    EXPECT_EQ(IST::ICloadCount, 0u);
    EXPECT_TRUE(IST::unloaddone);
    EXPECT_EQ(IST::lt, nullptr);
    EXPECT_TRUE(IST::mymis.empty());
    EXPECT_TRUE(IST::mymilibs.empty());
    EXPECT_TRUE(IST::myfps.empty());
    EXPECT_TRUE(IST::myfplibs.empty());
    EXPECT_EQ(ictestprobe::liveImages(), 0);
}

TEST_F(Lifecycle, AnUnloadAfterTheTeardownDoesNothing)
{
    tree_.addMI("mi_alpha");
    ASSERT_EQ(open(), 0);
    Unloadlib();
    ASSERT_TRUE(IST::unloaddone);
    unsigned short const counter = IST::mymifpctr;
    ictestprobe::reset();
    ictest::LogCapture cap;
    Unloadlib();
    EXPECT_TRUE(ictest::libraryLogs(cap).empty());
    EXPECT_TRUE(ictestprobe::events().empty());
    EXPECT_EQ(IST::ICloadCount, 0u);
    EXPECT_TRUE(IST::unloaddone);
    EXPECT_EQ(IST::mymifpctr, counter);
}

TEST_F(Lifecycle, NodesOutliveTheTeardownUntilTheNextFirstOpen)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    ASSERT_EQ(open(), 0);
    IC::InstrumentationControl* const ic = control_;
    MIRecord const a = mi("mi_alpha");
    IC::Node* const cpu = a.nodes[2];
    std::string const path = ic->getNodeUniqueId(cpu);
    Unloadlib();
    ASSERT_TRUE(IST::unloaddone);

    IC::Node* n = nullptr;
    EXPECT_EQ(ic->getNode(a.base | 3, &n).getStatus(), 0);
    EXPECT_EQ(n, cpu);
    std::vector<IC::Node*> listed;
    ic->getMap(listed);
    EXPECT_EQ(listed.size(), 2u); // fp_one's
    // The counter goes on across the teardown.
    unsigned short const counter = IST::mymifpctr;

    ASSERT_EQ(open(), 0);
    n = nullptr;
    EXPECT_EQ(ic->getNode(a.base | 3, &n).getStatus(), 1);
    EXPECT_EQ(n, nullptr);
    MIRecord const again = mi("mi_alpha");
    EXPECT_EQ(again.base, static_cast<unsigned int>(counter) << 16);
    // The same node path names the new instance's node.
    EXPECT_EQ(ic->getNode(path, &n).getStatus(), 0);
    EXPECT_EQ(n, again.nodes[2]);
}

TEST_F(Lifecycle, TheLastUnloadDeletesEveryRegistration)
{
    tree_.addMI("mi_alpha");
    ASSERT_EQ(open(), 0);
    int ctx = 0;
    ASSERT_EQ(control_->registerForAlerts(&ictest::recAlert, IC::Node::CPU, &ctx).getStatus(), 0);
    ASSERT_EQ(IST::regFPsensorAlerts(&ictest::recAlert, IC::Node::Fan, &sentinel_).getStatus(), 0);
    ASSERT_EQ(open(), 0);
    Unloadlib();
    EXPECT_EQ(IST::callbacks.size(), 2u);
    Unloadlib();
    EXPECT_TRUE(IST::callbacks.empty());
    EXPECT_TRUE(IST::sensortypeTOalertregister.empty());
    EXPECT_TRUE(IST::classtypeTOalertregister.empty());
    EXPECT_TRUE(IST::nodepathTOalertregister.empty());
}

// A process that never opened the library: its first unload tears down
// (nothing), and the open after it is a first open. Runs in a child process
// so that the library's state is really untouched; the exit code tells which
// expectation failed.
int unloadBeforeAnyOpen()
{
    ictest::TempTree tree;
    ictest::EnvGuard mi("IC_MI_DIR", tree.miDir());
    ictest::EnvGuard fp("IC_FP_DIR", tree.fpDir());
    tree.addMI("mi_alpha");
    int code = 0;
    {
        ictest::LogCapture cap;
        if (IST::ICloadCount != 0 || IST::unloaddone)
            code = 10;
        Unloadlib();
        if (code == 0 && countLog(cap, kLogIC, 3000, "InstrumentationControl unload done") != 1)
            code = 11;
        if (code == 0 && (!IST::unloaddone || IST::ICloadCount != 0))
            code = 12;
        IC::InstrumentationControl* c = nullptr;
        IC::Error* e = nullptr;
        if (code == 0 && Open(&c, &e) != 0)
            code = 13;
        if (code == 0 && (IST::ICloadCount != 1 || IST::unloaddone ||
                          !ictestprobe::findMI("mi_alpha", nullptr)))
            code = 14;
        if (code == 0 &&
            countLog(cap, kLogIC, 3000, "InstrumentationControl: entry Open count=1") != 1)
            code = 15;
        Unloadlib();
    }
    return code;
}

TEST(LifecycleFresh, AnUnloadBeforeAnyOpenTearsDownAndTheNextOpenIsAFirstOpen)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(std::exit(unloadBeforeAnyOpen()), testing::ExitedWithCode(0), "");
}

// ---- a client that loads the library itself ----

TEST_F(Lifecycle, AClientCanFindTheEntryPointsAndUseThem)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    void* lib = dlopen(IC_LIBRARY_PATH, RTLD_NOW | RTLD_LOCAL);
    ASSERT_NE(lib, nullptr) << dlerror();
    using OpenFn = unsigned char (*)(IC::InstrumentationControl**, IC::Error**);
    using OpenlibFn = unsigned char (*)(IC::InstrumentationControl**, IC::Error**, std::string);
    using OpenliblogFn =
        unsigned char (*)(IC::InstrumentationControl**, IC::Error**, std::string, std::string);
    using UnloadFn = void (*)();
    auto const open = reinterpret_cast<OpenFn>(dlsym(lib, "Open"));
    auto const openlib = reinterpret_cast<OpenlibFn>(dlsym(lib, "Openlib"));
    auto const openliblog = reinterpret_cast<OpenliblogFn>(dlsym(lib, "Openliblog"));
    auto const unload = reinterpret_cast<UnloadFn>(dlsym(lib, "Unloadlib"));
    ASSERT_NE(open, nullptr);
    ASSERT_NE(openlib, nullptr);
    ASSERT_NE(openliblog, nullptr);
    ASSERT_NE(unload, nullptr);

    IC::InstrumentationControl* ic = nullptr;
    IC::Error* err = nullptr;
    ASSERT_EQ(open(&ic, &err), 0);
    ASSERT_NE(ic, nullptr);
    EXPECT_EQ(err->getStatus(), 0);
    std::vector<IC::Node*> nodes;
    EXPECT_EQ(ic->getMap(nodes).getStatus(), 0);
    EXPECT_EQ(nodes.size(), 2u);
    EXPECT_EQ(openlib(&ic, &err, ""), 0);
    EXPECT_EQ(openliblog(&ic, &err, "", ""), 0);
    EXPECT_EQ(IST::ICloadCount, 3u);
    unload();
    unload();
    unload();
    EXPECT_EQ(IST::ICloadCount, 0u);
    EXPECT_TRUE(IST::unloaddone);
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    dlclose(lib);
}

// ---- the facade's node queries ----

class Queries : public Lifecycle {
protected:
    void SetUp() override
    {
        Lifecycle::SetUp();
        tree_.addMI("mi_alpha");
        tree_.addFP("fp_one");
        ASSERT_EQ(open(), 0);
        ic_ = control_;
        alpha_ = mi("mi_alpha");
        ASSERT_EQ(alpha_.nodes.size(), 4u);
    }
    IC::InstrumentationControl* ic_ = nullptr;
    MIRecord alpha_;
};

TEST_F(Queries, ByIdAndByPath)
{
    IC::Node* const cpu = alpha_.nodes[2];
    unsigned int const id = alpha_.base | 3;
    {
        ictest::LogCapture cap;
        IC::Node* n = nullptr;
        EXPECT_EQ(ic_->getNode(id, &n).getStatus(), 0);
        EXPECT_EQ(n, cpu);
        expectQueryLog(cap, "getNode", "getNode: nodeId " + std::to_string(id));
    }
    {
        IC::Node* n = alpha_.nodes[0];
        EXPECT_EQ(ic_->getNode(0xFFFFFFFFu, &n).getStatus(), 1);
        EXPECT_EQ(n, alpha_.nodes[0]);
    }
    std::string path;
    {
        ictest::LogCapture cap;
        path = ic_->getNodeUniqueId(cpu);
        expectQueryLog(cap, "getNodeUniqueId", "getNodeUniqueId:");
    }
    // CPU 1 in Chassis 0 under ROOT 0.
    EXPECT_EQ(path, std::string("\x2f\x50\x1f\x20\x1f\x5c"));
    {
        ictest::LogCapture cap;
        IC::Node* n = nullptr;
        EXPECT_EQ(ic_->getNode(path, &n).getStatus(), 0);
        EXPECT_EQ(n, cpu);
        expectQueryLog(cap, "getNode", "getNode: path 2f501f201f5c");
    }
    IC::Node* n = nullptr;
    EXPECT_EQ(ic_->getNode(std::string("\x2f\x50"), &n).getStatus(), 1);
    EXPECT_EQ(n, nullptr);
}

TEST_F(Queries, PrintablePaths)
{
    std::string const path("\x2f\x50\x1f\x20\x1f\x5c");
    {
        ictest::LogCapture cap;
        EXPECT_EQ(ic_->pathToPrintablePath(path), "2f501f201f5c");
        expectQueryLog(cap, "pathToPrintablePath", "pathToPrintablePath: 2f501f201f5c");
    }
    {
        ictest::LogCapture cap;
        EXPECT_EQ(ic_->printablePathToPath("2F501F201F5C"), path);
        expectQueryLog(cap, "printablePathToPath", "printabePathToPath: 2F501F201F5C");
    }
    EXPECT_EQ(ic_->printablePathToPath("1f5c"), std::string("\x1f\x5c"));
    EXPECT_EQ(ic_->printablePathToPath(""), "");
    EXPECT_THROW(ic_->printablePathToPath("0"), std::invalid_argument);
    EXPECT_THROW(ic_->printablePathToPath("1g"), std::invalid_argument);
}

TEST_F(Queries, TheMapHoldsTheFPsNodesNotTheInterfaces)
{
    FPRecord const one = fp("fp_one");
    ASSERT_EQ(one.nodes.size(), 2u);
    {
        ictest::LogCapture cap;
        std::vector<IC::Node*> nodes{alpha_.nodes[0]};
        EXPECT_EQ(ic_->getMap(nodes).getStatus(), 0);
        // By sensor type: Fan (20) before Power Supply (25).
        EXPECT_EQ(nodes, one.nodes);
        expectQueryLog(cap, "getMap", "getMap: all");
    }
    {
        ictest::LogCapture cap;
        std::vector<IC::Node*> nodes{alpha_.nodes[0]};
        EXPECT_EQ(ic_->getMap(nodes, IC::Node::PowerSupply).getStatus(), 0);
        EXPECT_EQ(nodes, std::vector<IC::Node*>{one.nodes[1]});
        expectQueryLog(cap, "getMap", "getMap: sensor 25");
    }
    std::vector<IC::Node*> nodes{alpha_.nodes[0]};
    EXPECT_EQ(ic_->getMap(nodes, 74).getStatus(), 0);
    EXPECT_TRUE(nodes.empty());
    EXPECT_EQ(ic_->getMap(nodes, IC::Node::CPU).getStatus(), 0);
    EXPECT_TRUE(nodes.empty());
}

TEST_F(Queries, Hierarchies)
{
    IC::Node* const cpu = alpha_.nodes[2];
    IC::Node* const temp = alpha_.nodes[3];
    {
        ictest::LogCapture cap;
        EXPECT_EQ(ic_->getNodeHierarchy(cpu), "ROOT:00000000->Chassis:00000000->CPU:00000001");
        expectQueryLog(cap, "getNodeHierarchy", "getNodeHierarchy: ");
    }
    {
        ictest::LogCapture cap;
        EXPECT_EQ(ic_->getNodeHierarchy(temp, IC::Node::Chassis),
                  "Chassis:00000000->CPU:00000001->Temperature Sensor:0000000d");
        expectQueryLog(cap, "getNodeHierarchy", "getNodeHierarchy: parent sensor 1");
    }
    {
        ictest::LogCapture cap;
        EXPECT_EQ(ic_->getNodeHierarchy(nullptr), "");
        expectQueryLog(cap, "getNodeHierarchy", "getNodeHierarchy: ");
    }
}

TEST_F(Queries, AnInterfacesLookUpReportsAMiss)
{
    ASSERT_EQ(alpha_.lookup, &IST::getNodeCallBackMI);
    {
        ictest::LogCapture cap;
        IC::Node* n = nullptr;
        IC::Error const e = alpha_.lookup(ic_->getNodeUniqueId(alpha_.nodes[1]), &n);
        EXPECT_EQ(e.getStatus(), 0);
        EXPECT_EQ(n, alpha_.nodes[1]);
        auto const logs = ictest::logsOf(cap, kLogIC);
        // getNodeUniqueId's line, then the look-up's own.
        ASSERT_EQ(logs.size(), 2u);
        EXPECT_EQ(logs[1].message, "getNodeCallBack:");
        EXPECT_EQ(logs[1].function, "getNodeCallBackMI");
        EXPECT_EQ(logs[1].level, 3000);
    }
    ictest::LogCapture cap;
    IC::Node* n = alpha_.nodes[0];
    IC::Error const e = alpha_.lookup(std::string("\x7f\x7f"), &n);
    EXPECT_EQ(e.getStatus(), 1);
    EXPECT_EQ(n, alpha_.nodes[0]);
    auto const logs = ictest::logsOf(cap, kLogIC);
    ASSERT_EQ(logs.size(), 2u);
    EXPECT_EQ(logs[0].message, "getNodeCallBack:");
    EXPECT_EQ(logs[1].message, "getNodeCallBackMI: failure: " + errText(e));
    EXPECT_EQ(logs[1].function, "diagError");
    EXPECT_EQ(logs[1].level, 6000);
    EXPECT_EQ(logs[1].file, "InstrumentationControl");
}

TEST_F(Queries, AnFPAnnouncesItsOwnNodesOnce)
{
    FPRecord const one = fp("fp_one");
    EXPECT_EQ(ictestprobe::count("fp_one:announced status=0"), 2u);
    IC::NodeAnnouncement const announce = one.services->getMapNewFPNode();
    IC::Node* const extra = ictestprobe::makeNode(IC::Node::Fan, 99, one.base | 0x50, 0, "extra");

    ictest::LogCapture cap;
    EXPECT_EQ(announce(extra).getStatus(), 0);
    std::vector<IC::Node*> nodes;
    ic_->getMap(nodes, IC::Node::Fan);
    EXPECT_EQ(nodes, (std::vector<IC::Node*>{one.nodes[0], extra}));
    // Again, and a second node under the same path: neither is added.
    EXPECT_EQ(announce(extra).getStatus(), 0);
    IC::Node* const twin = ictestprobe::makeNode(IC::Node::Fan, 99, one.base | 0x51, 0, "twin");
    EXPECT_EQ(announce(twin).getStatus(), 0);
    ic_->getMap(nodes, IC::Node::Fan);
    EXPECT_EQ(nodes.size(), 2u);
    IC::Node* n = nullptr;
    EXPECT_EQ(IST::nodestore.getNode(one.base | 0x51, &n).getStatus(), 1);
    // The announcement itself writes nothing (the getMap calls above do).
    for (auto const& r : ictest::logsOf(cap, kLogIC))
        EXPECT_EQ(r.function, "getMap") << r.message;
}

// ---- node arrival from an interface ----

// A node that does not take the path the store gives it.
class PathlessNode : public IC::Node {
public:
    using IC::Node::Node;
    IC::Error setPath(std::string const&) override
    {
        return IC::Error(0, IC::Number(IC::Number::Generic), "");
    }
};

TEST_F(Queries, AnArrivingNodeIsStoredAndAnnouncedOnce)
{
    ASSERT_EQ(alpha_.arrival, &IST::LoadCallBackMI);
    int observer = 0;
    ASSERT_EQ(IST::regFPsensorAlerts(&ictest::recAlert, IC::Node::Fan, &observer).getStatus(), 0);
    IC::Node* const fan = ictestprobe::makeNode(IC::Node::Fan, 7, alpha_.base | 0x40,
                                                alpha_.base | 2, "extra fan");
    {
        ictest::LogCapture cap;
        IC::Error const e = alpha_.arrival(fan, alpha_.arrivalContext);
        EXPECT_EQ(e.getStatus(), 0);
        auto const first = findLog(cap, kLogIC,
                                   "LoadCallBack: NodePtr=" + ictest::ptrText(fan) +
                                       " desc=extra fan index=7");
        EXPECT_EQ(first.level, 3000);
        EXPECT_EQ(first.function, "LoadCallBackMI");
        bool sent = false;
        for (auto const& r : ictest::logsOf(cap, kLogIC))
            if (ictest::startsWith(r.message, "LoadCallbackMI: sent alert= ")) {
                sent = true;
                EXPECT_EQ(r.level, 3000);
                EXPECT_NE(r.message.find("extra fan"), std::string::npos) << r.message;
            }
        EXPECT_TRUE(sent);
    }
    IC::Node* n = nullptr;
    EXPECT_EQ(ic_->getNode(alpha_.base | 0x40, &n).getStatus(), 0);
    EXPECT_EQ(n, fan);
    std::string const path = ic_->getNodeUniqueId(fan);
    EXPECT_EQ(ic_->getNodeHierarchy(fan), "ROOT:00000000->Chassis:00000000->Fan:00000007");

    auto calls = ictest::Recorder::get().calls();
    ASSERT_EQ(calls.size(), 1u);
    EXPECT_EQ(calls[0].context, &observer);
    ASSERT_EQ(calls[0].alerts.size(), 1u);
    IC::Alert const& a = calls[0].alerts[0];
    EXPECT_EQ(a.getClass(), IC::Alert::NodeArrival);
    EXPECT_EQ(a.getSeverity(), 0);
    EXPECT_EQ(a.getStatus(), 1u);
    EXPECT_EQ(a.getMessage(), "extra fan");
    EXPECT_EQ(a.getNodePaths(), std::vector<std::string>{path});

    // Reported again: known, no alert.
    {
        ictest::LogCapture cap;
        EXPECT_EQ(alpha_.arrival(fan, alpha_.arrivalContext).getStatus(), 6);
        EXPECT_EQ(countLog(cap, kLogIC, 3000,
                           "LoadCallBack: NodeStore:addMINode duplicate Node =extra fan index=7"),
                  1u);
    }
    EXPECT_EQ(ictest::Recorder::get().calls().size(), 1u);

    // A node without a path is stored, but there is nothing to announce.
    static PathlessNode pathless(IC::Node::Fan, 8, alpha_.base | 0x41, alpha_.base | 2, "silent fan");
    {
        ictest::LogCapture cap;
        EXPECT_EQ(alpha_.arrival(&pathless, alpha_.arrivalContext).getStatus(), 0);
        EXPECT_EQ(countLog(cap, kLogIC, 6000,
                           "LoadCallBackMI: Node " + ictest::ptrText(&pathless) +
                               " path is empty: ''."),
                  1u);
    }
    EXPECT_EQ(ic_->getNode(alpha_.base | 0x41, &n).getStatus(), 0);
    EXPECT_EQ(n, &pathless);
    EXPECT_EQ(ictest::Recorder::get().calls().size(), 1u);
}

// ---- alerts through an FP to a client ----

class EndToEnd : public Lifecycle {};

TEST_F(EndToEnd, AnInterfacesAlertReachesAClientThroughAnFP)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_relay");
    ASSERT_EQ(open(), 0);
    EXPECT_EQ(ictestprobe::count("fp_relay:registered sensor=4 status=0"), 1u);
    int ctx = 0;
    ASSERT_EQ(control_->registerForAlerts(&clientCallback, IC::Node::CPU, &ctx).getStatus(), 0);

    MIRecord const a = mi("mi_alpha");
    std::string const cpu = control_->getNodeUniqueId(a.nodes[2]);
    std::vector<IC::Alert> batch;
    batch.emplace_back(2, static_cast<IC::Alert::ClassType>(2), std::vector<std::string>{cpu}, 2u,
                       "overheat");
    a.alert(batch, a.alertContext);

    auto const received = ictestprobe::relayReceived();
    ASSERT_EQ(received.size(), 1u);
    EXPECT_EQ(received[0].getMessage(), "overheat");
    auto const calls = clientCalls();
    ASSERT_EQ(calls.size(), 1u);
    EXPECT_EQ(calls[0].context, &ctx);
    ASSERT_EQ(calls[0].alerts.size(), 1u);
    EXPECT_EQ(calls[0].alerts[0].getMessage(), "relayed overheat");
    EXPECT_EQ(calls[0].alerts[0].getNodePaths(), std::vector<std::string>{cpu});
    EXPECT_EQ(calls[0].alerts[0].getStatus(), 2u);
    std::vector<IC::Alert> asserted;
    control_->getAssertedAlerts(asserted);
    ASSERT_EQ(asserted.size(), 1u);
    EXPECT_EQ(asserted[0].getMessage(), "relayed overheat");
}

TEST_F(EndToEnd, AnInterfacesOwnThreadIsHeardAndStoppedBeforeRelease)
{
    tree_.addMI("mi_thread");
    tree_.addFP("fp_relay");
    ASSERT_EQ(open(), 0);
    int ctx = 0;
    ASSERT_EQ(control_->registerForAlerts(&clientCallback, IC::Node::Fan, &ctx).getStatus(), 0);
    ictestprobe::ThreadPlan plan;
    plan.nodes = true;
    plan.alerts = true;
    plan.periodMs = 10;
    ictestprobe::setThreadPlan(plan);

    bool heard = false;
    for (int i = 0; i < 500 && !heard; ++i) {
        for (auto const& c : clientCalls())
            for (auto const& al : c.alerts)
                if (al.getMessage() == "relayed mi_thread thread alert")
                    heard = true;
        if (!heard)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    EXPECT_TRUE(heard);
    EXPECT_TRUE(mi("mi_thread").threadRunning);

    Unloadlib();
    auto const ev = ictestprobe::events();
    long const down = ictest::indexOf(ev, "mi_thread:shutdown");
    long const ended = ictest::indexOf(ev, "mi_thread:thread ended");
    long const released = ictest::indexOf(ev, "mi_thread:release");
    EXPECT_GE(down, 0);
    EXPECT_LT(down, ended);
    EXPECT_LT(ended, released);
    // The FP went first.
    EXPECT_LT(ictest::indexOf(ev, "fp_relay:release"), down);
    EXPECT_EQ(ictestprobe::liveImages(), 0);
}

// ---- timed reload ----

TEST_F(Lifecycle, ATimedReloadOfAClosedLibraryOnlyLogs)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    {
        ictest::LogCapture cap;
        IST::TimedReload();
        auto const logs = ictest::libraryLogs(cap);
        ASSERT_EQ(logs.size(), 1u);
        EXPECT_EQ(logs[0].message, "Instrumentation Control Timed Reload");
        EXPECT_EQ(logs[0].level, 3000);
        EXPECT_EQ(logs[0].function, "TimedReload");
        EXPECT_EQ(logs[0].logger, kLogIC);
    }
    EXPECT_TRUE(ictestprobe::events().empty());

    // Also after the last unload.
    ASSERT_EQ(open(), 0);
    Unloadlib();
    ictestprobe::reset();
    ictest::LogCapture cap;
    IST::TimedReload();
    EXPECT_EQ(ictest::libraryLogs(cap).size(), 1u);
    EXPECT_TRUE(ictestprobe::events().empty());
    EXPECT_TRUE(IST::mymis.empty());
}

TEST_F(Lifecycle, ATimedReloadFollowsTheDirectories)
{
    std::string const alpha = tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    ASSERT_EQ(open(), 0);

    // Nothing changed.
    {
        ictest::LogCapture cap;
        IST::TimedReload();
        EXPECT_EQ(countLog(cap, kLogMI, 3000, "MIControl reLoadMis End"), 1u);
        EXPECT_EQ(countLog(cap, kLogFP, 3000, " reloadFPs: Done - no additions"), 1u);
    }
    // An interface added.
    unsigned short c = IST::mymifpctr;
    std::string const beta = tree_.addMI("mi_beta");
    IST::TimedReload();
    EXPECT_EQ(mi("mi_beta").base, static_cast<unsigned int>(c) << 16);
    EXPECT_EQ(IST::mymis.size(), 2u);
    EXPECT_EQ(ictestprobe::count("fp_one:updatedMis added=1 removed=0"), 1u);
    EXPECT_EQ(fp("fp_one").lastAdded, std::vector<IC::ManagementInterface*>{IST::mymis[1]});

    // One removed: released without shutdown, the FP told.
    void const* const oldAlpha = mi("mi_alpha").object;
    ictest::TempTree::remove(alpha);
    IST::TimedReload();
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    EXPECT_EQ(ictestprobe::count("mi_alpha:shutdown"), 0u);
    EXPECT_FALSE(ictest::isMapped(alpha));
    FPRecord f = fp("fp_one");
    EXPECT_TRUE(f.lastAdded.empty());
    ASSERT_EQ(f.lastRemoved.size(), 1u);
    EXPECT_EQ(static_cast<void const*>(f.lastRemoved[0]), oldAlpha);

    // One renamed: a removal and an addition with a new number.
    c = IST::mymifpctr;
    ictest::TempTree::rename(beta, tree_.miDir() + "/zeta.so");
    IST::TimedReload();
    EXPECT_EQ(ictestprobe::count("mi_beta:release"), 1u);
    MIRecord const b = mi("mi_beta");
    std::size_t betas = 0;
    for (auto const& r : ictestprobe::mis())
        if (r.name == "mi_beta")
            ++betas;
    EXPECT_EQ(betas, 2u);
    EXPECT_EQ(b.base, static_cast<unsigned int>(c) << 16);
    ASSERT_EQ(IST::mymilibs.size(), 1u);
    EXPECT_EQ(IST::mymilibs[0].name, "zeta.so");
    EXPECT_EQ(ictestprobe::count("fp_one:updatedMis added=1 removed=1"), 1u);

    // An FP added: it sees the interfaces of now.
    c = IST::mymifpctr;
    tree_.addFP("fp_two");
    IST::TimedReload();
    FPRecord const two = fp("fp_two");
    EXPECT_EQ(two.base, static_cast<unsigned int>(c) << 16);
    EXPECT_EQ(two.services->getMIs(), IST::mymis);
    EXPECT_EQ(IST::myfps.size(), 2u);
}

TEST_F(Lifecycle, ATimedReloadStillReloadsFPsWhenTheInterfacesFail)
{
    std::string const alpha = tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    ASSERT_EQ(open(), 0);
    ictest::TempTree::remove(alpha);
    tree_.addMI("mi_code");
    tree_.addFP("fp_two");
    ictest::LogCapture cap;
    IST::TimedReload();
    // The interface reload ended with no interface at all ...
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    EXPECT_TRUE(IST::mymis.empty());
    EXPECT_EQ(countLog(cap, kLogMI, 6000, "myloadMIs count of MIs that did not load 1"), 1u);
    EXPECT_TRUE(ictestprobe::eventsWithPrefix("fp_one:updatedMis").empty());
    // ... and the FP reload ran all the same; the library stays open.
    EXPECT_TRUE(ictestprobe::findFP("fp_two", nullptr));
    EXPECT_EQ(IST::myfps.size(), 2u);
    EXPECT_EQ(IST::ICloadCount, 1u);
    EXPECT_FALSE(IST::unloaddone);
}

TEST_F(Lifecycle, ATimedReloadWaitsForTheLoadLock)
{
    ictest::Watchdog dog(30, "timed reload against a held load lock");
    tree_.addMI("mi_alpha");
    ASSERT_EQ(open(), 0);
    tree_.addMI("mi_beta");
    IST::loadlock.lock();
    std::thread reload([] { IST::TimedReload(); });
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    // Not even scanned while another holds the lock.
    EXPECT_TRUE(ictestprobe::eventsWithPrefix("mi_beta:").empty());
    IST::loadlock.unlock();
    reload.join();
    EXPECT_TRUE(ictestprobe::findMI("mi_beta", nullptr));
    EXPECT_EQ(IST::mymis.size(), 2u);
}

TEST_F(Lifecycle, NodesAnFPHandsOverOnAReloadAreAnnouncedToFPRegistrations)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_two");
    ASSERT_EQ(open(), 0);
    FPRecord const two = fp("fp_two");
    ASSERT_EQ(two.nodes.size(), 2u);
    int observer = 0;
    ASSERT_EQ(IST::regFPsensorAlerts(&ictest::recAlert, IC::Node::Fan, &observer).getStatus(), 0);
    ASSERT_EQ(IST::regFPsensorAlerts(&ictest::recAlert, IC::Node::PowerSupply, &observer).getStatus(),
              0);
    // Not handed over yet: fp_two only gives its nodes when asked.
    std::vector<IC::Node*> nodes;
    control_->getMap(nodes);
    EXPECT_TRUE(nodes.empty());

    tree_.addMI("mi_beta");
    IST::TimedReload();
    control_->getMap(nodes);
    EXPECT_EQ(nodes, two.nodes);
    auto const calls = ictest::Recorder::get().calls();
    ASSERT_EQ(calls.size(), 1u);
    EXPECT_EQ(calls[0].context, &observer);
    ASSERT_EQ(calls[0].alerts.size(), 2u);
    for (std::size_t i = 0; i < 2; ++i) {
        IC::Alert const& a = calls[0].alerts[i];
        EXPECT_EQ(a.getSeverity(), 3);
        EXPECT_EQ(a.getClass(), IC::Alert::NodeArrival);
        EXPECT_EQ(a.getStatus(), two.nodes[i]->getNodeNumber());
        EXPECT_EQ(a.getMessage(), "MIControl");
        EXPECT_EQ(a.getNodePaths(), std::vector<std::string>{control_->getNodeUniqueId(two.nodes[i])});
    }
    // A client registration does not hear an interface's batch.
    EXPECT_TRUE(clientCalls().empty());
}

} // namespace
