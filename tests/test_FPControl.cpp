// Functional plug-in loading, removal and reload (IC::FPControl), driven
// directly with local lists, against real plug-ins.
#include <IC/FPControl.h>
#include <IC/LoadControl.h>
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
using ictest::kLogFP;
using ictestprobe::FPRecord;

std::string const kRuntimeError = typeid(std::runtime_error).name();

int sinkCalls = 0;
IC::Error sink(std::vector<IC::Alert> const&)
{
    ++sinkCalls;
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

FPRecord fp(std::string const& name)
{
    FPRecord r;
    EXPECT_TRUE(ictestprobe::findFP(name, &r)) << name;
    return r;
}

std::vector<std::string> callsOf(std::string const& name)
{
    std::vector<std::string> out;
    for (auto const& e : ictestprobe::eventsWithPrefix(name + ":"))
        if (e.find(":image ") == std::string::npos)
            out.push_back(e);
    return out;
}

class FPControlTest : public testing::Test {
protected:
    FPControlTest()
        : fpEnv_("IC_FP_DIR", tree_.fpDir()),
          // Stand-in interfaces: the loader passes them on, nobody calls them.
          someMis_{reinterpret_cast<IC::ManagementInterface*>(&marker_[0]),
                   reinterpret_cast<IC::ManagementInterface*>(&marker_[1])},
          services_(ictest::makeServices(someMis_, &facade_))
    {
    }

    void SetUp() override
    {
        ictestprobe::reset();
        sinkCalls = 0;
    }
    void TearDown() override
    {
        for (auto& r : libs_) {
            static_cast<IC::FunctionalPlugIn*>(r.plugin)->release();
            SD::PlatformUtilities::unloadLibrary(r.handle);
        }
        EXPECT_EQ(ictestprobe::liveImages(), 0);
    }

    std::vector<IC::libstruct> discover()
    {
        std::vector<IC::libstruct> found;
        std::set<std::string> names;
        IC::LoadControl().findLibs(tree_.fpDir(), found, names);
        return found;
    }

    IC::Error load(std::vector<IC::libstruct>& toLoad)
    {
        return IC::FPControl().myloadFPs(counter_, libs_, fps_, store_, services_, toLoad);
    }

    IC::Error reload()
    {
        IC::AlertSink const alertCB = &sink;
        return IC::FPControl().reLoadFPs(counter_, libs_, fps_, store_, services_, alertCB, names_);
    }

    ictest::TempTree tree_;
    ictest::EnvGuard fpEnv_;
    char marker_[2] = {0, 0};
    IC::InstrumentationControl facade_;
    std::vector<IC::ManagementInterface*> someMis_;
    IC::ICforFP services_;
    unsigned short counter_ = 2;
    std::vector<IC::libstruct> libs_;
    std::vector<IC::FunctionalPlugIn*> fps_;
    std::set<std::string> names_;
    IC::NodeStore store_;
};

TEST_F(FPControlTest, InitialisesWithItsNumberAndTheElevenServices)
{
    std::string const path = tree_.addFP("fp_two");
    auto toLoad = discover();
    ASSERT_EQ(toLoad.size(), 1u);
    SD::_LibraryHandle* const handle = toLoad[0].handle;

    ictest::LogCapture cap;
    IC::Error const e = load(toLoad);
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getCode(), IC::Number(IC::Number::Generic));
    EXPECT_EQ(e.getText(), "");

    EXPECT_EQ(callsOf("fp_two"),
              (std::vector<std::string>{"fp_two:OpenFP", "fp_two:Initialize base=131072"}));
    FPRecord const r = fp("fp_two");
    EXPECT_EQ(r.base, 131072u);
    EXPECT_EQ(counter_, 3);
    ASSERT_TRUE(r.services);
    IC::ICforFP const& s = *r.services;
    EXPECT_EQ(s.getMIs(), someMis_);
    EXPECT_EQ(s.getRegFPAlerts(), &ictest::svRegPath);
    EXPECT_EQ(s.getDeRegFPAlerts(), &ictest::svDeRegPath);
    EXPECT_EQ(s.getAlertCallBackFP(), &ictest::svAlert);
    EXPECT_EQ(s.getAssertCallBackFP(), &ictest::svAssert);
    EXPECT_EQ(s.getInterfaceVersion(), IC::Number(IC::Version2{1, 0}));
    EXPECT_EQ(s.getModuleVersion(), IC::Number(IC::Version2{2, 3}));
    EXPECT_EQ(s.getMapNewFPNode(), &ictest::svMapNode);
    EXPECT_EQ(s.getInstrumentationControl(), &facade_);
    EXPECT_EQ(s.getRegFPsensorAlerts(), &ictest::svRegSensor);
    EXPECT_EQ(s.getDeRegFPsensorAlerts(), &ictest::svDeRegSensor);

    ASSERT_EQ(fps_.size(), 1u);
    EXPECT_EQ(static_cast<void const*>(fps_[0]), r.object);
    ASSERT_EQ(libs_.size(), 1u);
    EXPECT_EQ(libs_[0].handle, handle);
    EXPECT_EQ(libs_[0].path, path);
    EXPECT_EQ(libs_[0].name, "fp_two.so");
    EXPECT_EQ(libs_[0].plugin, r.object);
    EXPECT_EQ(libs_[0].idbase, 131072u);
    ASSERT_EQ(toLoad.size(), 1u);
    EXPECT_EQ(toLoad[0].plugin, r.object);
    EXPECT_EQ(toLoad[0].idbase, 131072u);

    // The store handed in is not used.
    std::vector<IC::Node*> listed;
    store_.getMap(listed);
    EXPECT_TRUE(listed.empty());
    IC::Node* n = nullptr;
    EXPECT_EQ(store_.getNode(131072u | 1, &n).getStatus(), 1);

    auto const t = ictest::timeline(cap);
    long const before = ictest::indexOf(t, "myloadFPs: " + path + " Initialize");
    long const during = ictest::indexOf(t, "fp_two:Initialize base=131072");
    long const after = ictest::indexOf(t, "myloadFPs: " + path + " Initialize Done");
    EXPECT_GE(before, 0);
    EXPECT_LT(before, during);
    EXPECT_LT(during, after);
    auto const rec = findLog(cap, kLogFP, "myloadFPs: " + path + " Initialize");
    EXPECT_EQ(rec.level, 3000);
    EXPECT_EQ(rec.function, "myloadFPs");
    EXPECT_EQ(rec.file, "FPControl");
    for (auto const& l : ictest::logsOf(cap, kLogFP))
        EXPECT_NE(l.level, 6000) << l.message;
}

// ---- one failing library ----

struct Failure {
    std::string module;
    std::string message; // {path} stands for the library's path
    std::string function;
    bool madeObject;
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

class FPFailure : public FPControlTest, public testing::WithParamInterface<Failure> {};

TEST_P(FPFailure, IsLoggedUnloadedAndCounted)
{
    Failure const& f = GetParam();
    std::string const path = tree_.addFP(f.module);
    auto toLoad = discover();
    ASSERT_EQ(toLoad.size(), 1u);

    ictest::LogCapture cap;
    IC::Error const e = load(toLoad);
    auto const rec = findLog(cap, kLogFP, withPath(f.message, path));
    EXPECT_EQ(rec.level, 6000);
    EXPECT_EQ(rec.function, f.function);
    EXPECT_EQ(rec.file, "FPControl");

    EXPECT_EQ(e.getStatus(), 1);
    EXPECT_EQ(e.getCode(), IC::Number(1u));
    EXPECT_EQ(e.getText(), "No FPs were loaded");
    EXPECT_EQ(countLog(cap, kLogFP, 6000, "myloadFPs count of FPs that did not load 1"), 1u);
    EXPECT_EQ(counter_, 2);
    EXPECT_TRUE(toLoad.empty());
    EXPECT_TRUE(libs_.empty());
    EXPECT_TRUE(fps_.empty());
    EXPECT_EQ(ictestprobe::liveImages(), 0);
    EXPECT_FALSE(ictest::isMapped(path));
    EXPECT_EQ(ictestprobe::count(f.module + ":release"), 0u);
    EXPECT_EQ(ictestprobe::fps().size(), f.madeObject ? 1u : 0u);
}

INSTANTIATE_TEST_SUITE_P(
    EveryWayToFail, FPFailure,
    testing::Values(
        Failure{"fp_noentry", "myloadFPs: {path} OpenFP not found", "myloadFPs", false},
        Failure{"fp_code", "myloadFPs: {path} OpenFP failed, code=X", "myloadFPs", false},
        Failure{"fp_nullerror", "myloadFPs: {path} Pointer to Error is NULL", "myloadFPs", true},
        Failure{"fp_errstatus", "OpenFP(): " + errText(IC::Error(1, IC::Number(8u), "fp refused")),
                "diagError", true},
        Failure{"fp_nullobject", "myloadFPs: {path} OpenFP pointer is NULL", "myloadFPs", false},
        Failure{"fp_initfails",
                "FP Initialize(): " + errText(IC::Error(1, IC::Number(5u), "fp init refused")),
                "diagError", true},
        Failure{"fp_throwinit",
                "myloadFPs: Exception fp init exploded Type=" + kRuntimeError + " for {path}",
                "myloadFPs", true},
        Failure{"fp_throwint", "myloadFPs Caught exception for {path}", "myloadFPs", false}),
    [](testing::TestParamInfo<Failure> const& info) { return info.param.module; });

TEST_F(FPControlTest, OfThreeTheSecondFailsAndTheOthersTakeConsecutiveNumbers)
{
    tree_.addFP("fp_one", "a1.so");
    tree_.addFP("fp_initfails", "a2.so");
    tree_.addFP("fp_two", "a3.so");
    counter_ = 40;
    auto toLoad = discover();
    ASSERT_EQ(toLoad.size(), 3u);
    ictest::LogCapture cap;
    IC::Error const e = load(toLoad);
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getCode(), IC::Number(1u));
    EXPECT_EQ(e.getText(), "Count of FPs that did not load");
    EXPECT_EQ(countLog(cap, kLogFP, 6000, "myloadFPs count of FPs that did not load 1"), 1u);
    EXPECT_EQ(fp("fp_one").base, 40u << 16);
    EXPECT_EQ(fp("fp_two").base, 41u << 16);
    EXPECT_EQ(counter_, 42);
    ASSERT_EQ(toLoad.size(), 2u);
    EXPECT_EQ(toLoad[0].name, "a1.so");
    EXPECT_EQ(toLoad[1].name, "a3.so");
    ASSERT_EQ(libs_.size(), 2u);
    EXPECT_EQ(libs_[1].idbase, 41u << 16);
    EXPECT_FALSE(ictest::isMapped(tree_.fpDir() + "/a2.so"));
    // The failed one was initialised, and abandoned rather than released.
    EXPECT_EQ(ictestprobe::count("fp_initfails:Initialize base=" + std::to_string(41u << 16)), 1u);
    EXPECT_EQ(ictestprobe::count("fp_initfails:release"), 0u);
}

TEST_F(FPControlTest, FailuresWithEarlierFPsLoadedAreOnlyCounted)
{
    tree_.addFP("fp_one");
    auto first = discover();
    ASSERT_EQ(load(first).getStatus(), 0);
    tree_.addFP("fp_code");
    std::vector<IC::libstruct> fresh;
    for (auto& r : discover())
        if (r.name == "fp_one.so")
            SD::PlatformUtilities::unloadLibrary(r.handle);
        else
            fresh.push_back(r);
    IC::Error const e = load(fresh);
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getCode(), IC::Number(1u));
    EXPECT_EQ(e.getText(), "Count of FPs that did not load");
    EXPECT_EQ(fps_.size(), 1u);
    EXPECT_EQ(counter_, 3);
}

// ---- removal ----

class DeleteFP : public FPControlTest {
protected:
    void SetUp() override
    {
        FPControlTest::SetUp();
        onePath_ = tree_.addFP("fp_one");
        tree_.addFP("fp_two");
        auto toLoad = discover();
        ASSERT_EQ(load(toLoad).getStatus(), 0);
        ASSERT_EQ(fps_.size(), 2u);
    }
    std::string onePath_;
};

TEST_F(DeleteFP, ReleasesThePlugInAndClosesItsLibrary)
{
    IC::FunctionalPlugIn* const two = fps_[1];
    ictest::LogCapture cap;
    IC::FPControl().deleteFP(libs_, onePath_, fps_);
    EXPECT_EQ(ictestprobe::count("fp_one:release"), 1u);
    ASSERT_EQ(fps_.size(), 1u);
    EXPECT_EQ(fps_[0], two);
    ASSERT_EQ(libs_.size(), 1u);
    EXPECT_EQ(libs_[0].name, "fp_two.so");
    EXPECT_FALSE(ictest::isMapped(onePath_));
    auto const ev = ictestprobe::events();
    EXPECT_LT(ictest::indexOf(ev, "fp_one:release"), ictest::indexOf(ev, "fp_one:image unloaded"));
    EXPECT_TRUE(ictest::logsOf(cap, kLogFP).empty());
}

TEST_F(DeleteFP, AnUnknownPathOnlyLogs)
{
    ictest::LogCapture cap;
    IC::FPControl().deleteFP(libs_, tree_.fpDir() + "/fp_three.so", fps_);
    auto const logs = ictest::logsOf(cap, kLogFP);
    ASSERT_EQ(logs.size(), 1u);
    EXPECT_EQ(logs[0].message, "deleteFP: FP not found in FP vector");
    EXPECT_EQ(logs[0].level, 6000);
    EXPECT_EQ(logs[0].function, "deleteFP");
    EXPECT_EQ(fps_.size(), 2u);
    EXPECT_EQ(libs_.size(), 2u);
    EXPECT_EQ(ictestprobe::count("fp_one:release"), 0u);
}

TEST_F(DeleteFP, APlugInMissingFromTheListStillGoesAndIsReportedAfterwards)
{
    fps_.erase(fps_.begin());
    ictest::LogCapture cap;
    IC::FPControl().deleteFP(libs_, onePath_, fps_);
    EXPECT_EQ(ictestprobe::count("fp_one:release"), 1u);
    ASSERT_EQ(libs_.size(), 1u);
    EXPECT_EQ(libs_[0].name, "fp_two.so");
    EXPECT_EQ(fps_.size(), 1u);
    EXPECT_FALSE(ictest::isMapped(onePath_));
    EXPECT_EQ(countLog(cap, kLogFP, 6000, "deleteFP: FP not found in FP vector"), 1u);
    // The report comes after the library was closed.
    auto const t = ictest::timeline(cap);
    long const closed = ictest::indexOf(t, "fp_one:image unloaded");
    long const report = ictest::indexOf(t, "deleteFP: FP not found in FP vector");
    EXPECT_GE(closed, 0);
    EXPECT_LT(closed, report);
}

// ---- reload ----

TEST_F(FPControlTest, TheFirstReloadLoadsInNameOrderAndAnnouncesNothing)
{
    tree_.addFP("fp_two");
    tree_.addFP("fp_one");
    ictest::LogCapture cap;
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getText(), "");
    ASSERT_EQ(libs_.size(), 2u);
    EXPECT_EQ(libs_[0].name, "fp_one.so");
    EXPECT_EQ(libs_[1].name, "fp_two.so");
    EXPECT_EQ(fp("fp_one").base, 2u << 16);
    EXPECT_EQ(fp("fp_two").base, 3u << 16);
    EXPECT_EQ(counter_, 4);

    auto const t = ictest::timeline(cap);
    long const start = ictest::indexOf(t, " reLoadFPs:");
    long const map = ictest::indexOf(t, "reloadFPs: NodeStore::getMap");
    long const done = ictest::indexOf(t, " reloadFPs: Done adding FPs");
    EXPECT_GE(start, 0);
    EXPECT_LT(start, map);
    EXPECT_LT(map, done);
    // The temporary store is empty: no node, no alert.
    EXPECT_EQ(countLog(cap, kLogFP, 3000, "reloadFPs: NodeStore::addNodeIfNew"), 0u);
    EXPECT_EQ(countLog(cap, kLogFP, 3000, "reloadFPs: callback alerts"), 0u);
    EXPECT_EQ(sinkCalls, 0);
    std::vector<IC::Node*> listed;
    store_.getMap(listed);
    EXPECT_TRUE(listed.empty());
}

TEST_F(FPControlTest, AnUnchangedDirectoryIsDoneWithoutAdditions)
{
    tree_.addFP("fp_one");
    ASSERT_EQ(reload().getStatus(), 0);
    ictestprobe::reset();
    ictest::LogCapture cap;
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getCode(), IC::Number(IC::Number::Generic));
    EXPECT_EQ(countLog(cap, kLogFP, 3000, " reloadFPs: Done - no additions"), 1u);
    EXPECT_EQ(countLog(cap, kLogFP, 3000, " reloadFPs: Done adding FPs"), 0u);
    EXPECT_TRUE(ictestprobe::fps().empty());
    EXPECT_EQ(libs_.size(), 1u);
    EXPECT_EQ(counter_, 3);
    EXPECT_EQ(ictestprobe::liveImages(), 1);
}

TEST_F(FPControlTest, ARemovedLibraryIsReleasedAndClosed)
{
    std::string const one = tree_.addFP("fp_one");
    tree_.addFP("fp_two");
    ASSERT_EQ(reload().getStatus(), 0);
    ictest::TempTree::remove(one);
    ictest::LogCapture cap;
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(ictestprobe::count("fp_one:release"), 1u);
    EXPECT_FALSE(ictest::isMapped(one));
    ASSERT_EQ(fps_.size(), 1u);
    ASSERT_EQ(libs_.size(), 1u);
    EXPECT_EQ(libs_[0].name, "fp_two.so");
    EXPECT_EQ(countLog(cap, kLogFP, 3000, " reloadFPs: Done - no additions"), 1u);
}

TEST_F(FPControlTest, ARenamedLibraryGetsANewNumber)
{
    std::string const one = tree_.addFP("fp_one");
    ASSERT_EQ(reload().getStatus(), 0);
    ictest::TempTree::rename(one, tree_.fpDir() + "/fp_renamed.so");
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(ictestprobe::count("fp_one:release"), 1u);
    std::vector<FPRecord> ones;
    for (auto const& r : ictestprobe::fps())
        if (r.name == "fp_one")
            ones.push_back(r);
    ASSERT_EQ(ones.size(), 2u);
    EXPECT_TRUE(ones[0].released);
    EXPECT_FALSE(ones[1].released);
    FPRecord const& fresh = ones[1];
    EXPECT_EQ(fresh.base, 3u << 16);
    EXPECT_EQ(counter_, 4);
    ASSERT_EQ(libs_.size(), 1u);
    EXPECT_EQ(libs_[0].name, "fp_renamed.so");
}

TEST_F(FPControlTest, AddedLibrariesThatAllFailWithOthersLoadedAreCounted)
{
    tree_.addFP("fp_one");
    ASSERT_EQ(reload().getStatus(), 0);
    tree_.addFP("fp_code");
    ictest::LogCapture cap;
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getCode(), IC::Number(1u));
    EXPECT_EQ(e.getText(), "Count of FPs that did not load");
    EXPECT_EQ(countLog(cap, kLogFP, 3000, " reloadFPs: Done adding FPs"), 1u);
    EXPECT_EQ(fps_.size(), 1u);
}

TEST_F(FPControlTest, WhenNoFPLoadsAtAllTheReloadFails)
{
    std::string const bad = tree_.addFP("fp_initfails");
    ictest::LogCapture cap;
    IC::Error const e = reload();
    EXPECT_EQ(e.getStatus(), 1);
    EXPECT_EQ(e.getCode(), IC::Number(1u));
    EXPECT_EQ(e.getText(), "No FPs were loaded");
    // A failed load does not read the temporary store.
    EXPECT_EQ(countLog(cap, kLogFP, 3000, "reloadFPs: NodeStore::getMap"), 0u);
    EXPECT_EQ(countLog(cap, kLogFP, 3000, " reloadFPs: Done adding FPs"), 1u);
    EXPECT_TRUE(fps_.empty());
    EXPECT_FALSE(ictest::isMapped(bad));
}

} // namespace
