// The library's life through its entry points, with real plug-ins: open and
// load codes, repeated opens, unload order, timed reload, the node queries of
// the facade and the node entries handed to plug-ins.
#include "PluginHarness.h"
#include "Recorders.h"


namespace {

using namespace ictest;
namespace IST = IC::InstCtrl;
using Strings = std::vector<std::string>;
using Nodes = std::vector<IC::Node*>;

IC::Node* keptNode(IC::Node::SensorType type, unsigned int instance, unsigned int id, unsigned int parent,
                   std::string const& description)
{
    auto* n = new IC::Node(type, instance, id, parent, description, 1);
    ictest_keep(n);
    return n;
}

class Lifecycle : public ictest::PluginTest {
protected:
    void SetUp() override
    {
        PluginTest::SetUp();
        ictest::Recorder::get().reset();
    }
    unsigned char open()
    {
        control_ = &sentinel_;
        error_ = nullptr;
        return Open(&control_, &error_);
    }
    IC::InstrumentationControl sentinel_;
    IC::InstrumentationControl* control_ = nullptr;
    IC::Error* error_ = nullptr;
};

// Interfaces first, in name order, then the FPs, numbered on from the
// library's counter. A repeated open only counts; the last unload ends FPs
// before interfaces, each group's objects before their libraries, last
// loaded first, and deletes every registration. Nodes stay until the next
// first open, which clears them.
TEST_F(Lifecycle, OpenUnloadAndOpenAgain)
{
    for (char const* m : {"mi_gamma", "mi_beta", "mi_alpha"})
        tree_.addMI(m);
    tree_.addFP("fp_two");
    tree_.addFP("fp_one");
    unsigned int const c = IST::mymifpctr;
    ictest::LogCapture cap;
    ASSERT_EQ(open(), 0);
    ASSERT_TRUE(control_ != &sentinel_ && control_ != nullptr && error_ != nullptr);
    ictest::expectError(*error_, 0, IC::Number(0u));
    EXPECT_TRUE(IST::ICloadCount == 1u && !IST::unloaddone && IST::mymifpctr == c + 5);
    EXPECT_EQ(ictest::calls(cap, "mi_alpha").at(2), "mi_alpha:Initialize base=" + std::to_string(c << 16) + " iv=1.0 mv=1.0");
    EXPECT_TRUE(seen("mi_gamma").base == (c + 2) << 16 && seen("fp_one").base == (c + 3) << 16);
    // What the services do is the node-entry test's; here, whom they name.
    ASSERT_TRUE(seen("fp_one").services);
    IC::ICforFP const& s = *seen("fp_one").services;
    EXPECT_TRUE(s.getMIs() == IST::mymis && IST::mymis.size() == 3u && s.getInstrumentationControl() == control_);
    EXPECT_TRUE(s.getInterfaceVersion() == IC::Number(IC::Version2{1, 0}) && s.getModuleVersion() == s.getInterfaceVersion());
    EXPECT_TRUE(s.getRegFPAlerts() == &IST::regFPAlerts && s.getDeRegFPAlerts() == &IST::deRegFPAlerts);

    IC::InstrumentationControl* const ic = control_;
    IC::Error* const firstError = error_;
    int ctx = 0;
    ASSERT_EQ(ic->registerForAlerts(&ictest::recAlert, IC::Node::CPU, &ctx).getStatus(), 0);
    ASSERT_EQ(IST::regFPsensorAlerts(&ictest::recAlert, IC::Node::Fan, &sentinel_).getStatus(), 0);
    cap.clear();
    ASSERT_EQ(open(), 0);
    EXPECT_TRUE(control_ == ic && error_ == firstError && IST::ICloadCount == 2u);
    Unloadlib();
    EXPECT_TRUE(IST::ICloadCount == 1u && !IST::unloaddone && IST::callbacks.size() == 2u);
    EXPECT_TRUE(ictest::calls(cap).empty());
    Unloadlib();
    EXPECT_EQ(ictest::calls(cap),
              (Strings{"fp_two:release", "fp_one:release", "fp_two:image unloaded", "fp_one:image unloaded",
                       "mi_gamma:shutdown", "mi_gamma:release", "mi_beta:shutdown", "mi_beta:release",
                       "mi_alpha:shutdown", "mi_alpha:release", "mi_gamma:image unloaded", "mi_beta:image unloaded",
                       "mi_alpha:image unloaded"}));
    EXPECT_EQ(cap.messages(kLogIC).back(), "InstrumentationControl unload done");
    EXPECT_TRUE(IST::ICloadCount == 0u && IST::unloaddone && IST::mymis.empty() && IST::mymilibs.empty() &&
                IST::myfps.empty() && IST::myfplibs.empty() && IST::callbacks.empty() &&
                IST::sensortypeTOalertregister.empty());
    cap.clear();
    Unloadlib();
    EXPECT_TRUE(cap.messages(kLogIC).empty() && ictest::calls(cap).empty()) << "a further unload does nothing";

    auto const& a = seen("mi_alpha");
    IC::Node* n = nullptr;
    EXPECT_TRUE(ic->getNode(a.base | 3, &n).getStatus() == 0 && n == a.nodes[2]);
    std::string const path = ic->getNodeUniqueId(a.nodes[2]);
    ASSERT_EQ(open(), 0);
    EXPECT_EQ(ic->getNode(a.base | 3, &n).getStatus(), 1);
    EXPECT_EQ(seen("mi_alpha").base, (c + 5) << 16);
    EXPECT_TRUE(ic->getNode(path, &n).getStatus() == 0 && n == seen("mi_alpha").nodes[2]);
}

// A failed first open: its code, the shared load error, nothing handed out
// and everything undone; the next open is a first open again.
TEST_F(Lifecycle, AFailedFirstOpenUndoesItself)
{
    IC::Error* shared = nullptr;
    auto const failedOpen = [&](unsigned char code) {
        ictest::LogCapture cap;
        EXPECT_EQ(open(), code);
        EXPECT_EQ(control_, &sentinel_);
        EXPECT_NE(error_, nullptr);
        if (error_)
            ictest::expectError(*error_, 5, IC::Number(1u), "Load Library");
        EXPECT_EQ(error_, shared ? shared : (shared = error_)) << "every failed open hands out the same error";
        EXPECT_TRUE(IST::ICloadCount == 0u && IST::unloaddone && IST::mymis.empty() && IST::myfps.empty());
        EXPECT_FALSE(ictest::isMapped(tree_.root()));
        return ictest::calls(cap);
    };
    std::string const bad = tree_.addMI("mi_initfails");
    tree_.addFP("fp_initfails");
    tree_.addFP("fp_code");
    Strings c = failedOpen(15);
    EXPECT_TRUE(std::none_of(c.begin(), c.end(), [](auto const& e) { return e.rfind("fp_", 0) == 0; }))
        << "the FPs were not looked at";
    ictest::fs::remove(bad);
    failedOpen(31);
    tree_.addMI("mi_alpha");
    c = failedOpen(31);
    EXPECT_EQ(count(c, "mi_alpha:shutdown") + count(c, "mi_alpha:release"), 2u);
    tree_.addFP("fp_one");
    ASSERT_EQ(open(), 0);
    EXPECT_NE(error_, shared);
}

// A process that never opened the library: a timed reload does nothing, the
// first unload tears down (nothing), and the open after it is a first open.
// Runs in a child process, so that the library's state is really untouched.
int unloadBeforeAnyOpen()
{
    ictest::TempTree tree;
    ictest::EnvGuard mi("IC_MI_DIR", tree.miDir()), fp("IC_FP_DIR", tree.fpDir());
    tree.addMI("mi_alpha");
    ictest::LogCapture cap;
    if (IST::ICloadCount != 0 || IST::unloaddone)
        return 10;
    IST::TimedReload();
    if (ictest::isMapped(tree.root()))
        return 11;
    Unloadlib();
    if (cap.count(kLogIC, 3000, "InstrumentationControl unload done") != 1 || !IST::unloaddone || IST::ICloadCount != 0)
        return 12;
    IST::TimedReload(); // after the last unload, as before the first open
    if (ictest::isMapped(tree.root()))
        return 14;
    IC::InstrumentationControl* c = nullptr;
    IC::Error* e = nullptr;
    if (Open(&c, &e) != 0 || IST::ICloadCount != 1 || IST::unloaddone || IST::mymis.size() != 1)
        return 13;
    Unloadlib();
    return 0;
}

TEST(LifecycleFresh, AnUnloadBeforeAnyOpenTearsDownAndTheNextOpenIsAFirstOpen)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(std::exit(unloadBeforeAnyOpen()), testing::ExitedWithCode(0), "");
}

// A node that does not take the path the store gives it.
struct PathlessNode : IC::Node {
    using IC::Node::Node;
    IC::Error setPath(std::string const&) override { return IC::Error(0, IC::Number(IC::Number::Generic), ""); }
};

// The queries answer from the node store; a look-up logs what it was asked.
// (The path forms and the full hierarchy are icctl's and linuxhw's to show.)
// An interface's look-up reports a miss as an error; an FP's announcement
// adds a node once; an arriving node is stored and announced once to FP
// registrations, one without a path only stored. What an FP raises reaches
// clients and is asserted.
TEST_F(Lifecycle, TheQueriesAndTheNodeEntriesGivenToPlugIns)
{
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_one");
    ASSERT_EQ(open(), 0);
    IC::InstrumentationControl* const ic = control_;
    auto const& alpha = seen("mi_alpha");
    auto const& one = seen("fp_one");
    IC::Node* const cpu = alpha.nodes.at(2);
    std::string const path("\x1f\x50\x1f\x20\x1f\x5c"); // CPU 0 in Chassis 0 under ROOT 0
    IC::Node* n = nullptr;
    Nodes nodes;
    ictest::LogCapture cap;
    EXPECT_TRUE(ic->getNode(alpha.base | 3, &n).getStatus() == 0 && n == cpu);
    EXPECT_TRUE(ic->getNode(path, &n).getStatus() == 0 && n == cpu);
    EXPECT_EQ(cap.messages(kLogIC), (Strings{"getNode: nodeId " + std::to_string(alpha.base | 3),
                                             "getNode: path 1f501f201f5c"}));
    IST::diagError(nullptr, "ctx");
    EXPECT_EQ(cap.messages(kLogIC).at(2).rfind("ctx: ", 0), 0u) << "a null error is reported, not dereferenced";
    EXPECT_EQ(ic->getNodeUniqueId(cpu), path);
    EXPECT_TRUE(ic->getMap(nodes).getStatus() == 0 && nodes == one.nodes);
    EXPECT_TRUE(ic->getMap(nodes, IC::Node::PowerSupply).getStatus() == 0 && nodes == Nodes{one.nodes[1]});
    EXPECT_TRUE(ic->getAllNodes(nodes).getStatus() == 0 && nodes.size() == 8u);
    EXPECT_EQ(ic->getNodeHierarchy(alpha.nodes[3], IC::Node::Chassis),
              "Chassis:00000000->CPU:00000000->Temperature Sensor:00000000");
    EXPECT_TRUE(ic->getModuleVersion() == IC::Number(IC::Version2{1, 0}) &&
                ic->getInterfaceVersion() == IC::Number(IC::Version2{1, 0}));

    ictest::expectError(alpha.lookup(control_->getNodeUniqueId(alpha.nodes.at(1)), &n), 0);
    EXPECT_EQ(n, alpha.nodes[1]);
    IC::Error const miss = alpha.lookup(std::string("\x7f\x7f"), &n);
    EXPECT_EQ(miss.getStatus(), 1);
    EXPECT_EQ(cap.count(kLogIC, 6000, "getNodeCallBackMI: failure: " + ictest::errText(miss)), 1u);

    IC::NodeAnnouncement const announce = one.services->getMapNewFPNode();
    IC::Node* const extra = keptNode(IC::Node::Fan, 99, one.base | 0x50, 0, "extra");
    IC::Node* const twin = keptNode(IC::Node::Fan, 99, one.base | 0x51, 0, "twin");
    EXPECT_EQ(announce(extra).getStatus() + announce(extra).getStatus() + announce(twin).getStatus(), 0);
    control_->getMap(nodes, IC::Node::Fan);
    EXPECT_EQ(nodes, (Nodes{one.nodes.at(0), extra})) << "a second node under the same path is not added";

    int observer = 0, client = 0;
    ASSERT_EQ(IST::regFPsensorAlerts(&ictest::recAlert, IC::Node::Fan, &observer).getStatus(), 0);
    ASSERT_EQ(control_->registerForAlerts(&ictest::recAlert, IC::Node::Fan, &client).getStatus(), 0);
    IC::Node* const fan = keptNode(IC::Node::Fan, 7, alpha.base | 0x40, alpha.base | 2, "extra fan");
    ictest::expectError(alpha.arrival(fan, alpha.arrivalContext), 0);
    EXPECT_TRUE(control_->getNode(alpha.base | 0x40, &n).getStatus() == 0 && n == fan);
    auto const calls = ictest::Recorder::get().calls();
    ASSERT_EQ(calls.size(), 1u);
    EXPECT_EQ(calls[0].context, &observer);
    IC::Alert const arrival(0, IC::Alert::NodeArrival, {control_->getNodeUniqueId(fan)}, 1, "extra fan");
    EXPECT_EQ(ictest::sigs(calls[0].alerts), Strings{ictest::sig(arrival)});
    EXPECT_EQ(alpha.arrival(fan, alpha.arrivalContext).getStatus(), 6);
    static PathlessNode pathless(IC::Node::Fan, 8, alpha.base | 0x41, alpha.base | 2, "silent fan");
    EXPECT_EQ(alpha.arrival(&pathless, alpha.arrivalContext).getStatus(), 0);
    EXPECT_TRUE(control_->getNode(alpha.base | 0x41, &n).getStatus() == 0 && n == &pathless);
    EXPECT_EQ(ictest::Recorder::get().calls().size(), 1u) << "known or pathless nodes are not announced";
    IC::Alert const hot(2, static_cast<IC::Alert::ClassType>(2), {control_->getNodeUniqueId(fan)}, 2u, "hot");
    ictest::expectError(one.services->getAlertCallBackFP()({hot}), 0);
    std::vector<IC::Alert> asserted;
    control_->getAssertedAlerts(asserted);
    EXPECT_EQ(ictest::Recorder::get().calls(&client).size(), 1u);
    EXPECT_EQ(ictest::sigs(asserted), Strings{ictest::sig(hot)});
}

// Not even scanning while another holds the load lock (a closed library is
// the fresh process's test).
// An FP's nodes new to the store go to FP registrations only; an added FP
// sees the interfaces of now, and is loaded even when the interfaces fail.
// (How a removed interface is released is the loaders' test.)
TEST_F(Lifecycle, ATimedReloadFollowsTheDirectoriesWhileOpen)
{
    ictest::Watchdog dog(30, "timed reload against a held load lock");
    std::string const alpha = tree_.addMI("mi_alpha");
    tree_.addFP("fp_two");
    ictest::LogCapture cap;
    ASSERT_EQ(open(), 0);
    int observer = 0, client = 0;
    ASSERT_EQ(IST::regFPsensorAlerts(&ictest::recAlert, IC::Node::Fan, &observer).getStatus(), 0);
    ASSERT_EQ(control_->registerForAlerts(&ictest::recAlert, IC::Node::Fan, &client).getStatus(), 0);
    unsigned short c = IST::mymifpctr;
    tree_.addMI("mi_beta");
    IST::loadlock.lock();
    ictest::JoinedThread reload([] { IST::TimedReload(); });
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_TRUE(ictest::calls(cap, "mi_beta").empty());
    IST::loadlock.unlock();
    reload.join();
    EXPECT_EQ(seen("mi_beta").base, static_cast<unsigned int>(c) << 16);
    ASSERT_EQ(IST::mymis.size(), 2u);
    EXPECT_EQ(seen("fp_two").added, std::vector<IC::ManagementInterface*>{IST::mymis[1]});
    auto const calls = ictest::Recorder::get().calls();
    ASSERT_EQ(calls.size(), 1u) << "a client registration does not hear an interface's batch";
    EXPECT_TRUE(calls[0].context == &observer && calls[0].alerts.size() == 1u);

    c = IST::mymifpctr;
    tree_.addFP("fp_one");
    IST::TimedReload();
    EXPECT_EQ(seen("fp_one").base, static_cast<unsigned int>(c) << 16);
    EXPECT_EQ(seen("fp_one").services->getMIs(), IST::mymis);
    ictest::fs::remove(alpha);
    ictest::fs::remove(tree_.miDir() + "/mi_beta.so");
    tree_.addMI("mi_code");
    tree_.addFP("fp_relay");
    IST::TimedReload();
    EXPECT_TRUE(IST::mymis.empty() && IST::myfps.size() == 3u && IST::ICloadCount == 1u && !IST::unloaddone);
}

} // namespace
