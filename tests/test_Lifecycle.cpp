// The library's life through its entry points, with real plug-ins: open and
// load codes, repeated opens, unload order, timed reload, the node queries of
// the facade and the node entries handed to plug-ins.
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include "PluginTest.h"

#include <dlfcn.h>
#include <unistd.h>

namespace {

using ictest::errText;
using ictest::findLog;
using ictest::fp;
using ictest::kLogFP;
using ictest::kLogIC;
using ictest::kLogMI;
using ictest::mi;
using ictestprobe::FPRecord;
using ictestprobe::MIRecord;
namespace IST = IC::InstCtrl;
using Events = std::vector<std::string>;
using Nodes = std::vector<IC::Node*>;

// The probe's events that show the end of plug-ins and their libraries.
Events endings()
{
    Events out;
    for (auto const& e : ictestprobe::events())
        if (e.find(":release") != std::string::npos || e.find(":shutdown") != std::string::npos ||
            e.find(":image unloaded") != std::string::npos)
            out.push_back(e);
    return out;
}

class Lifecycle : public ictest::PluginTest {
protected:
    unsigned char open()
    {
        control_ = &sentinel_;
        error_ = nullptr;
        return Open(&control_, &error_);
    }

    // A failed first open: its code, the shared load error, nothing handed
    // out and everything undone.
    void expectFailedOpen(unsigned char code)
    {
        ictest::LogCapture cap;
        EXPECT_EQ(open(), code);
        EXPECT_EQ(control_, &sentinel_);
        ASSERT_NE(error_, nullptr);
        ictest::expectError(*error_, 5, IC::Number(1u), "Load Library");
        EXPECT_EQ(IST::ICloadCount, 0u);
        EXPECT_TRUE(IST::unloaddone);
        EXPECT_EQ(ictestprobe::liveImages(), 0);
        // The unload ran before the exit line.
        std::string const exit = "InstrumentationControl: Open count=0 exit code=" + std::to_string(code);
        EXPECT_EQ(cap.count(kLogIC, 3000, exit), 1u);
        ictest::expectInOrder(ictest::timeline(cap), {"InstrumentationControl unload done", exit});
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
    ictest::expectError(*error_, 0, IC::Number(0u));
    EXPECT_EQ(IST::ICloadCount, 1u);
    EXPECT_FALSE(IST::unloaddone);
    EXPECT_EQ(IST::mymilibs.size() + IST::mymis.size() + IST::myfplibs.size() + IST::myfps.size(), 8u);
    EXPECT_EQ(IST::mymifpctr, c + 4);

    // Interfaces first, in name order, then the FPs.
    EXPECT_EQ(ictestprobe::eventsWithPrefix("mi_alpha:Initialize"),
              Events{"mi_alpha:Initialize base=" + std::to_string(c << 16) + " iv=1.0 mv=1.0"});
    EXPECT_EQ(mi("mi_beta").base, (c + 1) << 16);
    EXPECT_EQ(fp("fp_one").base, (c + 2) << 16);
    EXPECT_EQ(fp("fp_two").base, (c + 3) << 16);
    ictest::expectInOrder(ictestprobe::events(), {"mi_beta:getMap", "fp_one:OpenFP"});

    // What an interface was given.
    MIRecord const a = mi("mi_alpha");
    EXPECT_TRUE(a.arrival == &IST::LoadCallBackMI && a.arrivalContext == control_);
    EXPECT_EQ(a.lookup, &IST::getNodeCallBackMI);
    EXPECT_TRUE(a.alert == &IST::AlertCallBackMI && a.alertContext == a.object);

    // What an FP was given: the live interfaces and the library's services.
    FPRecord const f = fp("fp_one");
    ASSERT_TRUE(f.services);
    IC::ICforFP const& s = *f.services;
    EXPECT_EQ(s.getMIs(), IST::mymis);
    EXPECT_TRUE(s.getRegFPAlerts() == &IST::regFPAlerts && s.getDeRegFPAlerts() == &IST::deRegFPAlerts);
    EXPECT_TRUE(s.getAlertCallBackFP() == &IST::AlertCallBackFP && s.getAssertCallBackFP() == &IST::AssertCallBackFP);
    EXPECT_EQ(s.getInterfaceVersion(), IC::Number(IC::Version2{1, 0}));
    EXPECT_EQ(s.getModuleVersion(), IC::Number(IC::Version2{1, 0}));
    EXPECT_TRUE(s.getMapNewFPNode() == &IST::MapNewFPNode && s.getInstrumentationControl() == control_);
    EXPECT_TRUE(s.getRegFPsensorAlerts() == &IST::regFPsensorAlerts &&
                s.getDeRegFPsensorAlerts() == &IST::deRegFPsensorAlerts);

    ictest::expectInOrder(ictest::timeline(cap),
                          {"InstrumentationControl: entry Open count=1", " MIControl reLoadMIs:",
                           " reLoadFPs:", "InstrumentationControl: Open count=1 exit code=0"});
    ictest::expectEvent(cap, {kLogIC, "InstrumentationControl"},
                        "InstrumentationControl: Open count=1 exit code=0", 3000, "openLib");
}

TEST_F(Lifecycle, ARepeatedOpenOnlyCountsAndOnlyTheLastUnloadTearsDown)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    ASSERT_EQ(open(), 0);
    IC::InstrumentationControl* const first = control_;
    IC::Error* const firstError = error_;
    int ctx = 0;
    ASSERT_EQ(control_->registerForAlerts(&ictest::recAlert, IC::Node::CPU, &ctx).getStatus(), 0);
    ASSERT_EQ(IST::regFPsensorAlerts(&ictest::recAlert, IC::Node::Fan, &sentinel_).getStatus(), 0);
    ictestprobe::reset();

    ictest::LogCapture cap;
    ASSERT_EQ(open(), 0);
    EXPECT_TRUE(control_ == first && error_ == firstError);
    EXPECT_EQ(IST::ICloadCount, 2u);
    EXPECT_EQ(cap.messages(kLogIC), Events{"InstrumentationControl: Open count=2 exit code=0"});
    EXPECT_EQ(ictest::libraryLogs(cap).size(), 1u);
    EXPECT_TRUE(ictestprobe::events().empty());
    // One unload of two: everything stays.
    Unloadlib();
    EXPECT_TRUE(IST::ICloadCount == 1u && !IST::unloaddone);
    EXPECT_EQ(IST::mymis.size() + IST::myfps.size() + IST::callbacks.size(), 4u);
    EXPECT_TRUE(endings().empty());
    EXPECT_EQ(cap.count(kLogIC, 3000, "InstrumentationControl unload done"), 0u);
    Unloadlib();
    EXPECT_TRUE(IST::ICloadCount == 0u && IST::unloaddone);
    EXPECT_EQ(cap.count(kLogIC, 3000, "InstrumentationControl unload done"), 1u);
    EXPECT_EQ(ictestprobe::count("mi_alpha:release") + ictestprobe::count("fp_one:release"), 2u);
    // The last unload deletes every registration.
    EXPECT_TRUE(IST::callbacks.empty() && IST::sensortypeTOalertregister.empty() &&
                IST::classtypeTOalertregister.empty() && IST::nodepathTOalertregister.empty());
    // An unload after the teardown does nothing.
    unsigned short const counter = IST::mymifpctr;
    ictestprobe::reset();
    cap.clear();
    Unloadlib();
    EXPECT_TRUE(ictest::libraryLogs(cap).empty() && ictestprobe::events().empty());
    EXPECT_TRUE(IST::ICloadCount == 0u && IST::unloaddone && IST::mymifpctr == counter);
}

TEST_F(Lifecycle, BasePathsAreKeptWithASeparatorOnEveryOpenAndEveryEntryLoads)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    std::string const base = "/tmp/ictest-base-" + std::to_string(getpid()) + "-" +
                             std::to_string(std::chrono::steady_clock::now().time_since_epoch().count());
    std::size_t const before = IST::icbaselibpath.size();
    ASSERT_EQ(Openliblog(&control_, &error_, base + "-a", tree_.path("no-logs-here")), 0);
    EXPECT_TRUE(ictestprobe::findMI("mi_alpha", nullptr) && ictestprobe::findFP("fp_one", nullptr));
    EXPECT_EQ(error_->getStatus(), 0);
    // Later opens add theirs too; one that ends with a separator is kept as
    // it is; the log directory's trailing separator makes no difference.
    ASSERT_EQ(Openlib(&control_, &error_, base + "-b/") + Openlib(&control_, &error_, base + "-a") +
                  Open(&control_, &error_) + Openlib(&control_, &error_, ""),
              0);
    ASSERT_EQ(Openliblog(&control_, &error_, base + "-c", tree_.root()) +
                  Openliblog(&control_, &error_, base + "-c", tree_.root() + "/"),
              0);
    EXPECT_EQ(IST::ICloadCount, 7u);
    std::set<std::string> added;
    for (auto const& p : IST::icbaselibpath)
        if (p.compare(0, base.size(), base) == 0)
            added.insert(p);
    EXPECT_EQ(added, (std::set<std::string>{base + "-a/", base + "-b/", base + "-c/"}));
    EXPECT_EQ(IST::icbaselibpath.size(), before + 3);
    // Never emptied, not even by the teardown.
    ictest::fullyUnload();
    EXPECT_EQ(IST::icbaselibpath.count(base + "-a/") + IST::icbaselibpath.count(base + "-c/"), 2u);
}

TEST_F(Lifecycle, WhenNoInterfaceLoadsTheOpenFailsWith15AndUndoesItself)
{
    tree_.addMI("mi_initfails");
    tree_.addFP("fp_one");
    expectFailedOpen(15);
    EXPECT_TRUE(ictestprobe::eventsWithPrefix("fp_one:").empty()) << "the FPs were not looked at";

    // The next open is a first open again; no interface at all is no failure.
    IC::Error* const failed = error_;
    ictest::fs::remove(tree_.miDir() + "/mi_initfails.so");
    ASSERT_EQ(open(), 0);
    EXPECT_NE(error_, failed);
    EXPECT_EQ(IST::ICloadCount, 1u);
    EXPECT_TRUE(IST::mymis.empty());
    EXPECT_TRUE(ictestprobe::findFP("fp_one", nullptr));
}

TEST_F(Lifecycle, WhenEveryFPFailsTheOpenFailsWith31AndUnloadsTheInterfaces)
{
    std::string const alpha = tree_.addMI("mi_alpha");
    tree_.addFP("fp_initfails");
    tree_.addFP("fp_code");
    expectFailedOpen(31);
    EXPECT_EQ(ictestprobe::count("mi_alpha:shutdown") + ictestprobe::count("mi_alpha:release"), 2u);
    EXPECT_FALSE(ictest::isMapped(alpha));
    EXPECT_TRUE(IST::mymis.empty() && IST::mymilibs.empty());
    // Every failed open hands out the same error object.
    IC::Error* const first = error_;
    EXPECT_EQ(open(), 31);
    EXPECT_EQ(error_, first);
}

// ---- unloading ----

TEST_F(Lifecycle, TheLastUnloadEndsFPsThenInterfacesLastLoadedFirst)
{
    for (char const* m : {"mi_alpha", "mi_beta", "mi_gamma"})
        tree_.addMI(m);
    tree_.addFP("fp_one");
    tree_.addFP("fp_two");
    ASSERT_EQ(open(), 0);
    ictestprobe::reset();
    ictest::LogCapture cap;
    Unloadlib();
    EXPECT_EQ(endings(), (Events{"fp_two:release", "fp_one:release", "fp_two:image unloaded",
                                 "fp_one:image unloaded", "mi_gamma:shutdown", "mi_gamma:release",
                                 "mi_beta:shutdown", "mi_beta:release", "mi_alpha:shutdown",
                                 "mi_alpha:release", "mi_gamma:image unloaded",
                                 "mi_beta:image unloaded", "mi_alpha:image unloaded"}));
    EXPECT_EQ(ictest::timeline(cap).back(), "InstrumentationControl unload done");
    ictest::expectEvent(cap, {kLogIC, "InstrumentationControl"}, "InstrumentationControl unload done",
                        3000, "doUnload");
    // No loader thread was installed.
    EXPECT_EQ(cap.count(kLogIC, 3000, "doUnload: waiting for LoaderThread Termination "), 0u);
    EXPECT_EQ(IST::ICloadCount, 0u);
    EXPECT_TRUE(IST::unloaddone);
    EXPECT_EQ(IST::lt, nullptr);
    EXPECT_TRUE(IST::mymis.empty() && IST::mymilibs.empty() && IST::myfps.empty() &&
                IST::myfplibs.empty());
    EXPECT_EQ(ictestprobe::liveImages(), 0);
}

TEST_F(Lifecycle, NodesOutliveTheTeardownUntilTheNextFirstOpen)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    ASSERT_EQ(open(), 0);
    IC::InstrumentationControl* const ic = control_;
    MIRecord const a = mi("mi_alpha");
    std::string const path = ic->getNodeUniqueId(a.nodes[2]);
    Unloadlib();
    ASSERT_TRUE(IST::unloaddone);
    IC::Node* n = nullptr;
    EXPECT_EQ(ic->getNode(a.base | 3, &n).getStatus(), 0);
    EXPECT_EQ(n, a.nodes[2]);
    Nodes listed;
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

// A process that never opened the library: its first unload tears down
// (nothing), and the open after it is a first open. Runs in a child process
// so that the library's state is really untouched; the exit code tells which
// expectation failed.
int unloadBeforeAnyOpen()
{
    ictest::TempTree tree;
    ictest::EnvGuard mi("IC_MI_DIR", tree.miDir()), fp("IC_FP_DIR", tree.fpDir());
    tree.addMI("mi_alpha");
    ictest::LogCapture cap;
    if (IST::ICloadCount != 0 || IST::unloaddone)
        return 10;
    Unloadlib();
    if (cap.count(kLogIC, 3000, "InstrumentationControl unload done") != 1)
        return 11;
    if (!IST::unloaddone || IST::ICloadCount != 0)
        return 12;
    IC::InstrumentationControl* c = nullptr;
    IC::Error* e = nullptr;
    if (Open(&c, &e) != 0)
        return 13;
    if (IST::ICloadCount != 1 || IST::unloaddone || !ictestprobe::findMI("mi_alpha", nullptr))
        return 14;
    if (cap.count(kLogIC, 3000, "InstrumentationControl: entry Open count=1") != 1)
        return 15;
    Unloadlib();
    return 0;
}

TEST(LifecycleFresh, AnUnloadBeforeAnyOpenTearsDownAndTheNextOpenIsAFirstOpen)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(std::exit(unloadBeforeAnyOpen()), testing::ExitedWithCode(0), "");
}

TEST_F(Lifecycle, AClientCanFindTheEntryPointsAndUseThem)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    void* lib = dlopen(IC_LIBRARY_PATH, RTLD_NOW | RTLD_LOCAL);
    ASSERT_NE(lib, nullptr) << dlerror();
    auto const open = reinterpret_cast<decltype(&Open)>(dlsym(lib, "Open"));
    auto const openlib = reinterpret_cast<decltype(&Openlib)>(dlsym(lib, "Openlib"));
    auto const openliblog = reinterpret_cast<decltype(&Openliblog)>(dlsym(lib, "Openliblog"));
    auto const unload = reinterpret_cast<decltype(&Unloadlib)>(dlsym(lib, "Unloadlib"));
    ASSERT_TRUE(open && openlib && openliblog && unload);
    IC::InstrumentationControl* ic = nullptr;
    IC::Error* err = nullptr;
    ASSERT_EQ(open(&ic, &err) + openlib(&ic, &err, "") + openliblog(&ic, &err, "", ""), 0);
    ASSERT_TRUE(ic != nullptr && err->getStatus() == 0);
    Nodes nodes;
    EXPECT_EQ(ic->getMap(nodes).getStatus(), 0);
    EXPECT_EQ(nodes.size(), 2u);
    EXPECT_EQ(IST::ICloadCount, 3u);
    for (int i = 0; i < 3; ++i)
        unload();
    EXPECT_TRUE(IST::ICloadCount == 0u && IST::unloaddone);
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
        one_ = fp("fp_one");
        ASSERT_EQ(alpha_.nodes.size(), 4u);
        ASSERT_EQ(one_.nodes.size(), 2u);
    }
    IC::InstrumentationControl* ic_ = nullptr;
    MIRecord alpha_;
    FPRecord one_;
};

TEST_F(Queries, EachQueryLogsOneLineAndAnswersFromTheNodeStore)
{
    IC::Node* const cpu = alpha_.nodes[2];
    IC::Node* const temp = alpha_.nodes[3];
    unsigned int const id = alpha_.base | 3;
    std::string const path("\x2f\x50\x1f\x20\x1f\x5c"); // CPU 1 in Chassis 0 under ROOT 0
    IC::Node* n = nullptr;
    Nodes nodes{cpu};
    // Each query writes one progress line, as its own.
    auto check = [](std::string const& function, std::string const& message, auto query) {
        SCOPED_TRACE(message);
        ictest::LogCapture cap;
        query();
        EXPECT_EQ(cap.logs(kLogIC).size(), 1u);
        ictest::expectEvent(cap, {kLogIC, "InstrumentationControl"}, message, 3000, function);
    };
    check("getNode", "getNode: nodeId " + std::to_string(id), [&] { ictest::expectError(ic_->getNode(id, &n), 0); });
    EXPECT_EQ(n, cpu);
    check("getNodeUniqueId", "getNodeUniqueId:", [&] { EXPECT_EQ(ic_->getNodeUniqueId(cpu), path); });
    n = nullptr;
    check("getNode", "getNode: path 2f501f201f5c", [&] { ictest::expectError(ic_->getNode(path, &n), 0); });
    EXPECT_EQ(n, cpu);
    check("pathToPrintablePath", "pathToPrintablePath: 2f501f201f5c",
          [&] { EXPECT_EQ(ic_->pathToPrintablePath(path), "2f501f201f5c"); });
    check("printablePathToPath", "printabePathToPath: 2F501F201F5C",
          [&] { EXPECT_EQ(ic_->printablePathToPath("2F501F201F5C"), path); });
    // By sensor type: Fan (20) before Power Supply (25).
    check("getMap", "getMap: all", [&] { ictest::expectError(ic_->getMap(nodes), 0); });
    EXPECT_EQ(nodes, one_.nodes);
    check("getMap", "getMap: sensor 25", [&] { ictest::expectError(ic_->getMap(nodes, IC::Node::PowerSupply), 0); });
    EXPECT_EQ(nodes, Nodes{one_.nodes[1]});
    std::string const hierarchy = "ROOT:00000000->Chassis:00000000->CPU:00000001";
    check("getNodeHierarchy", "getNodeHierarchy: ", [&] { EXPECT_EQ(ic_->getNodeHierarchy(cpu), hierarchy); });
    check("getNodeHierarchy", "getNodeHierarchy: parent sensor 1", [&] {
        EXPECT_EQ(ic_->getNodeHierarchy(temp, IC::Node::Chassis),
                  "Chassis:00000000->CPU:00000001->Temperature Sensor:0000000d");
    });
    check("getNodeHierarchy", "getNodeHierarchy: ", [&] { EXPECT_EQ(ic_->getNodeHierarchy(nullptr), ""); });
    // Misses leave the node alone, or find nothing; bad text throws.
    n = alpha_.nodes[0];
    EXPECT_EQ(ic_->getNode(0xFFFFFFFFu, &n).getStatus(), 1);
    EXPECT_EQ(n, alpha_.nodes[0]);
    n = nullptr;
    EXPECT_EQ(ic_->getNode(std::string("\x2f\x50"), &n).getStatus(), 1);
    EXPECT_EQ(n, nullptr);
    for (unsigned int sensor : {74u, static_cast<unsigned int>(IC::Node::CPU)}) {
        EXPECT_EQ(ic_->getMap(nodes, sensor).getStatus(), 0);
        EXPECT_TRUE(nodes.empty()) << "interfaces' nodes are not listed";
    }
    EXPECT_EQ(ic_->printablePathToPath("1f5c"), std::string("\x1f\x5c"));
    EXPECT_EQ(ic_->printablePathToPath(""), "");
    EXPECT_THROW(ic_->printablePathToPath("0"), std::invalid_argument);
    EXPECT_THROW(ic_->printablePathToPath("1g"), std::invalid_argument);
}

TEST_F(Queries, AnInterfacesLookUpFindsNodesAndReportsAMiss)
{
    ASSERT_EQ(alpha_.lookup, &IST::getNodeCallBackMI);
    std::string const path = ic_->getNodeUniqueId(alpha_.nodes[1]);
    ictest::LogCapture cap;
    IC::Node* n = nullptr;
    ictest::expectError(alpha_.lookup(path, &n), 0);
    EXPECT_EQ(n, alpha_.nodes[1]);
    ictest::expectEvent(cap, {kLogIC, "InstrumentationControl"}, "getNodeCallBack:", 3000, "getNodeCallBackMI");
    cap.clear();
    IC::Error const e = alpha_.lookup(std::string("\x7f\x7f"), &n);
    EXPECT_EQ(e.getStatus(), 1);
    EXPECT_EQ(n, alpha_.nodes[1]);
    EXPECT_EQ(cap.messages(kLogIC), (Events{"getNodeCallBack:", "getNodeCallBackMI: failure: " + errText(e)}));
    ictest::expectEvent(cap, {kLogIC, "InstrumentationControl"}, "getNodeCallBackMI: failure: " + errText(e),
                        6000, "diagError");
}

TEST_F(Queries, AnFPAnnouncesItsOwnNodesOnce)
{
    EXPECT_EQ(ictestprobe::count("fp_one:announced status=0"), 2u);
    IC::NodeAnnouncement const announce = one_.services->getMapNewFPNode();
    IC::Node* const extra = ictestprobe::makeNode(IC::Node::Fan, 99, one_.base | 0x50, 0, "extra");
    IC::Node* const twin = ictestprobe::makeNode(IC::Node::Fan, 99, one_.base | 0x51, 0, "twin");
    ictest::LogCapture cap;
    EXPECT_EQ(announce(extra).getStatus(), 0);
    // Again, and a second node under the same path: neither is added.
    EXPECT_EQ(announce(extra).getStatus(), 0);
    EXPECT_EQ(announce(twin).getStatus(), 0);
    EXPECT_TRUE(ictest::libraryLogs(cap).empty()) << "the announcement itself writes nothing";
    Nodes nodes;
    ic_->getMap(nodes, IC::Node::Fan);
    EXPECT_EQ(nodes, (Nodes{one_.nodes[0], extra}));
    IC::Node* n = nullptr;
    EXPECT_EQ(IST::nodestore.getNode(one_.base | 0x51, &n).getStatus(), 1);
}

// A node that does not take the path the store gives it.
class PathlessNode : public IC::Node {
public:
    using IC::Node::Node;
    IC::Error setPath(std::string const&) override { return IC::Error(0, IC::Number(IC::Number::Generic), ""); }
};

TEST_F(Queries, AnArrivingNodeIsStoredAndAnnouncedOnce)
{
    ASSERT_EQ(alpha_.arrival, &IST::LoadCallBackMI);
    int observer = 0;
    ASSERT_EQ(IST::regFPsensorAlerts(&ictest::recAlert, IC::Node::Fan, &observer).getStatus(), 0);
    IC::Node* const fan =
        ictestprobe::makeNode(IC::Node::Fan, 7, alpha_.base | 0x40, alpha_.base | 2, "extra fan");
    {
        ictest::LogCapture cap;
        ictest::expectError(alpha_.arrival(fan, alpha_.arrivalContext), 0);
        ictest::expectEvent(cap, {kLogIC, "InstrumentationControl"},
                            "LoadCallBack: NodePtr=" + ictest::ptrText(fan) + " desc=extra fan index=7",
                            3000, "LoadCallBackMI");
        auto const logs = cap.logs(kLogIC);
        ASSERT_EQ(logs.size(), 2u);
        EXPECT_EQ(logs[1].message.rfind("LoadCallbackMI: sent alert= ", 0), 0u) << logs[1].message;
        EXPECT_NE(logs[1].message.find("extra fan"), std::string::npos) << logs[1].message;
        EXPECT_EQ(logs[1].level, 3000);
    }
    IC::Node* n = nullptr;
    EXPECT_EQ(ic_->getNode(alpha_.base | 0x40, &n).getStatus(), 0);
    EXPECT_EQ(n, fan);
    EXPECT_EQ(ic_->getNodeHierarchy(fan), "ROOT:00000000->Chassis:00000000->Fan:00000007");
    auto const calls = ictest::Recorder::get().calls();
    ASSERT_EQ(calls.size(), 1u);
    EXPECT_EQ(calls[0].context, &observer);
    EXPECT_EQ(ictest::sigs(calls[0].alerts),
              Events{ictest::sig(IC::Alert(0, IC::Alert::NodeArrival, {ic_->getNodeUniqueId(fan)}, 1, "extra fan"))});

    // Reported again: known, no alert. A node without a path is stored, but
    // there is nothing to announce.
    static PathlessNode pathless(IC::Node::Fan, 8, alpha_.base | 0x41, alpha_.base | 2, "silent fan");
    ictest::LogCapture cap;
    EXPECT_EQ(alpha_.arrival(fan, alpha_.arrivalContext).getStatus(), 6);
    EXPECT_EQ(alpha_.arrival(&pathless, alpha_.arrivalContext).getStatus(), 0);
    EXPECT_EQ(cap.count(kLogIC, 3000, "LoadCallBack: NodeStore:addMINode duplicate Node =extra fan index=7"), 1u);
    EXPECT_EQ(cap.count(kLogIC, 6000, "LoadCallBackMI: Node " + ictest::ptrText(&pathless) + " path is empty: ''."),
              1u);
    EXPECT_EQ(ic_->getNode(alpha_.base | 0x41, &n).getStatus(), 0);
    EXPECT_EQ(n, &pathless);
    EXPECT_EQ(ictest::Recorder::get().calls().size(), 1u);
}

// ---- alerts through an FP to a client ----

TEST_F(Lifecycle, AnInterfacesAlertReachesAClientThroughAnFP)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_relay");
    ASSERT_EQ(open(), 0);
    EXPECT_EQ(ictestprobe::count("fp_relay:registered sensor=4 status=0"), 1u);
    int ctx = 0;
    ASSERT_EQ(control_->registerForAlerts(&ictest::recAlert, IC::Node::CPU, &ctx).getStatus(), 0);
    MIRecord const a = mi("mi_alpha");
    std::string const cpu = control_->getNodeUniqueId(a.nodes[2]);
    a.alert({IC::Alert(2, static_cast<IC::Alert::ClassType>(2), {cpu}, 2u, "overheat")}, a.alertContext);
    auto const received = ictestprobe::relayReceived();
    ASSERT_EQ(received.size(), 1u);
    EXPECT_EQ(received[0].getMessage(), "overheat");
    auto const calls = ictest::Recorder::get().calls();
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

TEST_F(Lifecycle, AnInterfacesOwnThreadIsHeardAndStoppedBeforeRelease)
{
    tree_.addMI("mi_thread");
    tree_.addFP("fp_relay");
    ASSERT_EQ(open(), 0);
    int ctx = 0;
    ASSERT_EQ(control_->registerForAlerts(&ictest::recAlert, IC::Node::Fan, &ctx).getStatus(), 0);
    ictestprobe::ThreadPlan plan;
    plan.nodes = plan.alerts = true;
    plan.periodMs = 10;
    ictestprobe::setThreadPlan(plan);
    EXPECT_TRUE(ictest::eventually([&] {
        for (auto const& c : ictest::Recorder::get().calls(&ctx))
            for (auto const& al : c.alerts)
                if (al.getMessage() == "relayed mi_thread thread alert")
                    return true;
        return false;
    }));
    EXPECT_TRUE(mi("mi_thread").threadRunning);
    Unloadlib();
    // The FP went first; the thread ended between shutdown and release.
    ictest::expectInOrder(ictestprobe::events(), {"fp_relay:release", "mi_thread:shutdown",
                                                  "mi_thread:thread ended", "mi_thread:release"});
    EXPECT_EQ(ictestprobe::liveImages(), 0);
}

// ---- timed reload ----

TEST_F(Lifecycle, ATimedReloadOfAClosedLibraryOnlyLogs)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    for (int round = 0; round < 2; ++round) { // never opened, then after the last unload
        ictest::LogCapture cap;
        IST::TimedReload();
        ASSERT_EQ(ictest::libraryLogs(cap).size(), 1u);
        ictest::expectEvent(cap, {kLogIC, "InstrumentationControl"}, "Instrumentation Control Timed Reload",
                            3000, "TimedReload");
        EXPECT_TRUE(ictestprobe::events().empty());
        EXPECT_TRUE(IST::mymis.empty());
        ASSERT_EQ(open(), 0);
        Unloadlib();
        ictestprobe::reset();
    }
}

TEST_F(Lifecycle, ATimedReloadFollowsTheDirectories)
{
    std::string const alpha = tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    ASSERT_EQ(open(), 0);
    {
        ictest::LogCapture cap;
        IST::TimedReload(); // nothing changed
        EXPECT_EQ(cap.count(kLogMI, 3000, "MIControl reLoadMis End"), 1u);
        EXPECT_EQ(cap.count(kLogFP, 3000, " reloadFPs: Done - no additions"), 1u);
    }
    // An interface added.
    unsigned short c = IST::mymifpctr;
    tree_.addMI("mi_beta");
    IST::TimedReload();
    EXPECT_EQ(mi("mi_beta").base, static_cast<unsigned int>(c) << 16);
    ASSERT_EQ(IST::mymis.size(), 2u);
    EXPECT_EQ(ictestprobe::count("fp_one:updatedMis added=1 removed=0"), 1u);
    EXPECT_EQ(fp("fp_one").lastAdded, std::vector<IC::ManagementInterface*>{IST::mymis[1]});

    // One removed: released without shutdown, the FP told.
    void const* const oldAlpha = mi("mi_alpha").object;
    ictest::fs::remove(alpha);
    IST::TimedReload();
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    EXPECT_EQ(ictestprobe::count("mi_alpha:shutdown"), 0u);
    EXPECT_FALSE(ictest::isMapped(alpha));
    EXPECT_TRUE(fp("fp_one").lastAdded.empty());
    EXPECT_EQ(fp("fp_one").lastRemoved, std::vector<IC::ManagementInterface*>{
                                           static_cast<IC::ManagementInterface*>(const_cast<void*>(oldAlpha))});
    EXPECT_EQ(IST::mymilibs.size(), 1u);

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
    ictest::fs::remove(alpha);
    tree_.addMI("mi_code");
    tree_.addFP("fp_two");
    ictest::LogCapture cap;
    IST::TimedReload();
    // The interface reload ended with no interface at all ...
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    EXPECT_TRUE(IST::mymis.empty());
    EXPECT_EQ(cap.count(kLogMI, 6000, "myloadMIs count of MIs that did not load 1"), 1u);
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

TEST_F(Lifecycle, NodesAnFPHandsOverOnAReloadAreAnnouncedToFPRegistrationsOnly)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_two");
    ASSERT_EQ(open(), 0);
    FPRecord const two = fp("fp_two");
    ASSERT_EQ(two.nodes.size(), 2u);
    int observer = 0, client = 0;
    for (auto s : {IC::Node::Fan, IC::Node::PowerSupply}) {
        ASSERT_EQ(IST::regFPsensorAlerts(&ictest::recAlert, s, &observer).getStatus(), 0);
        ASSERT_EQ(control_->registerForAlerts(&ictest::recAlert, s, &client).getStatus(), 0);
    }
    // Not handed over yet: fp_two only gives its nodes when asked.
    Nodes nodes;
    control_->getMap(nodes);
    EXPECT_TRUE(nodes.empty());
    tree_.addMI("mi_beta");
    IST::TimedReload();
    control_->getMap(nodes);
    EXPECT_EQ(nodes, two.nodes);
    auto const calls = ictest::Recorder::get().calls();
    ASSERT_EQ(calls.size(), 1u) << "a client registration does not hear an interface's batch";
    EXPECT_EQ(calls[0].context, &observer);
    Events want;
    for (IC::Node* n : two.nodes)
        want.push_back(ictest::sig(IC::Alert(3, IC::Alert::NodeArrival, {control_->getNodeUniqueId(n)},
                                             n->getNodeNumber(), "MIControl")));
    EXPECT_EQ(ictest::sigs(calls[0].alerts), want);
}

} // namespace
