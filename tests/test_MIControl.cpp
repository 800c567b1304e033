// Management-interface loading, removal and reload (IC::MIControl), driven
// directly with local lists and a local node store, against real plug-ins.
#include <IC/FPControl.h>
#include <IC/LoadControl.h>
#include <IC/MIControl.h>
#include <IC/NodeStore.h>
#include <SD/PlatformUtilities.h>

#include "PluginTest.h"
#include "Recorders.h"

#include <gtest/gtest.h>

#include <ostream>
#include <set>
#include <stdexcept>
#include <string>
#include <typeinfo>
#include <vector>

namespace {

using ictest::countLog;
using ictest::errText;
using ictest::findLog;
using ictest::kLogMI;
using ictestprobe::MIRecord;

IC::Number const kIV(IC::Version2{1, 0});
IC::Number const kMV(IC::Version2{2, 3});
int const kContext = 0; // stands for the facade

// Events a plug-in recorded about the loader's calls (not its image's).
std::vector<std::string> callsOf(std::string const& name)
{
    std::vector<std::string> out;
    for (auto const& e : ictestprobe::eventsWithPrefix(name + ":"))
        if (e.find(":image ") == std::string::npos)
            out.push_back(e);
    return out;
}

MIRecord mi(std::string const& name)
{
    MIRecord r;
    EXPECT_TRUE(ictestprobe::findMI(name, &r)) << name;
    return r;
}

class MIControlTest : public testing::Test {
protected:
    MIControlTest() : miEnv_("IC_MI_DIR", tree_.miDir()), fpEnv_("IC_FP_DIR", tree_.fpDir()) {}

    void SetUp() override
    {
        ictestprobe::reset();
        ictest::Recorder::get().reset();
    }
    void TearDown() override
    {
        for (auto& r : fplibs_) {
            static_cast<IC::FunctionalPlugIn*>(r.plugin)->release();
            SD::PlatformUtilities::unloadLibrary(r.handle);
        }
        for (auto& r : libs_) {
            static_cast<IC::ManagementInterface*>(r.plugin)->release();
            SD::PlatformUtilities::unloadLibrary(r.handle);
        }
        closeAll(pending_);
        // Every library the loader opened has been closed again.
        EXPECT_EQ(ictestprobe::liveImages(), 0);
    }

    static void closeAll(std::vector<IC::libstruct>& v)
    {
        for (auto& r : v)
            SD::PlatformUtilities::unloadLibrary(r.handle);
        v.clear();
    }

    // The MI directory as discovery sees it.
    std::vector<IC::libstruct> discover()
    {
        std::vector<IC::libstruct> found;
        std::set<std::string> names;
        IC::LoadControl().findLibs(tree_.miDir(), found, names);
        return found;
    }

    IC::Error load(std::vector<IC::libstruct>& toLoad)
    {
        return IC::MIControl().myloadMIs(counter_, libs_, mis_, &ictest::recAlert, toLoad, kIV,
                                         kMV, store_, &ictest::recArrival, &kContext,
                                         &ictest::recLookup);
    }

    IC::Error reload()
    {
        return IC::MIControl().reLoadMIs(counter_, libs_, mis_, &ictest::recAlert, fps_, kIV, kMV,
                                         store_, names_, &ictest::recArrival, &kContext,
                                         &ictest::recLookup);
    }

    // Functional plug-ins from the FP directory, for the reload's FP part.
    void loadFPs()
    {
        std::vector<IC::libstruct> found;
        IC::LoadControl().findLibs(tree_.fpDir(), found, names_);
        std::sort(found.begin(), found.end(), &IC::FP_CONTROL::libLT);
        IC::ICforFP const services = ictest::makeServices(mis_, nullptr);
        IC::NodeStore unused;
        IC::FPControl().myloadFPs(counter_, fplibs_, fps_, unused, services, found);
    }

    ictest::TempTree tree_;
    ictest::EnvGuard miEnv_;
    ictest::EnvGuard fpEnv_;
    unsigned short counter_ = 7;
    std::vector<IC::libstruct> libs_;
    std::vector<IC::ManagementInterface*> mis_;
    std::vector<IC::libstruct> fplibs_;
    std::vector<IC::FunctionalPlugIn*> fps_;
    std::vector<IC::libstruct> pending_;
    std::set<std::string> names_;
    IC::NodeStore store_;
};

TEST_F(MIControlTest, LoadsAnInterfaceWithItsCallbacksInOrder)
{
    std::string const path = tree_.addMI("mi_alpha");
    auto toLoad = discover();
    ASSERT_EQ(toLoad.size(), 1u);
    SD::_LibraryHandle* const handle = toLoad[0].handle;

    ictest::LogCapture cap;
    IC::Error const e = load(toLoad);
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getCode(), IC::Number(IC::Number::Generic));
    EXPECT_EQ(e.getText(), "");

    unsigned int const base = 7u << 16;
    EXPECT_EQ(callsOf("mi_alpha"),
              (std::vector<std::string>{"mi_alpha:OpenMI", "mi_alpha:registerNodeCallBacks",
                                        "mi_alpha:Initialize base=458752 iv=1.0 mv=2.3",
                                        "mi_alpha:registerForAlerts", "mi_alpha:getMap"}));
    MIRecord const r = mi("mi_alpha");
    EXPECT_EQ(r.arrival, &ictest::recArrival);
    EXPECT_EQ(r.arrivalContext, &kContext);
    EXPECT_EQ(r.lookup, &ictest::recLookup);
    EXPECT_EQ(r.alert, &ictest::recAlert);
    // Alerts come back with the interface itself as their context.
    EXPECT_EQ(r.alertContext, r.object);
    EXPECT_EQ(r.base, base);

    EXPECT_EQ(counter_, 8);
    ASSERT_EQ(mis_.size(), 1u);
    EXPECT_EQ(static_cast<void const*>(mis_[0]), r.object);
    ASSERT_EQ(libs_.size(), 1u);
    EXPECT_EQ(libs_[0].handle, handle);
    EXPECT_EQ(libs_[0].path, path);
    EXPECT_EQ(libs_[0].name, "mi_alpha.so");
    EXPECT_EQ(libs_[0].plugin, r.object);
    EXPECT_EQ(libs_[0].idbase, base);
    ASSERT_EQ(toLoad.size(), 1u);
    EXPECT_EQ(toLoad[0].plugin, r.object);
    EXPECT_EQ(toLoad[0].idbase, base);

    // Its nodes are in the store by id, but not in the get map.
    for (unsigned int n = 1; n <= 4; ++n) {
        IC::Node* node = nullptr;
        EXPECT_EQ(store_.getNode(base | n, &node).getStatus(), 0) << n;
        EXPECT_EQ(node, r.nodes[n - 1]);
    }
    std::vector<IC::Node*> listed;
    store_.getMap(listed);
    EXPECT_TRUE(listed.empty());

    // The two progress lines stand around the plug-in's Initialize.
    auto const t = ictest::timeline(cap);
    long const before = ictest::indexOf(t, "myloadMIs: " + path + " Initialize");
    long const during = ictest::indexOf(t, "mi_alpha:Initialize base=458752 iv=1.0 mv=2.3");
    long const after = ictest::indexOf(t, "myloadMIs: " + path + " Initialize Done");
    EXPECT_GE(before, 0);
    EXPECT_LT(before, during);
    EXPECT_LT(during, after);
    auto const rec = findLog(cap, kLogMI, "myloadMIs: " + path + " Initialize");
    EXPECT_EQ(rec.level, 3000);
    EXPECT_EQ(rec.function, "myloadMIs");
    EXPECT_EQ(rec.file, "MIControl");
    EXPECT_EQ(findLog(cap, kLogMI, "myloadMIs: " + path + " Initialize Done").level, 3000);
    for (auto const& l : ictest::logsOf(cap, kLogMI))
        EXPECT_NE(l.level, 6000) << l.message;
}

TEST_F(MIControlTest, AnEmptyListLoadsNothing)
{
    std::vector<IC::libstruct> none;
    ictest::LogCapture cap;
    IC::Error const e = load(none);
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getText(), "");
    EXPECT_EQ(counter_, 7);
    EXPECT_TRUE(libs_.empty());
    EXPECT_TRUE(mis_.empty());
    for (auto const& l : ictest::logsOf(cap, kLogMI))
        EXPECT_NE(l.level, 6000) << l.message;
}

// ---- one failing library ----

struct Failure {
    std::string module;
    // The level-6000 line that names the failure; {path} stands for the path.
    std::string message;
    std::string function;
    bool madeObject; // OpenMI handed out an object (which is then abandoned)
};

// Names the case in test output instead of dumping its bytes.
void PrintTo(Failure const& f, std::ostream* os)
{
    *os << f.module;
}

std::string withPath(std::string text, std::string const& path)
{
    auto const at = text.find("{path}");
    if (at != std::string::npos)
        text.replace(at, 6, path);
    return text;
}

class MIFailure : public MIControlTest, public testing::WithParamInterface<Failure> {};

TEST_P(MIFailure, IsLoggedUnloadedAndCounted)
{
    Failure const& f = GetParam();
    std::string const path = tree_.addMI(f.module);
    auto toLoad = discover();
    ASSERT_EQ(toLoad.size(), 1u);
    ASSERT_EQ(ictestprobe::liveImages(), 1);

    ictest::LogCapture cap;
    IC::Error const e = load(toLoad);

    auto const rec = findLog(cap, kLogMI, withPath(f.message, path));
    EXPECT_EQ(rec.level, 6000);
    EXPECT_EQ(rec.function, f.function);
    EXPECT_EQ(rec.file, "MIControl");

    // Nothing else is loaded, so the whole load failed.
    EXPECT_EQ(e.getStatus(), 1);
    EXPECT_EQ(e.getCode(), IC::Number(1u));
    EXPECT_EQ(e.getText(), "No MIs were loaded");
    EXPECT_EQ(countLog(cap, kLogMI, 6000, "myloadMIs count of MIs that did not load 1"), 1u);

    EXPECT_EQ(counter_, 7);
    EXPECT_TRUE(toLoad.empty());
    EXPECT_TRUE(libs_.empty());
    EXPECT_TRUE(mis_.empty());
    // The library is closed (an abandoned object went with it).
    EXPECT_EQ(ictestprobe::liveImages(), 0);
    EXPECT_FALSE(ictest::isMapped(path));
    EXPECT_EQ(ictestprobe::count(f.module + ":image unloaded"), 1u);
    // An object that failed half-way is not released by the loader.
    EXPECT_EQ(ictestprobe::count(f.module + ":release"), 0u);
    EXPECT_EQ(ictestprobe::mis().size(), f.madeObject ? 1u : 0u);
}

std::string const kRuntimeError = typeid(std::runtime_error).name();

INSTANTIATE_TEST_SUITE_P(
    EveryWayToFail, MIFailure,
    testing::Values(
        Failure{"mi_noentry", "myloadMIs: {path} OpenMI() function is missing.", "myloadMIs", false},
        Failure{"mi_code", "myloadMIs: {path} OpenMI failed code=X", "myloadMIs", false},
        Failure{"mi_nullerror", "myloadMIs: {path} Pointer to Error is NULL", "myloadMIs", true},
        Failure{"mi_errstatus",
                "OpenMI() failed: " + errText(IC::Error(1, IC::Number(7u), "mi refused")),
                "diagError", true},
        Failure{"mi_nullobject", "myloadMIs: {path} OpenMI pointer to MI is NULL", "myloadMIs",
                false},
        Failure{"mi_initfails",
                "MI Initialize: " + errText(IC::Error(1, IC::Number(3u), "mi init refused")),
                "diagError", true},
        Failure{"mi_regfails",
                "MIControl MI registerForAlerts: " +
                    errText(IC::Error(1, IC::Number(4u), "mi alerts refused")),
                "diagError", true},
        Failure{"mi_throwopen",
                "myloadMIs: Exception open exploded Type=" + kRuntimeError + " for {path}",
                "myloadMIs", false},
        Failure{"mi_throwinit",
                "myloadMIs: Exception init exploded Type=" + kRuntimeError + " for {path}",
                "myloadMIs", true},
        Failure{"mi_throwint", "myloadMIs: {path} Exception loading library", "myloadMIs", true}),
    [](testing::TestParamInfo<Failure> const& info) { return info.param.module; });

TEST_F(MIControlTest, AFailingInitializeStillLogsItsDoneLine)
{
    std::string const path = tree_.addMI("mi_initfails");
    auto toLoad = discover();
    ictest::LogCapture cap;
    load(toLoad);
    auto const t = ictest::timeline(cap);
    long const done = ictest::indexOf(t, "myloadMIs: " + path + " Initialize Done");
    long const diag = ictest::indexOf(
        t, "MI Initialize: " + errText(IC::Error(1, IC::Number(3u), "mi init refused")));
    EXPECT_GE(done, 0);
    EXPECT_LT(done, diag);
    EXPECT_EQ(callsOf("mi_initfails"),
              (std::vector<std::string>{"mi_initfails:OpenMI",
                                        "mi_initfails:registerNodeCallBacks",
                                        "mi_initfails:Initialize base=458752 iv=1.0 mv=2.3"}));
}

TEST_F(MIControlTest, AnInterfaceWhoseGetMapFailsIsKept)
{
    std::string const path = tree_.addMI("mi_mapfails");
    auto toLoad = discover();
    ictest::LogCapture cap;
    IC::Error const e = load(toLoad);
    IC::Error const refused(1, IC::Number(9u), "mi map refused");

    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getText(), "");
    EXPECT_EQ(countLog(cap, kLogMI, 6000, "MIControl MI getMap() Failed: " + errText(refused)), 1u);
    EXPECT_EQ(countLog(cap, kLogMI, 6000, "MIControl MI getMap(): " + errText(refused)), 1u);
    EXPECT_EQ(countLog(cap, kLogMI, 6000, "myloadMIs count of MIs that did not load 1"), 0u);
    EXPECT_EQ(counter_, 8);
    ASSERT_EQ(mis_.size(), 1u);
    ASSERT_EQ(libs_.size(), 1u);
    EXPECT_EQ(libs_[0].idbase, 7u << 16);
    EXPECT_EQ(toLoad.size(), 1u);
    EXPECT_TRUE(ictest::isMapped(path));
}

TEST_F(MIControlTest, AnExceptionFromGetMapIsLoggedAndTheInterfaceKept)
{
    tree_.addMI("mi_mapthrows");
    auto toLoad = discover();
    ictest::LogCapture cap;
    IC::Error const e = load(toLoad);
    EXPECT_EQ(e.getStatus(), 0);
    auto const rec = findLog(cap, kLogMI,
                             "getMINodeSensors getMap(): Exception map exploded Type=" + kRuntimeError);
    EXPECT_EQ(rec.level, 6000);
    EXPECT_EQ(rec.function, "getMINodeSensors");
    // The result stayed a success, so there is no failure report.
    for (auto const& l : ictest::logsOf(cap, kLogMI))
        EXPECT_EQ(l.message.find("MIControl MI getMap()"), std::string::npos) << l.message;
    EXPECT_EQ(mis_.size(), 1u);
    EXPECT_EQ(counter_, 8);
}

TEST_F(MIControlTest, OfThreeNewInterfacesTheSecondFailsAndTheOthersTakeConsecutiveNumbers)
{
    tree_.addMI("mi_alpha", "a1.so");
    tree_.addMI("mi_initfails", "a2.so");
    tree_.addMI("mi_beta", "a3.so");
    counter_ = 3;
    auto toLoad = discover();
    ASSERT_EQ(toLoad.size(), 3u);
    ASSERT_EQ(toLoad[1].name, "a2.so");

    ictest::LogCapture cap;
    IC::Error const e = load(toLoad);
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getCode(), IC::Number(1u));
    EXPECT_EQ(e.getText(), "Count of MIs that did not load");
    EXPECT_EQ(countLog(cap, kLogMI, 6000, "myloadMIs count of MIs that did not load 1"), 1u);

    EXPECT_EQ(mi("mi_alpha").base, 3u << 16);
    EXPECT_EQ(mi("mi_beta").base, 4u << 16);
    EXPECT_EQ(counter_, 5);
    ASSERT_EQ(toLoad.size(), 2u);
    EXPECT_EQ(toLoad[0].name, "a1.so");
    EXPECT_EQ(toLoad[1].name, "a3.so");
    ASSERT_EQ(libs_.size(), 2u);
    EXPECT_EQ(libs_[0].name, "a1.so");
    EXPECT_EQ(libs_[0].idbase, 3u << 16);
    EXPECT_EQ(libs_[1].name, "a3.so");
    EXPECT_EQ(libs_[1].idbase, 4u << 16);
    ASSERT_EQ(mis_.size(), 2u);
    EXPECT_EQ(static_cast<void const*>(mis_[0]), mi("mi_alpha").object);
    EXPECT_EQ(static_cast<void const*>(mis_[1]), mi("mi_beta").object);
    EXPECT_FALSE(ictest::isMapped(tree_.miDir() + "/a2.so"));
}

TEST_F(MIControlTest, FailuresWithEarlierInterfacesLoadedAreOnlyCounted)
{
    tree_.addMI("mi_alpha");
    auto first = discover();
    ASSERT_EQ(load(first).getStatus(), 0);

    std::string const bad1 = tree_.addMI("mi_code");
    std::string const bad2 = tree_.addMI("mi_noentry");
    std::vector<IC::libstruct> fresh;
    for (auto& r : discover())
        if (r.name == "mi_alpha.so")
            SD::PlatformUtilities::unloadLibrary(r.handle);
        else
            fresh.push_back(r);
    ASSERT_EQ(fresh.size(), 2u);

    ictest::LogCapture cap;
    IC::Error const e = load(fresh);
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getCode(), IC::Number(2u));
    EXPECT_EQ(e.getText(), "Count of MIs that did not load");
    EXPECT_EQ(countLog(cap, kLogMI, 6000, "myloadMIs count of MIs that did not load 2"), 1u);
    EXPECT_TRUE(fresh.empty());
    EXPECT_EQ(mis_.size(), 1u);
    EXPECT_EQ(counter_, 8);
    EXPECT_FALSE(ictest::isMapped(bad1));
    EXPECT_FALSE(ictest::isMapped(bad2));
}

TEST_F(MIControlTest, NodeIntakeTakesEveryNodeAndReportsTheLastResult)
{
    tree_.addMI("mi_alpha");
    auto toLoad = discover();
    ASSERT_EQ(load(toLoad).getStatus(), 0);

    IC::NodeStore other;
    ictest::LogCapture cap;
    IC::Error const first = IC::MIControl().getMINodeSensors(mis_[0], other);
    EXPECT_EQ(first.getStatus(), 0);
    for (IC::Node* n : mi("mi_alpha").nodes) {
        IC::Node* found = nullptr;
        EXPECT_EQ(other.getNode(n->getNodeId(), &found).getStatus(), 0);
        EXPECT_EQ(found, n);
    }
    // Again: every node is known now, which passes silently as status 6.
    IC::Error const again = IC::MIControl().getMINodeSensors(mis_[0], other);
    EXPECT_EQ(again.getStatus(), 6);
    for (auto const& l : ictest::logsOf(cap, kLogMI))
        EXPECT_NE(l.level, 6000) << l.message;
}

// ---- removal ----

class DeleteMI : public MIControlTest {
protected:
    void SetUp() override
    {
        MIControlTest::SetUp();
        alphaPath_ = tree_.addMI("mi_alpha");
        tree_.addMI("mi_beta");
        auto toLoad = discover();
        ASSERT_EQ(load(toLoad).getStatus(), 0);
        ASSERT_EQ(mis_.size(), 2u);
        alpha_ = mis_[0];
        beta_ = mis_[1];
    }
    std::string alphaPath_;
    IC::ManagementInterface* alpha_ = nullptr;
    IC::ManagementInterface* beta_ = nullptr;
};

TEST_F(DeleteMI, ReleasesTheInterfaceAndClosesItsLibrary)
{
    ictest::LogCapture cap;
    IC::MIControl().deleteMI(libs_, alphaPath_, mis_);
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    // shutdown() belongs to the unload, not to a removal.
    EXPECT_EQ(ictestprobe::count("mi_alpha:shutdown"), 0u);
    ASSERT_EQ(mis_.size(), 1u);
    EXPECT_EQ(mis_[0], beta_);
    ASSERT_EQ(libs_.size(), 1u);
    EXPECT_EQ(libs_[0].name, "mi_beta.so");
    EXPECT_FALSE(ictest::isMapped(alphaPath_));
    EXPECT_EQ(ictestprobe::count("mi_alpha:image unloaded"), 1u);
    // Released before its library went.
    auto const ev = ictestprobe::events();
    EXPECT_LT(ictest::indexOf(ev, "mi_alpha:release"), ictest::indexOf(ev, "mi_alpha:image unloaded"));
    for (auto const& l : ictest::logsOf(cap, kLogMI))
        EXPECT_NE(l.level, 6000) << l.message;
}

TEST_F(DeleteMI, AnUnknownPathChangesNothing)
{
    ictest::LogCapture cap;
    IC::MIControl().deleteMI(libs_, tree_.miDir() + "/mi_gamma.so", mis_);
    // Only a full path identifies a record, not a bare name.
    IC::MIControl().deleteMI(libs_, "mi_alpha.so", mis_);
    EXPECT_EQ(countLog(cap, kLogMI, 6000, "deleteMI: MI removal error."), 2u);
    EXPECT_EQ(findLog(cap, kLogMI, "deleteMI: MI removal error.").function, "deleteMI");
    EXPECT_EQ(mis_.size(), 2u);
    EXPECT_EQ(libs_.size(), 2u);
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 0u);
    EXPECT_TRUE(ictest::isMapped(alphaPath_));
}

TEST_F(DeleteMI, AnInterfaceMissingFromTheListStillGoes)
{
    mis_.erase(mis_.begin());
    ictest::LogCapture cap;
    IC::MIControl().deleteMI(libs_, alphaPath_, mis_);
    EXPECT_EQ(countLog(cap, kLogMI, 6000, "deleteMI: MI not found in MI vector."), 1u);
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    ASSERT_EQ(libs_.size(), 1u);
    EXPECT_EQ(libs_[0].name, "mi_beta.so");
    ASSERT_EQ(mis_.size(), 1u);
    EXPECT_EQ(mis_[0], beta_);
    EXPECT_FALSE(ictest::isMapped(alphaPath_));
}

// ---- reload ----

class ReloadMIs : public MIControlTest {
protected:
    // alpha and beta loaded by a first reload, with no FPs yet.
    void SetUp() override
    {
        MIControlTest::SetUp();
        alphaPath_ = tree_.addMI("mi_alpha");
        betaPath_ = tree_.addMI("mi_beta");
        ASSERT_EQ(reload().getStatus(), 0);
        ASSERT_EQ(mis_.size(), 2u);
    }

    std::vector<IC::Alert> sentAlerts()
    {
        std::vector<IC::Alert> out;
        for (auto const& c : ictest::Recorder::get().calls()) {
            EXPECT_EQ(c.context, nullptr);
            out.insert(out.end(), c.alerts.begin(), c.alerts.end());
        }
        return out;
    }

    std::string alphaPath_;
    std::string betaPath_;
};

TEST_F(ReloadMIs, TheFirstPassLoadsInNameOrderAndTellsNobody)
{
    EXPECT_EQ(libs_[0].name, "mi_alpha.so");
    EXPECT_EQ(libs_[1].name, "mi_beta.so");
    EXPECT_EQ(mi("mi_alpha").base, 7u << 16);
    EXPECT_EQ(mi("mi_beta").base, 8u << 16);
    EXPECT_EQ(counter_, 9);
    EXPECT_TRUE(ictest::Recorder::get().calls().empty());
}

TEST_F(ReloadMIs, AnUnchangedDirectoryChangesNothing)
{
    tree_.addFP("fp_two");
    loadFPs();
    ASSERT_EQ(fps_.size(), 1u);
    ictestprobe::reset();

    ictest::LogCapture cap;
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getCode(), IC::Number(IC::Number::Generic));
    EXPECT_EQ(countLog(cap, kLogMI, 3000, " MIControl reLoadMIs:"), 1u);
    EXPECT_EQ(countLog(cap, kLogMI, 3000, "MIControl reLoadMis End"), 1u);
    EXPECT_EQ(libs_.size(), 2u);
    EXPECT_EQ(mis_.size(), 2u);
    EXPECT_EQ(counter_, 10);
    // Nothing was created, released, or told.
    EXPECT_TRUE(ictestprobe::mis().empty());
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 0u);
    EXPECT_TRUE(ictestprobe::eventsWithPrefix("fp_two:").empty());
    // The scan's second handles were closed: the images stay mapped only by
    // the loaded instances (checked again when those are closed).
    EXPECT_EQ(ictestprobe::liveImages(), 3);
}

TEST_F(ReloadMIs, ARemovedLibraryIsReleasedAndTheFPsToldWithItsOldPointer)
{
    tree_.addFP("fp_two");
    loadFPs();
    void const* const beta = mi("mi_beta").object;
    ictestprobe::FPRecord fp;
    ASSERT_TRUE(ictestprobe::findFP("fp_two", &fp));

    ictest::TempTree::remove(betaPath_);
    ictest::LogCapture cap;
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(ictestprobe::count("mi_beta:release"), 1u);
    EXPECT_EQ(ictestprobe::count("mi_beta:shutdown"), 0u);
    EXPECT_FALSE(ictest::isMapped(betaPath_));
    ASSERT_EQ(mis_.size(), 1u);
    ASSERT_EQ(libs_.size(), 1u);
    EXPECT_EQ(libs_[0].name, "mi_alpha.so");

    ASSERT_TRUE(ictestprobe::findFP("fp_two", &fp));
    EXPECT_EQ(fp.updates, 1);
    EXPECT_TRUE(fp.lastAdded.empty());
    ASSERT_EQ(fp.lastRemoved.size(), 1u);
    EXPECT_EQ(static_cast<void const*>(fp.lastRemoved[0]), beta);
    EXPECT_EQ(ictestprobe::count("fp_two:updatedMis added=0 removed=1"), 1u);

    // The FP's nodes were new to the store: one announcement each, as a
    // batch with no context.
    auto const alerts = sentAlerts();
    ASSERT_EQ(alerts.size(), fp.nodes.size());
    for (std::size_t i = 0; i < alerts.size(); ++i) {
        IC::Node* const n = fp.nodes[i];
        EXPECT_EQ(alerts[i].getSeverity(), 3);
        EXPECT_EQ(alerts[i].getClass(), IC::Alert::NodeArrival);
        EXPECT_EQ(alerts[i].getStatus(), n->getNodeNumber());
        EXPECT_EQ(alerts[i].getMessage(), "MIControl");
        EXPECT_EQ(alerts[i].getNodePaths(), std::vector<std::string>{store_.getNodePath(n)});
        EXPECT_FALSE(store_.getNodePath(n).empty());
    }
    EXPECT_EQ(ictest::Recorder::get().calls().size(), 1u);
    std::vector<IC::Node*> listed;
    store_.getMap(listed);
    EXPECT_EQ(listed.size(), fp.nodes.size());

    auto const t = ictest::timeline(cap);
    long const upd = ictest::indexOf(t, "reloadMIs: FP updatedMis");
    long const map = ictest::indexOf(t, "reloadMIs: FP getMap");
    long const add = ictest::indexOf(t, "reloadMIs: NodeStore::addNodeIfNew");
    long const cb = ictest::indexOf(t, "reloadMIs: callback Alerts");
    EXPECT_GE(upd, 0);
    EXPECT_LT(upd, map);
    EXPECT_LT(map, add);
    EXPECT_LT(add, cb);
    EXPECT_EQ(countLog(cap, kLogMI, 3000, "reloadMIs: NodeStore::addNodeIfNew"), fp.nodes.size());
}

TEST_F(ReloadMIs, ARenamedLibraryIsOneRemovalAndOneAdditionWithANewNumber)
{
    tree_.addFP("fp_two");
    loadFPs();
    unsigned short const before = counter_;
    void const* const oldAlpha = mi("mi_alpha").object;
    ASSERT_EQ(reload().getStatus(), 0); // nothing to do yet

    ictest::TempTree::rename(alphaPath_, tree_.miDir() + "/zz_alpha.so");
    ictest::Recorder::get().reset();
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 0);

    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    // A second object from the same library (it may reuse the first one's
    // address, so count records rather than compare pointers).
    std::vector<MIRecord> alphas;
    for (auto const& r : ictestprobe::mis())
        if (r.name == "mi_alpha")
            alphas.push_back(r);
    ASSERT_EQ(alphas.size(), 2u);
    EXPECT_TRUE(alphas[0].released);
    EXPECT_FALSE(alphas[1].released);
    MIRecord const& fresh = alphas[1];
    EXPECT_EQ(fresh.base, static_cast<unsigned int>(before) << 16);
    EXPECT_EQ(counter_, before + 1);
    ASSERT_EQ(libs_.size(), 2u);
    bool found = false;
    for (auto const& r : libs_)
        if (r.name == "zz_alpha.so") {
            found = true;
            EXPECT_EQ(r.plugin, fresh.object);
            EXPECT_EQ(r.idbase, static_cast<unsigned int>(before) << 16);
        }
    EXPECT_TRUE(found);

    ictestprobe::FPRecord fp;
    ASSERT_TRUE(ictestprobe::findFP("fp_two", &fp));
    ASSERT_EQ(fp.lastAdded.size(), 1u);
    ASSERT_EQ(fp.lastRemoved.size(), 1u);
    EXPECT_EQ(static_cast<void const*>(fp.lastAdded[0]), fresh.object);
    EXPECT_EQ(static_cast<void const*>(fp.lastRemoved[0]), oldAlpha);
}

TEST_F(ReloadMIs, AnFPWhoseUpdateFailsIsNotAskedForNodesAndIsCounted)
{
    tree_.addFP("fp_two");
    tree_.addFP("fp_updatefails");
    loadFPs();
    ASSERT_EQ(fps_.size(), 2u);
    tree_.addMI("mi_gamma");

    ictest::LogCapture cap;
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 1);
    EXPECT_EQ(e.getCode(), IC::Number(1u));
    EXPECT_EQ(e.getText(), "");
    EXPECT_EQ(ictestprobe::count("fp_updatefails:updatedMis added=1 removed=0"), 1u);
    EXPECT_EQ(ictestprobe::count("fp_updatefails:getMap"), 0u);
    // The other FP is still visited.
    EXPECT_EQ(ictestprobe::count("fp_two:updatedMis added=1 removed=0"), 1u);
    EXPECT_EQ(ictestprobe::count("fp_two:getMap"), 1u);
    EXPECT_EQ(mis_.size(), 3u);
}

TEST_F(ReloadMIs, AnFPWhoseGetMapFailsIsReportedAndCounted)
{
    tree_.addFP("fp_mapfails");
    loadFPs();
    tree_.addMI("mi_gamma");
    ictest::LogCapture cap;
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 1);
    EXPECT_EQ(e.getCode(), IC::Number(1u));
    auto const rec = findLog(cap, kLogMI,
                             "MIControl FP getMap(): " +
                                 errText(IC::Error(1, IC::Number(12u), "fp map refused")));
    EXPECT_EQ(rec.level, 6000);
    EXPECT_EQ(rec.function, "diagError");
    EXPECT_TRUE(ictest::Recorder::get().calls().empty());
}

TEST_F(ReloadMIs, ARefusedAnnouncementIsReportedAndCounted)
{
    tree_.addFP("fp_two");
    loadFPs();
    IC::Error const refused(1, IC::Number(99u), "not now");
    ictest::Recorder::get().setAlertResult(refused);
    tree_.addMI("mi_gamma");
    ictest::LogCapture cap;
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 1);
    EXPECT_EQ(e.getCode(), IC::Number(1u));
    EXPECT_EQ(countLog(cap, kLogMI, 6000, "MIControl Throw Load Alerts: " + errText(refused)), 1u);
    EXPECT_EQ(ictest::Recorder::get().calls().size(), 1u);
}

TEST_F(ReloadMIs, WithoutFPsAChangeEndsInSuccessWithoutAlerts)
{
    ictest::TempTree::remove(alphaPath_);
    tree_.addMI("mi_gamma");
    ictest::LogCapture cap;
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getCode(), IC::Number(IC::Number::Generic));
    EXPECT_EQ(countLog(cap, kLogMI, 3000, "MIControl reLoadMis End"), 0u);
    EXPECT_TRUE(ictest::Recorder::get().calls().empty());
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    EXPECT_TRUE(ictestprobe::findMI("mi_gamma", nullptr));
    EXPECT_EQ(mis_.size(), 2u);
}

TEST_F(ReloadMIs, WhenNoInterfaceIsLeftTheReloadStopsBeforeTellingTheFPs)
{
    tree_.addFP("fp_two");
    loadFPs();
    ictest::TempTree::remove(alphaPath_);
    ictest::TempTree::remove(betaPath_);
    std::string const bad = tree_.addMI("mi_code");
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 1);
    EXPECT_EQ(e.getCode(), IC::Number(1u));
    EXPECT_EQ(e.getText(), "No MIs were loaded");
    // The removals happened, the FPs heard nothing.
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 1u);
    EXPECT_EQ(ictestprobe::count("mi_beta:release"), 1u);
    EXPECT_TRUE(mis_.empty());
    EXPECT_TRUE(libs_.empty());
    EXPECT_TRUE(ictestprobe::eventsWithPrefix("fp_two:updatedMis").empty());
    EXPECT_FALSE(ictest::isMapped(bad));
}

TEST_F(ReloadMIs, AFileReplacedUnderTheSameNameIsNotReloaded)
{
    void const* const alpha = mi("mi_alpha").object;
    // Replace the file by another build under the same name.
    ictest::TempTree::remove(alphaPath_);
    tree_.install(tree_.miDir(), "mi_gamma", "mi_alpha.so");
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(mi("mi_alpha").object, alpha);
    EXPECT_EQ(ictestprobe::count("mi_alpha:release"), 0u);
    EXPECT_TRUE(ictestprobe::mis().size() == 2u);
    EXPECT_FALSE(ictestprobe::findMI("mi_gamma", nullptr));
}

} // namespace
