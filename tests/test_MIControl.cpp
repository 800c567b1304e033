// Management-interface loading, removal and reload (IC::MIControl), driven
// directly with local lists and a local node store, against real plug-ins.
#include <IC/FPControl.h>
#include <IC/LoadControl.h>
#include <IC/MIControl.h>
#include <IC/NodeStore.h>
#include <SD/PlatformUtilities.h>

#include "PluginTest.h"

#include <typeinfo>

namespace {

using ictest::expectError;
using ictest::kLogMI;
using ictest::mi;
using ictest::recs;
using ictestprobe::count;
using Strings = std::vector<std::string>;
using MIs = std::vector<IC::ManagementInterface*>;

IC::Number const kIV(IC::Version2{1, 0});
IC::Number const kMV(IC::Version2{2, 3});
int const kContext = 0; // stands for the facade
ictest::Source const kMI{kLogMI, "MIControl"};

std::string err(unsigned int code, char const* text)
{
    return ictest::errText(IC::Error(1, IC::Number(code), text));
}
IC::ManagementInterface* object(ictestprobe::MIRecord const& r)
{
    return static_cast<IC::ManagementInterface*>(const_cast<void*>(r.object));
}

class MIControlTest : public testing::Test {
protected:
    void SetUp() override
    {
        ictestprobe::reset();
        ictest::Recorder::get().reset();
    }
    void TearDown() override
    {
        for (auto& r : fplibs_)
            static_cast<IC::FunctionalPlugIn*>(r.plugin)->release();
        for (auto& r : libs_)
            static_cast<IC::ManagementInterface*>(r.plugin)->release();
        for (auto* list : {&fplibs_, &libs_})
            for (auto& r : *list)
                SD::PlatformUtilities::unloadLibrary(r.handle);
        EXPECT_EQ(ictestprobe::liveImages(), 0) << "every library the loader opened is closed again";
    }
    IC::Error load()
    {
        toLoad_ = ictest::discover(tree_.miDir());
        return IC::MIControl().myloadMIs(counter_, libs_, mis_, &ictest::recAlert, toLoad_, kIV, kMV, store_,
                                         &ictest::recArrival, &kContext, &ictest::recLookup);
    }
    IC::Error reload()
    {
        return IC::MIControl().reLoadMIs(counter_, libs_, mis_, &ictest::recAlert, fps_, kIV, kMV, store_, names_,
                                         &ictest::recArrival, &kContext, &ictest::recLookup);
    }

    ictest::TempTree tree_;
    ictest::EnvGuard miEnv_{"IC_MI_DIR", tree_.miDir()};
    unsigned short counter_ = 7;
    std::vector<IC::libstruct> libs_, fplibs_, toLoad_;
    MIs mis_;
    std::vector<IC::FunctionalPlugIn*> fps_;
    std::set<std::string> names_;
    IC::NodeStore store_;
};

// Of three, the second fails in Initialize: the others take consecutive
// numbers and every callback in order; the failed one stops after its
// Initialize, whose done line still comes before the error.
TEST_F(MIControlTest, LoadsEachWithItsCallbacksInOrderAndCountsTheFailures)
{
    std::string const path = tree_.addMI("mi_alpha", "a1.so"), bad = tree_.addMI("mi_initfails", "a2.so");
    tree_.addMI("mi_beta", "a3.so");
    ictest::LogCapture cap;
    expectError(load(), 0, IC::Number(1u), "Count of MIs that did not load");
    EXPECT_EQ(cap.count(kLogMI, 6000, "myloadMIs count of MIs that did not load 1"), 1u);
    std::string const init = "mi_alpha:Initialize base=458752 iv=1.0 mv=2.3";
    EXPECT_EQ(ictest::callsOf("mi_alpha"), (Strings{"mi_alpha:OpenMI", "mi_alpha:registerNodeCallBacks", init,
                                                    "mi_alpha:registerForAlerts", "mi_alpha:getMap"}));
    EXPECT_EQ(ictest::callsOf("mi_initfails").back(), "mi_initfails:Initialize base=524288 iv=1.0 mv=2.3");
    ictest::expectInOrder(ictest::timeline(cap),
                          {"myloadMIs: " + path + " Initialize", init, "myloadMIs: " + path + " Initialize Done",
                           "myloadMIs: " + bad + " Initialize Done", "MI Initialize: " + err(3, "mi init refused")});
    ictest::expectEvent(cap, kMI, "myloadMIs: " + path + " Initialize Done", 3000, "myloadMIs");
    auto const a = mi("mi_alpha");
    EXPECT_TRUE(a.arrival == &ictest::recArrival && a.arrivalContext == &kContext && a.lookup == &ictest::recLookup);
    EXPECT_TRUE(a.alert == &ictest::recAlert && a.alertContext == a.object) << "alerts come back with the interface";
    EXPECT_TRUE(a.base == 7u << 16 && mi("mi_beta").base == 8u << 16 && counter_ == 9);
    EXPECT_EQ(mis_, (MIs{object(a), object(mi("mi_beta"))}));
    EXPECT_EQ(recs(toLoad_), (Strings{"a1.so 7", "a3.so 8"}));
    EXPECT_EQ(recs(libs_), (Strings{"a1.so 7", "a3.so 8"}));
    EXPECT_TRUE(libs_[0].handle == toLoad_[0].handle && libs_[0].path == path && libs_[0].plugin == a.object);
    // Its nodes are in the store by id, but not in the get map.
    IC::Node* node = nullptr;
    for (unsigned int n = 1; n <= 4; ++n)
        EXPECT_TRUE(store_.getNode(a.base | n, &node).getStatus() == 0 && node == a.nodes[n - 1]) << n;
    std::vector<IC::Node*> listed;
    store_.getMap(listed);
    EXPECT_TRUE(listed.empty());

    // Only a full path names a record to delete. shutdown() belongs to the
    // unload, not to a removal; the interface is released before its
    // library goes, and one missing from the list still goes, reported.
    ictestprobe::reset();
    cap.clear();
    IC::MIControl().deleteMI(libs_, "a1.so", mis_);
    ictest::expectEvent(cap, kMI, "deleteMI: MI removal error.", 6000, "deleteMI");
    cap.clear();
    IC::MIControl().deleteMI(libs_, path, mis_);
    EXPECT_TRUE(cap.logs(kLogMI).empty() && mis_.size() == 1u);
    mis_.clear();
    IC::MIControl().deleteMI(libs_, libs_.at(0).path, mis_);
    EXPECT_EQ(ictestprobe::events(), (Strings{"mi_alpha:release", "mi_alpha:image unloaded", "mi_beta:release",
                                              "mi_beta:image unloaded"}));
    EXPECT_EQ(cap.messages(kLogMI), Strings{"deleteMI: MI not found in MI vector."});
    EXPECT_TRUE(libs_.empty());
}

// One library that fails, each way it can: its line, the whole load failed,
// no number used, the library closed, its object (if any) abandoned.
TEST_F(MIControlTest, EveryWayToFailIsLoggedUnloadedAndCounted)
{
    std::string const thrown = std::string(" exploded Type=") + typeid(std::runtime_error).name() + " for {path}";
    struct Case {
        char const* module;
        std::string message; // {path} stands for the library's path
        char const* function;
        bool madeObject;
    } const cases[] = {
        {"mi_noentry", "myloadMIs: {path} OpenMI() function is missing.", "myloadMIs", false},
        {"mi_code", "myloadMIs: {path} OpenMI failed code=X", "myloadMIs", false},
        {"mi_nullerror", "myloadMIs: {path} Pointer to Error is NULL", "myloadMIs", true},
        {"mi_errstatus", "OpenMI() failed: " + err(7, "mi refused"), "diagError", true},
        {"mi_nullobject", "myloadMIs: {path} OpenMI pointer to MI is NULL", "myloadMIs", false},
        {"mi_initfails", "MI Initialize: " + err(3, "mi init refused"), "diagError", true},
        {"mi_regfails", "MIControl MI registerForAlerts: " + err(4, "mi alerts refused"), "diagError", true},
        {"mi_throwopen", "myloadMIs: Exception open" + thrown, "myloadMIs", false},
        {"mi_throwinit", "myloadMIs: Exception init" + thrown, "myloadMIs", true},
        {"mi_throwint", "myloadMIs: {path} Exception loading library", "myloadMIs", true}};
    for (auto const& c : cases) {
        SCOPED_TRACE(c.module);
        ictestprobe::reset();
        std::string const path = tree_.addMI(c.module);
        ictest::LogCapture cap;
        expectError(load(), 1, IC::Number(1u), "No MIs were loaded");
        std::string message = c.message;
        if (message.find("{path}") != std::string::npos)
            message.replace(message.find("{path}"), 6, path);
        ictest::expectEvent(cap, kMI, message, 6000, c.function);
        EXPECT_TRUE(counter_ == 7 && toLoad_.empty() && libs_.empty() && mis_.empty());
        EXPECT_EQ(ictestprobe::liveImages(), 0);
        EXPECT_EQ(count(std::string(c.module) + ":release"), 0u);
        EXPECT_EQ(ictestprobe::mis().size(), c.madeObject ? 1u : 0u);
        ictest::fs::remove(path);
    }
}

// An exception from getMap leaves the result a success, so there is no
// failure report for it; known nodes pass silently (status 6).
TEST_F(MIControlTest, AnInterfaceWhoseMapCannotBeReadIsKept)
{
    for (char const* m : {"mi_alpha", "mi_mapfails", "mi_mapthrows"})
        tree_.addMI(m);
    ictest::LogCapture cap;
    expectError(load(), 0);
    ictest::expectEvent(cap, kMI, "MIControl MI getMap() Failed: " + err(9, "mi map refused"), 6000, "diagError");
    ictest::expectEvent(cap, kMI, "MIControl MI getMap(): " + err(9, "mi map refused"), 6000, "diagError");
    ictest::expectEvent(cap, kMI, std::string("getMINodeSensors getMap(): Exception map exploded Type=") +
                                      typeid(std::runtime_error).name(), 6000, "getMINodeSensors");
    EXPECT_EQ(cap.logs(kLogMI).size(), 9u) << "two progress lines each and the three above";
    EXPECT_EQ(mis_.size(), 3u);
    cap.clear();
    EXPECT_EQ(IC::MIControl().getMINodeSensors(mis_[0], store_).getStatus(), 6);
    EXPECT_TRUE(cap.logs(kLogMI).empty());
}

// ---- reload ----

class ReloadMIs : public MIControlTest {
protected:
    // alpha and beta loaded by a first reload, in name order, which tells
    // nobody; then fp_two.
    void SetUp() override
    {
        MIControlTest::SetUp();
        betaPath_ = tree_.addMI("mi_beta");
        alphaPath_ = tree_.addMI("mi_alpha");
        ASSERT_EQ(reload().getStatus(), 0);
        ASSERT_EQ(recs(libs_), (Strings{"mi_alpha.so 7", "mi_beta.so 8"}));
        tree_.addFP("fp_two");
        loadFPs();
        ASSERT_TRUE(fps_.size() == 1u && ictest::Recorder::get().calls().empty());
    }
    void loadFPs(std::set<std::string> const& skip = {})
    {
        auto found = ictest::discover(tree_.fpDir(), skip);
        IC::NodeStore unused;
        IC::FPControl().myloadFPs(counter_, fplibs_, fps_, unused, ictest::makeServices(mis_, nullptr), found);
    }
    std::string alphaPath_, betaPath_;
};

// A removal releases without shutdown; the FPs are told, and their nodes new
// to the store announced as one batch without context. A renamed library is
// one removal and one addition with a new number.
TEST_F(ReloadMIs, ChangesAreToldToTheFPsAndTheirNewNodesAnnouncedOnce)
{
    auto const beta = mi("mi_beta");
    ictest::fs::remove(betaPath_);
    ictest::LogCapture cap;
    expectError(reload(), 0);
    ictest::expectInOrder(ictestprobe::events(), {"mi_beta:release", "mi_beta:image unloaded",
                                                  "fp_two:updatedMis added=0 removed=1", "fp_two:getMap"});
    EXPECT_EQ(count("mi_beta:shutdown"), 0u);
    EXPECT_EQ(recs(libs_), Strings{"mi_alpha.so 7"});
    EXPECT_EQ(mis_.size(), 1u);
    auto fp = ictest::fp("fp_two");
    EXPECT_TRUE(fp.lastAdded.empty() && fp.lastRemoved == MIs{object(beta)});
    auto const calls = ictest::Recorder::get().calls();
    ASSERT_EQ(calls.size(), 1u);
    EXPECT_EQ(calls[0].context, nullptr);
    Strings want;
    for (IC::Node* n : fp.nodes)
        want.push_back(ictest::sig(IC::Alert(3, IC::Alert::NodeArrival, {store_.getNodePath(n)},
                                              n->getNodeNumber(), "MIControl")));
    EXPECT_EQ(ictest::sigs(calls[0].alerts), want);
    EXPECT_EQ(want.size(), 2u);
    std::vector<IC::Node*> listed;
    store_.getMap(listed);
    EXPECT_EQ(listed, fp.nodes);
    ictest::expectInOrder(ictest::timeline(cap), {"reloadMIs: FP updatedMis", "fp_two:updatedMis added=0 removed=1",
                                                  "reloadMIs: FP getMap", "reloadMIs: NodeStore::addNodeIfNew",
                                                  "reloadMIs: callback Alerts"});

    auto const oldAlpha = mi("mi_alpha");
    ictest::fs::rename(alphaPath_, tree_.miDir() + "/zz_alpha.so");
    cap.clear();
    expectError(reload(), 0);
    auto const newAlpha = mi("mi_alpha");
    EXPECT_TRUE(newAlpha.base == 10u << 16 && counter_ == 11 && count("mi_alpha:release") == 1u);
    EXPECT_EQ(recs(libs_), Strings{"zz_alpha.so 10"});
    EXPECT_EQ(libs_[0].plugin, newAlpha.object);
    fp = ictest::fp("fp_two");
    EXPECT_TRUE(fp.lastAdded == MIs{object(newAlpha)} && fp.lastRemoved == MIs{object(oldAlpha)});
    EXPECT_EQ(ictest::Recorder::get().calls().size(), 1u) << "known nodes are not announced again";
    for (auto const& r : cap.logs(kLogMI))
        EXPECT_LT(r.level, 6000) << r.message;
}

// An FP whose update fails is not asked for nodes; the others are still
// visited, and a refused announcement counts too.
TEST_F(ReloadMIs, FPsThatFailToUpdateOrMapAndRefusedAnnouncementsAreCounted)
{
    tree_.addFP("fp_updatefails");
    tree_.addFP("fp_mapfails");
    loadFPs({"fp_two.so"});
    ASSERT_EQ(fps_.size(), 3u);
    IC::Error const refused(1, IC::Number(99u), "not now");
    ictest::Recorder::get().reset(refused);
    tree_.addMI("mi_gamma");
    ictest::LogCapture cap;
    expectError(reload(), 1, IC::Number(3u));
    for (char const* fp : {"fp_two", "fp_updatefails", "fp_mapfails"})
        EXPECT_EQ(count(std::string(fp) + ":updatedMis added=1 removed=0"), 1u) << fp;
    EXPECT_EQ(count("fp_updatefails:getMap"), 0u);
    ictest::expectEvent(cap, kMI, "MIControl FP getMap(): " + err(12, "fp map refused"), 6000, "diagError");
    EXPECT_EQ(cap.count(kLogMI, 6000, "MIControl Throw Load Alerts: " + ictest::errText(refused)), 1u);
    ASSERT_EQ(ictest::Recorder::get().calls().size(), 1u);
    EXPECT_EQ(ictest::Recorder::get().calls()[0].alerts.size(), 2u) << "fp_two's nodes only";
}

// A file replaced under a loaded name is not reloaded, and the scan's
// second handles are closed again. Without FPs a change ends in success,
// without alerts or the end line. When no interface is left, the reload
// fails before telling the FPs.
TEST_F(ReloadMIs, WhenNothingChangesOrNobodyIsLeftNobodyIsTold)
{
    ictest::fs::remove(alphaPath_);
    tree_.install(tree_.miDir(), "mi_gamma", "mi_alpha.so");
    ictestprobe::reset();
    ictest::LogCapture cap;
    expectError(reload(), 0);
    EXPECT_EQ(cap.messages(kLogMI), (Strings{" MIControl reLoadMIs:", "MIControl reLoadMis End"}));
    ictest::expectEvent(cap, kMI, "MIControl reLoadMis End", 3000, "reLoadMIs");
    EXPECT_TRUE(counter_ == 10 && ictestprobe::events().size() == 2u && ictestprobe::liveImages() == 3)
        << "only mi_gamma's image came and went";
    std::vector<IC::FunctionalPlugIn*> none;
    std::swap(fps_, none);
    ictest::fs::remove(alphaPath_);
    cap.clear();
    expectError(reload(), 0);
    std::swap(fps_, none);
    EXPECT_EQ(cap.count(kLogMI, 3000, "MIControl reLoadMis End"), 0u);
    ictest::fs::remove(betaPath_);
    tree_.addMI("mi_code");
    expectError(reload(), 1, IC::Number(1u), "No MIs were loaded");
    EXPECT_EQ(count("mi_alpha:release") + count("mi_beta:release"), 2u);
    EXPECT_TRUE(mis_.empty() && libs_.empty() && ictestprobe::eventsWithPrefix("fp_two:updatedMis").empty());
    EXPECT_TRUE(ictest::Recorder::get().calls().empty());
}

} // namespace
