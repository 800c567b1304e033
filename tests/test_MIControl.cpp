// Management-interface loading, removal and reload (IC::MIControl), driven
// directly with local lists and a local node store, against real plug-ins.
#include <IC/FPControl.h>
#include <IC/LoadControl.h>
#include <IC/MIControl.h>
#include <IC/NodeStore.h>
#include <SD/PlatformUtilities.h>

#include "PluginTest.h"

#include <ostream>
#include <typeinfo>

namespace {

using ictest::errText;
using ictest::expectError;
using ictest::findLog;
using ictest::kLogMI;
using ictest::mi;
using ictest::recs;
using ictestprobe::count;
using ictestprobe::MIRecord;
using Strings = std::vector<std::string>;

IC::Number const kIV(IC::Version2{1, 0});
IC::Number const kMV(IC::Version2{2, 3});
int const kContext = 0; // stands for the facade
std::string const kRuntimeError = typeid(std::runtime_error).name();

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
        for (auto& r : fplibs_)
            SD::PlatformUtilities::unloadLibrary(r.handle);
        for (auto& r : libs_)
            SD::PlatformUtilities::unloadLibrary(r.handle);
        EXPECT_EQ(ictestprobe::liveImages(), 0) << "every library the loader opened is closed again";
    }

    IC::Error load(std::vector<IC::libstruct>& toLoad)
    {
        return IC::MIControl().myloadMIs(counter_, libs_, mis_, &ictest::recAlert, toLoad, kIV, kMV, store_,
                                         &ictest::recArrival, &kContext, &ictest::recLookup);
    }
    IC::Error reload()
    {
        return IC::MIControl().reLoadMIs(counter_, libs_, mis_, &ictest::recAlert, fps_, kIV, kMV, store_, names_,
                                         &ictest::recArrival, &kContext, &ictest::recLookup);
    }
    // Functional plug-ins from the FP directory, for the reload's FP part.
    void loadFPs(std::set<std::string> const& skip = {})
    {
        auto found = ictest::discover(tree_.fpDir(), skip);
        std::sort(found.begin(), found.end(), &IC::FP_CONTROL::libLT);
        IC::NodeStore unused;
        IC::FPControl().myloadFPs(counter_, fplibs_, fps_, unused, ictest::makeServices(mis_, nullptr), found);
    }

    ictest::TempTree tree_;
    ictest::EnvGuard miEnv_{"IC_MI_DIR", tree_.miDir()}, fpEnv_{"IC_FP_DIR", tree_.fpDir()};
    unsigned short counter_ = 7;
    std::vector<IC::libstruct> libs_, fplibs_;
    std::vector<IC::ManagementInterface*> mis_;
    std::vector<IC::FunctionalPlugIn*> fps_;
    std::set<std::string> names_;
    IC::NodeStore store_;
};

TEST_F(MIControlTest, LoadsAnInterfaceWithItsCallbacksInOrder)
{
    std::vector<IC::libstruct> none;
    expectError(load(none), 0);
    EXPECT_EQ(counter_, 7) << "an empty list loads nothing";
    std::string const path = tree_.addMI("mi_alpha");
    auto toLoad = ictest::discover(tree_.miDir());
    ASSERT_EQ(toLoad.size(), 1u);
    SD::_LibraryHandle* const handle = toLoad[0].handle;
    ictest::LogCapture cap;
    expectError(load(toLoad), 0);
    std::string const init = "mi_alpha:Initialize base=458752 iv=1.0 mv=2.3";
    EXPECT_EQ(ictest::callsOf("mi_alpha"), (Strings{"mi_alpha:OpenMI", "mi_alpha:registerNodeCallBacks", init,
                                                    "mi_alpha:registerForAlerts", "mi_alpha:getMap"}));
    MIRecord const r = mi("mi_alpha");
    EXPECT_TRUE(r.arrival == &ictest::recArrival && r.arrivalContext == &kContext && r.lookup == &ictest::recLookup);
    EXPECT_EQ(r.alert, &ictest::recAlert);
    EXPECT_EQ(r.alertContext, r.object) << "alerts come back with the interface as context";
    EXPECT_EQ(r.base, 7u << 16);
    EXPECT_EQ(counter_, 8);
    EXPECT_EQ(mis_, std::vector<IC::ManagementInterface*>{static_cast<IC::ManagementInterface*>(
                        const_cast<void*>(r.object))});
    ASSERT_EQ(libs_.size(), 1u);
    for (IC::libstruct const* l : {&libs_[0], &toLoad.at(0)}) {
        EXPECT_TRUE(l->handle == handle && l->path == path && l->plugin == r.object);
        EXPECT_EQ(recs({*l}), Strings{"mi_alpha.so 7"});
    }
    // Its nodes are in the store by id, but not in the get map.
    for (unsigned int n = 1; n <= 4; ++n) {
        IC::Node* node = nullptr;
        EXPECT_EQ(store_.getNode(r.base | n, &node).getStatus(), 0) << n;
        EXPECT_EQ(node, r.nodes[n - 1]);
    }
    std::vector<IC::Node*> listed;
    store_.getMap(listed);
    EXPECT_TRUE(listed.empty());
    // The two progress lines stand around the plug-in's Initialize.
    ictest::expectInOrder(ictest::timeline(cap),
                          {"myloadMIs: " + path + " Initialize", init, "myloadMIs: " + path + " Initialize Done"});
    for (std::string const line : {" Initialize", " Initialize Done"})
        ictest::expectEvent(cap, {kLogMI, "MIControl"}, "myloadMIs: " + path + line, 3000, "myloadMIs");
    EXPECT_EQ(cap.logs(kLogMI).size(), 2u);
}

// ---- one failing library ----

struct Failure {
    std::string module;
    std::string message; // the level-6000 line; {path} stands for the library's path
    std::string function;
    bool madeObject; // the entry point handed out an object (which is then abandoned)
};

// Names the case in test output instead of dumping its bytes.
void PrintTo(Failure const& f, std::ostream* os)
{
    *os << f.module;
}

class MIFailure : public MIControlTest, public testing::WithParamInterface<Failure> {};

TEST_P(MIFailure, IsLoggedUnloadedAndCounted)
{
    Failure const& f = GetParam();
    std::string const path = tree_.addMI(f.module);
    auto toLoad = ictest::discover(tree_.miDir());
    ASSERT_EQ(ictestprobe::liveImages(), 1);
    ictest::LogCapture cap;
    IC::Error const e = load(toLoad);
    std::string message = f.message;
    if (message.find("{path}") != std::string::npos)
        message.replace(message.find("{path}"), 6, path);
    ictest::expectEvent(cap, {kLogMI, "MIControl"}, message, 6000, f.function);
    // Nothing else is loaded, so the whole load failed.
    expectError(e, 1, IC::Number(1u), "No MIs were loaded");
    EXPECT_EQ(cap.count(kLogMI, 6000, "myloadMIs count of MIs that did not load 1"), 1u);
    EXPECT_EQ(counter_, 7);
    EXPECT_TRUE(toLoad.empty() && libs_.empty() && mis_.empty());
    // The library is closed (an abandoned object went with it, unreleased).
    EXPECT_EQ(ictestprobe::liveImages(), 0);
    EXPECT_FALSE(ictest::isMapped(path));
    EXPECT_EQ(count(f.module + ":image unloaded"), 1u);
    EXPECT_EQ(count(f.module + ":release"), 0u);
    EXPECT_EQ(ictestprobe::mis().size(), f.madeObject ? 1u : 0u);
}

INSTANTIATE_TEST_SUITE_P(
    EveryWayToFail, MIFailure,
    testing::Values(
        Failure{"mi_noentry", "myloadMIs: {path} OpenMI() function is missing.", "myloadMIs", false},
        Failure{"mi_code", "myloadMIs: {path} OpenMI failed code=X", "myloadMIs", false},
        Failure{"mi_nullerror", "myloadMIs: {path} Pointer to Error is NULL", "myloadMIs", true},
        Failure{"mi_errstatus", "OpenMI() failed: " + errText(IC::Error(1, IC::Number(7u), "mi refused")),
                "diagError", true},
        Failure{"mi_nullobject", "myloadMIs: {path} OpenMI pointer to MI is NULL", "myloadMIs", false},
        Failure{"mi_initfails", "MI Initialize: " + errText(IC::Error(1, IC::Number(3u), "mi init refused")),
                "diagError", true},
        Failure{"mi_regfails",
                "MIControl MI registerForAlerts: " + errText(IC::Error(1, IC::Number(4u), "mi alerts refused")),
                "diagError", true},
        Failure{"mi_throwopen", "myloadMIs: Exception open exploded Type=" + kRuntimeError + " for {path}",
                "myloadMIs", false},
        Failure{"mi_throwinit", "myloadMIs: Exception init exploded Type=" + kRuntimeError + " for {path}",
                "myloadMIs", true},
        Failure{"mi_throwint", "myloadMIs: {path} Exception loading library", "myloadMIs", true}),
    [](testing::TestParamInfo<Failure> const& info) { return info.param.module; });

TEST_F(MIControlTest, AFailingInitializeStillLogsItsDoneLineAndStops)
{
    std::string const path = tree_.addMI("mi_initfails");
    auto toLoad = ictest::discover(tree_.miDir());
    ictest::LogCapture cap;
    load(toLoad);
    ictest::expectInOrder(ictest::timeline(cap),
                          {"myloadMIs: " + path + " Initialize Done",
                           "MI Initialize: " + errText(IC::Error(1, IC::Number(3u), "mi init refused"))});
    EXPECT_EQ(ictest::callsOf("mi_initfails"), (Strings{"mi_initfails:OpenMI", "mi_initfails:registerNodeCallBacks",
                                                        "mi_initfails:Initialize base=458752 iv=1.0 mv=2.3"}));
}

TEST_F(MIControlTest, AnInterfaceWhoseMapCannotBeReadIsKept)
{
    tree_.addMI("mi_mapfails");
    tree_.addMI("mi_mapthrows");
    auto toLoad = ictest::discover(tree_.miDir());
    ictest::LogCapture cap;
    expectError(load(toLoad), 0);
    IC::Error const refused(1, IC::Number(9u), "mi map refused");
    EXPECT_EQ(cap.count(kLogMI, 6000, "MIControl MI getMap() Failed: " + errText(refused)), 1u);
    EXPECT_EQ(cap.count(kLogMI, 6000, "MIControl MI getMap(): " + errText(refused)), 1u);
    // An exception leaves the result a success, so there is no failure report.
    ictest::expectEvent(cap, {kLogMI, "MIControl"}, "getMINodeSensors getMap(): Exception map exploded Type=" +
                        kRuntimeError, 6000, "getMINodeSensors");
    EXPECT_EQ(cap.logs(kLogMI).size(), 7u) << "two progress lines each and the three above";
    EXPECT_EQ(recs(libs_), (Strings{"mi_mapfails.so 7", "mi_mapthrows.so 8"}));
    EXPECT_EQ(mis_.size() + toLoad.size(), 4u);
    EXPECT_EQ(counter_, 9);
}

TEST_F(MIControlTest, OfThreeTheSecondFailsAndTheOthersTakeConsecutiveNumbers)
{
    tree_.addMI("mi_alpha", "a1.so");
    tree_.addMI("mi_initfails", "a2.so");
    tree_.addMI("mi_beta", "a3.so");
    counter_ = 3;
    auto toLoad = ictest::discover(tree_.miDir());
    ASSERT_EQ(toLoad.size(), 3u);
    ictest::LogCapture cap;
    expectError(load(toLoad), 0, IC::Number(1u), "Count of MIs that did not load");
    EXPECT_EQ(cap.count(kLogMI, 6000, "myloadMIs count of MIs that did not load 1"), 1u);
    EXPECT_EQ(mi("mi_alpha").base, 3u << 16);
    EXPECT_EQ(mi("mi_beta").base, 4u << 16);
    EXPECT_EQ(counter_, 5);
    EXPECT_EQ(recs(toLoad), (Strings{"a1.so 3", "a3.so 4"}));
    EXPECT_EQ(recs(libs_), (Strings{"a1.so 3", "a3.so 4"}));
    ASSERT_EQ(mis_.size(), 2u);
    EXPECT_TRUE(mis_[0] == mi("mi_alpha").object && mis_[1] == mi("mi_beta").object);
    EXPECT_FALSE(ictest::isMapped(tree_.miDir() + "/a2.so"));

    // With interfaces loaded, later failures are only counted.
    std::string const bad1 = tree_.addMI("mi_code"), bad2 = tree_.addMI("mi_noentry");
    auto fresh = ictest::discover(tree_.miDir(), {"a1.so", "a2.so", "a3.so"});
    ASSERT_EQ(fresh.size(), 2u);
    cap.clear();
    expectError(load(fresh), 0, IC::Number(2u), "Count of MIs that did not load");
    EXPECT_EQ(cap.count(kLogMI, 6000, "myloadMIs count of MIs that did not load 2"), 1u);
    EXPECT_TRUE(fresh.empty());
    EXPECT_EQ(mis_.size(), 2u);
    EXPECT_EQ(counter_, 5);
    EXPECT_FALSE(ictest::isMapped(bad1) || ictest::isMapped(bad2));
}

TEST_F(MIControlTest, NodeIntakeTakesEveryNodeAndReportsTheLastResult)
{
    tree_.addMI("mi_alpha");
    auto toLoad = ictest::discover(tree_.miDir());
    ASSERT_EQ(load(toLoad).getStatus(), 0);
    IC::NodeStore other;
    ictest::LogCapture cap;
    expectError(IC::MIControl().getMINodeSensors(mis_[0], other), 0);
    for (IC::Node* n : mi("mi_alpha").nodes) {
        IC::Node* found = nullptr;
        EXPECT_EQ(other.getNode(n->getNodeId(), &found).getStatus(), 0);
        EXPECT_EQ(found, n);
    }
    // Again: every node is known now, which passes silently as status 6.
    EXPECT_EQ(IC::MIControl().getMINodeSensors(mis_[0], other).getStatus(), 6);
    EXPECT_TRUE(cap.logs(kLogMI).empty());
}

TEST_F(MIControlTest, DeleteReleasesTheInterfaceAndClosesItsLibrary)
{
    std::string const alpha = tree_.addMI("mi_alpha"), beta = tree_.addMI("mi_beta"), gamma = tree_.addMI("mi_gamma");
    auto toLoad = ictest::discover(tree_.miDir());
    ASSERT_EQ(load(toLoad).getStatus(), 0);
    auto* const gammaMI = mis_[2];
    ictest::LogCapture cap;
    // Only a full path identifies a record, not a bare name.
    IC::MIControl().deleteMI(libs_, tree_.miDir() + "/mi_delta.so", mis_);
    IC::MIControl().deleteMI(libs_, "mi_alpha.so", mis_);
    EXPECT_EQ(cap.count(kLogMI, 6000, "deleteMI: MI removal error."), 2u);
    EXPECT_EQ(findLog(cap, kLogMI, "deleteMI: MI removal error.").function, "deleteMI");
    EXPECT_EQ(mis_.size(), 3u);
    EXPECT_EQ(count("mi_alpha:release"), 0u);
    cap.clear();
    IC::MIControl().deleteMI(libs_, alpha, mis_);
    EXPECT_TRUE(cap.logs(kLogMI).empty());
    // An interface missing from the list still goes, with a report.
    mis_.erase(mis_.begin());
    IC::MIControl().deleteMI(libs_, beta, mis_);
    EXPECT_EQ(cap.messages(kLogMI), Strings{"deleteMI: MI not found in MI vector."});
    // shutdown() belongs to the unload, not to a removal; the interface is
    // released before its library goes.
    ictest::expectInOrder(ictestprobe::events(), {"mi_alpha:release", "mi_alpha:image unloaded", "mi_beta:release",
                                                  "mi_beta:image unloaded"});
    EXPECT_EQ(count("mi_alpha:shutdown") + count("mi_beta:shutdown"), 0u);
    EXPECT_EQ(mis_, std::vector<IC::ManagementInterface*>{gammaMI});
    EXPECT_EQ(recs(libs_), Strings{"mi_gamma.so 9"});
    EXPECT_FALSE(ictest::isMapped(alpha) || ictest::isMapped(beta));
}

// ---- reload ----

class ReloadMIs : public MIControlTest {
protected:
    // alpha and beta loaded by a first reload, with no FPs yet; then fp_two.
    void SetUp() override
    {
        MIControlTest::SetUp();
        alphaPath_ = tree_.addMI("mi_alpha");
        betaPath_ = tree_.addMI("mi_beta");
        ASSERT_EQ(reload().getStatus(), 0);
        ASSERT_EQ(recs(libs_), (Strings{"mi_alpha.so 7", "mi_beta.so 8"})) << "in name order";
        EXPECT_TRUE(ictest::Recorder::get().calls().empty()) << "nobody was told";
        tree_.addFP("fp_two");
        loadFPs();
        ASSERT_EQ(fps_.size(), 1u);
    }
    std::string alphaPath_, betaPath_;
};

TEST_F(ReloadMIs, AnUnchangedDirectoryChangesNothing)
{
    ictestprobe::reset();
    ictest::LogCapture cap;
    expectError(reload(), 0);
    EXPECT_EQ(cap.messages(kLogMI), (Strings{" MIControl reLoadMIs:", "MIControl reLoadMis End"}));
    EXPECT_EQ(cap.count(kLogMI, 3000, "MIControl reLoadMis End"), 1u);
    EXPECT_EQ(libs_.size() + mis_.size(), 4u);
    EXPECT_EQ(counter_, 10);
    // Nothing was created, released, or told; the scan's second handles were
    // closed, so only the loaded instances keep the images mapped.
    EXPECT_TRUE(ictestprobe::mis().empty());
    EXPECT_TRUE(ictestprobe::events().empty());
    EXPECT_EQ(ictestprobe::liveImages(), 3);
}

TEST_F(ReloadMIs, ARemovedLibraryIsReleasedTheFPsToldAndTheirNewNodesAnnounced)
{
    void const* const beta = mi("mi_beta").object;
    ictest::fs::remove(betaPath_);
    ictest::LogCapture cap;
    expectError(reload(), 0);
    EXPECT_EQ(count("mi_beta:release"), 1u);
    EXPECT_EQ(count("mi_beta:shutdown"), 0u);
    EXPECT_FALSE(ictest::isMapped(betaPath_));
    EXPECT_EQ(recs(libs_), Strings{"mi_alpha.so 7"});
    EXPECT_EQ(mis_.size(), 1u);
    auto const fp = ictest::fp("fp_two");
    EXPECT_EQ(fp.updates, 1);
    EXPECT_TRUE(fp.lastAdded.empty());
    EXPECT_EQ(fp.lastRemoved, std::vector<IC::ManagementInterface*>{static_cast<IC::ManagementInterface*>(
                                  const_cast<void*>(beta))});
    EXPECT_EQ(count("fp_two:updatedMis added=0 removed=1"), 1u);
    // The FP's nodes were new to the store: one announcement each, as one
    // batch with no context.
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
    ictest::expectInOrder(ictest::timeline(cap), {"reloadMIs: FP updatedMis", "reloadMIs: FP getMap",
                                                  "reloadMIs: NodeStore::addNodeIfNew", "reloadMIs: callback Alerts"});
    EXPECT_EQ(cap.count(kLogMI, 3000, "reloadMIs: NodeStore::addNodeIfNew"), 2u);
}

TEST_F(ReloadMIs, ARenamedLibraryIsOneRemovalAndOneAdditionWithANewNumber)
{
    void const* const oldAlpha = mi("mi_alpha").object;
    ictest::fs::rename(alphaPath_, tree_.miDir() + "/zz_alpha.so");
    expectError(reload(), 0);
    EXPECT_EQ(count("mi_alpha:release"), 1u);
    // A second object from the same library (it may reuse the first one's
    // address, so count records rather than compare pointers).
    std::vector<MIRecord> alphas;
    for (auto const& r : ictestprobe::mis())
        if (r.name == "mi_alpha")
            alphas.push_back(r);
    ASSERT_EQ(alphas.size(), 2u);
    EXPECT_TRUE(alphas[0].released && !alphas[1].released);
    EXPECT_EQ(alphas[1].base, 10u << 16);
    EXPECT_EQ(counter_, 11);
    EXPECT_EQ(recs(libs_), (Strings{"mi_beta.so 8", "zz_alpha.so 10"}));
    EXPECT_EQ(libs_[1].plugin, alphas[1].object);
    auto const fp = ictest::fp("fp_two");
    ASSERT_EQ(fp.lastAdded.size() + fp.lastRemoved.size(), 2u);
    EXPECT_TRUE(fp.lastAdded[0] == alphas[1].object && fp.lastRemoved[0] == oldAlpha);
}

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
    // An FP whose update fails is not asked for nodes; the others are still
    // visited.
    for (char const* fp : {"fp_two", "fp_updatefails", "fp_mapfails"})
        EXPECT_EQ(count(std::string(fp) + ":updatedMis added=1 removed=0"), 1u) << fp;
    EXPECT_EQ(count("fp_updatefails:getMap"), 0u);
    EXPECT_EQ(count("fp_two:getMap"), 1u);
    ictest::expectEvent(cap, {kLogMI, "MIControl"},
                        "MIControl FP getMap(): " + errText(IC::Error(1, IC::Number(12u), "fp map refused")), 6000,
                        "diagError");
    EXPECT_EQ(cap.count(kLogMI, 6000, "MIControl Throw Load Alerts: " + errText(refused)), 1u);
    ASSERT_EQ(ictest::Recorder::get().calls().size(), 1u);
    EXPECT_EQ(ictest::Recorder::get().calls()[0].alerts.size(), 2u) << "fp_two's nodes only";
    EXPECT_EQ(mis_.size(), 3u);
}

TEST_F(ReloadMIs, WithoutFPsAChangeEndsInSuccessWithoutAlerts)
{
    std::vector<IC::FunctionalPlugIn*> none;
    std::swap(fps_, none);
    ictest::fs::remove(alphaPath_);
    tree_.addMI("mi_gamma");
    ictest::LogCapture cap;
    expectError(reload(), 0);
    std::swap(fps_, none);
    EXPECT_EQ(cap.count(kLogMI, 3000, "MIControl reLoadMis End"), 0u);
    EXPECT_TRUE(ictest::Recorder::get().calls().empty());
    EXPECT_EQ(count("mi_alpha:release"), 1u);
    EXPECT_TRUE(ictestprobe::findMI("mi_gamma", nullptr));
    EXPECT_EQ(mis_.size(), 2u);
}

TEST_F(ReloadMIs, WhenNoInterfaceIsLeftTheReloadStopsBeforeTellingTheFPs)
{
    ictest::fs::remove(alphaPath_);
    ictest::fs::remove(betaPath_);
    std::string const bad = tree_.addMI("mi_code");
    expectError(reload(), 1, IC::Number(1u), "No MIs were loaded");
    // The removals happened, the FPs heard nothing.
    EXPECT_EQ(count("mi_alpha:release") + count("mi_beta:release"), 2u);
    EXPECT_TRUE(mis_.empty() && libs_.empty());
    EXPECT_TRUE(ictestprobe::eventsWithPrefix("fp_two:updatedMis").empty());
    EXPECT_FALSE(ictest::isMapped(bad));
}

TEST_F(ReloadMIs, AFileReplacedUnderTheSameNameIsNotReloaded)
{
    void const* const alpha = mi("mi_alpha").object;
    ictest::fs::remove(alphaPath_);
    tree_.install(tree_.miDir(), "mi_gamma", "mi_alpha.so");
    expectError(reload(), 0);
    EXPECT_EQ(mi("mi_alpha").object, alpha);
    EXPECT_EQ(count("mi_alpha:release"), 0u);
    EXPECT_EQ(ictestprobe::mis().size(), 2u);
    EXPECT_FALSE(ictestprobe::findMI("mi_gamma", nullptr));
}

} // namespace
