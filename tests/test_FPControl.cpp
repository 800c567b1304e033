// Functional plug-in loading, removal and reload (IC::FPControl), driven
// directly with local lists, against real plug-ins.
#include <IC/FPControl.h>
#include <IC/LoadControl.h>
#include <IC/NodeStore.h>
#include <SD/PlatformUtilities.h>

#include "PluginTest.h"

#include <ostream>
#include <typeinfo>

namespace {

using ictest::errText;
using ictest::expectError;
using ictest::fp;
using ictest::kLogFP;
using ictest::recs;
using ictestprobe::count;
using Strings = std::vector<std::string>;

int sinkCalls = 0;
IC::Error sink(std::vector<IC::Alert> const&)
{
    ++sinkCalls;
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

class FPControlTest : public testing::Test {
protected:
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
    ictest::EnvGuard fpEnv_{"IC_FP_DIR", tree_.fpDir()};
    char marker_[2] = {0, 0};
    IC::InstrumentationControl facade_;
    // Stand-in interfaces: the loader passes them on, nobody calls them.
    std::vector<IC::ManagementInterface*> someMis_{reinterpret_cast<IC::ManagementInterface*>(&marker_[0]),
                                                   reinterpret_cast<IC::ManagementInterface*>(&marker_[1])};
    IC::ICforFP services_ = ictest::makeServices(someMis_, &facade_);
    unsigned short counter_ = 2;
    std::vector<IC::libstruct> libs_;
    std::vector<IC::FunctionalPlugIn*> fps_;
    std::set<std::string> names_;
    IC::NodeStore store_;
};

TEST_F(FPControlTest, InitialisesWithItsNumberAndTheElevenServices)
{
    std::string const path = tree_.addFP("fp_two");
    auto toLoad = ictest::discover(tree_.fpDir());
    ASSERT_EQ(toLoad.size(), 1u);
    SD::_LibraryHandle* const handle = toLoad[0].handle;
    ictest::LogCapture cap;
    expectError(load(toLoad), 0);
    EXPECT_EQ(ictest::callsOf("fp_two"), (Strings{"fp_two:OpenFP", "fp_two:Initialize base=131072"}));
    auto const r = fp("fp_two");
    EXPECT_EQ(r.base, 131072u);
    EXPECT_EQ(counter_, 3);
    ASSERT_TRUE(r.services);
    ictest::expectServices(*r.services, someMis_, &facade_);
    ASSERT_EQ(fps_.size(), 1u);
    EXPECT_EQ(fps_[0], r.object);
    ASSERT_EQ(libs_.size(), 1u);
    for (IC::libstruct const* l : {&libs_[0], &toLoad.at(0)}) {
        EXPECT_TRUE(l->handle == handle && l->path == path && l->plugin == r.object);
        EXPECT_EQ(recs({*l}), Strings{"fp_two.so 2"});
    }
    // The store handed in is not used.
    std::vector<IC::Node*> listed;
    store_.getAllNodes(listed);
    EXPECT_TRUE(listed.empty());
    ictest::expectInOrder(ictest::timeline(cap), {"myloadFPs: " + path + " Initialize", "fp_two:Initialize base=131072",
                                                  "myloadFPs: " + path + " Initialize Done"});
    for (std::string const line : {" Initialize", " Initialize Done"})
        ictest::expectEvent(cap, {kLogFP, "FPControl"}, "myloadFPs: " + path + line, 3000, "myloadFPs");
    EXPECT_EQ(cap.logs(kLogFP).size(), 2u);
}

// ---- one failing library ----

struct Failure {
    std::string module;
    std::string message; // the level-6000 line; {path} stands for the library's path
    std::string function;
    bool madeObject;
};

// Names the case in test output instead of dumping its bytes.
void PrintTo(Failure const& f, std::ostream* os)
{
    *os << f.module;
}

class FPFailure : public FPControlTest, public testing::WithParamInterface<Failure> {};

TEST_P(FPFailure, IsLoggedUnloadedAndCounted)
{
    Failure const& f = GetParam();
    std::string const path = tree_.addFP(f.module);
    auto toLoad = ictest::discover(tree_.fpDir());
    ictest::LogCapture cap;
    IC::Error const e = load(toLoad);
    std::string message = f.message;
    if (message.find("{path}") != std::string::npos)
        message.replace(message.find("{path}"), 6, path);
    ictest::expectEvent(cap, {kLogFP, "FPControl"}, message, 6000, f.function);
    expectError(e, 1, IC::Number(1u), "No FPs were loaded");
    EXPECT_EQ(cap.count(kLogFP, 6000, "myloadFPs count of FPs that did not load 1"), 1u);
    EXPECT_EQ(counter_, 2);
    EXPECT_TRUE(toLoad.empty() && libs_.empty() && fps_.empty());
    EXPECT_EQ(ictestprobe::liveImages(), 0);
    EXPECT_FALSE(ictest::isMapped(path));
    EXPECT_EQ(count(f.module + ":release"), 0u);
    EXPECT_EQ(ictestprobe::fps().size(), f.madeObject ? 1u : 0u);
}

INSTANTIATE_TEST_SUITE_P(
    EveryWayToFail, FPFailure,
    testing::Values(
        Failure{"fp_noentry", "myloadFPs: {path} OpenFP not found", "myloadFPs", false},
        Failure{"fp_code", "myloadFPs: {path} OpenFP failed, code=X", "myloadFPs", false},
        Failure{"fp_nullerror", "myloadFPs: {path} Pointer to Error is NULL", "myloadFPs", true},
        Failure{"fp_errstatus", "OpenFP(): " + errText(IC::Error(1, IC::Number(8u), "fp refused")), "diagError",
                true},
        Failure{"fp_nullobject", "myloadFPs: {path} OpenFP pointer is NULL", "myloadFPs", false},
        Failure{"fp_initfails", "FP Initialize(): " + errText(IC::Error(1, IC::Number(5u), "fp init refused")),
                "diagError", true},
        Failure{"fp_throwinit",
                "myloadFPs: Exception fp init exploded Type=" + std::string(typeid(std::runtime_error).name()) +
                    " for {path}",
                "myloadFPs", true},
        Failure{"fp_throwint", "myloadFPs Caught exception for {path}", "myloadFPs", false}),
    [](testing::TestParamInfo<Failure> const& info) { return info.param.module; });

TEST_F(FPControlTest, OfThreeTheSecondFailsAndTheOthersTakeConsecutiveNumbers)
{
    tree_.addFP("fp_one", "a1.so");
    tree_.addFP("fp_initfails", "a2.so");
    tree_.addFP("fp_two", "a3.so");
    counter_ = 40;
    auto toLoad = ictest::discover(tree_.fpDir());
    ASSERT_EQ(toLoad.size(), 3u);
    ictest::LogCapture cap;
    expectError(load(toLoad), 0, IC::Number(1u), "Count of FPs that did not load");
    EXPECT_EQ(cap.count(kLogFP, 6000, "myloadFPs count of FPs that did not load 1"), 1u);
    EXPECT_EQ(fp("fp_one").base, 40u << 16);
    EXPECT_EQ(fp("fp_two").base, 41u << 16);
    EXPECT_EQ(counter_, 42);
    EXPECT_EQ(recs(toLoad), (Strings{"a1.so 40", "a3.so 41"}));
    EXPECT_EQ(recs(libs_), (Strings{"a1.so 40", "a3.so 41"}));
    EXPECT_FALSE(ictest::isMapped(tree_.fpDir() + "/a2.so"));
    // The failed one was initialised, and abandoned rather than released.
    EXPECT_EQ(count("fp_initfails:Initialize base=" + std::to_string(41u << 16)), 1u);
    EXPECT_EQ(count("fp_initfails:release"), 0u);

    // With FPs loaded, later failures are only counted.
    tree_.addFP("fp_code");
    auto fresh = ictest::discover(tree_.fpDir(), {"a1.so", "a2.so", "a3.so"});
    expectError(load(fresh), 0, IC::Number(1u), "Count of FPs that did not load");
    EXPECT_EQ(fps_.size(), 2u);
    EXPECT_EQ(counter_, 42);
}

TEST_F(FPControlTest, DeleteReleasesThePlugInAndClosesItsLibrary)
{
    std::string const one = tree_.addFP("fp_one"), two = tree_.addFP("fp_two");
    tree_.addFP("fp_relay");
    auto toLoad = ictest::discover(tree_.fpDir());
    ASSERT_EQ(load(toLoad).getStatus(), 0);
    IC::FunctionalPlugIn* const relay = fps_[1];
    ictest::LogCapture cap;
    IC::FPControl().deleteFP(libs_, tree_.fpDir() + "/fp_three.so", fps_);
    ictest::expectEvent(cap, {kLogFP, "FPControl"}, "deleteFP: FP not found in FP vector", 6000, "deleteFP");
    EXPECT_EQ(fps_.size(), 3u);
    EXPECT_EQ(count("fp_one:release"), 0u);
    cap.clear();
    IC::FPControl().deleteFP(libs_, one, fps_);
    EXPECT_TRUE(cap.logs(kLogFP).empty());
    // A plug-in missing from the list still goes, and is reported after its
    // library was closed.
    fps_.erase(fps_.begin() + 1);
    IC::FPControl().deleteFP(libs_, two, fps_);
    ictest::expectInOrder(ictest::timeline(cap), {"fp_one:release", "fp_one:image unloaded", "fp_two:release",
                                                  "fp_two:image unloaded", "deleteFP: FP not found in FP vector"});
    EXPECT_EQ(cap.count(kLogFP, 6000, "deleteFP: FP not found in FP vector"), 1u);
    EXPECT_EQ(fps_, std::vector<IC::FunctionalPlugIn*>{relay});
    EXPECT_EQ(recs(libs_), Strings{"fp_relay.so 3"});
    EXPECT_FALSE(ictest::isMapped(one) || ictest::isMapped(two));
}

// ---- reload ----

TEST_F(FPControlTest, TheFirstReloadLoadsInNameOrderAndAnnouncesNothing)
{
    tree_.addFP("fp_two");
    tree_.addFP("fp_one");
    ictest::LogCapture cap;
    expectError(reload(), 0);
    EXPECT_EQ(recs(libs_), (Strings{"fp_one.so 2", "fp_two.so 3"}));
    EXPECT_EQ(counter_, 4);
    // The temporary store is empty: no node, no alert.
    EXPECT_EQ(cap.messages(kLogFP),
              (Strings{" reLoadFPs:", "myloadFPs: " + tree_.fpDir() + "/fp_one.so Initialize",
                       "myloadFPs: " + tree_.fpDir() + "/fp_one.so Initialize Done",
                       "myloadFPs: " + tree_.fpDir() + "/fp_two.so Initialize",
                       "myloadFPs: " + tree_.fpDir() + "/fp_two.so Initialize Done", "reloadFPs: NodeStore::getMap",
                       " reloadFPs: Done adding FPs"}));
    EXPECT_EQ(sinkCalls, 0);
    std::vector<IC::Node*> listed;
    store_.getMap(listed);
    EXPECT_TRUE(listed.empty());

    // Nothing changed: done without additions.
    ictestprobe::reset();
    cap.clear();
    expectError(reload(), 0);
    EXPECT_EQ(cap.messages(kLogFP), (Strings{" reLoadFPs:", " reloadFPs: Done - no additions"}));
    EXPECT_TRUE(ictestprobe::fps().empty());
    EXPECT_EQ(libs_.size(), 2u);
    EXPECT_EQ(counter_, 4);
    EXPECT_EQ(ictestprobe::liveImages(), 2);
}

TEST_F(FPControlTest, ARemovedLibraryIsReleasedAndARenamedOneGetsANewNumber)
{
    std::string const one = tree_.addFP("fp_one"), two = tree_.addFP("fp_two");
    ASSERT_EQ(reload().getStatus(), 0);
    ictest::fs::remove(two);
    ictest::LogCapture cap;
    expectError(reload(), 0);
    EXPECT_EQ(count("fp_two:release"), 1u);
    EXPECT_FALSE(ictest::isMapped(two));
    EXPECT_EQ(cap.count(kLogFP, 3000, " reloadFPs: Done - no additions"), 1u);
    ictest::fs::rename(one, tree_.fpDir() + "/fp_renamed.so");
    expectError(reload(), 0);
    EXPECT_EQ(count("fp_one:release"), 1u);
    std::vector<ictestprobe::FPRecord> ones;
    for (auto const& r : ictestprobe::fps())
        if (r.name == "fp_one")
            ones.push_back(r);
    ASSERT_EQ(ones.size(), 2u);
    EXPECT_TRUE(ones[0].released && !ones[1].released);
    EXPECT_EQ(ones[1].base, 4u << 16);
    EXPECT_EQ(counter_, 5);
    EXPECT_EQ(recs(libs_), Strings{"fp_renamed.so 4"});
    EXPECT_EQ(fps_.size(), 1u);
}

TEST_F(FPControlTest, AddedLibrariesThatFailAreCountedOrFailTheReload)
{
    std::string const bad = tree_.addFP("fp_initfails");
    ictest::LogCapture cap;
    expectError(reload(), 1, IC::Number(1u), "No FPs were loaded");
    // A failed load does not read the temporary store.
    EXPECT_EQ(cap.count(kLogFP, 3000, "reloadFPs: NodeStore::getMap"), 0u);
    EXPECT_EQ(cap.count(kLogFP, 3000, " reloadFPs: Done adding FPs"), 1u);
    EXPECT_TRUE(fps_.empty());
    EXPECT_FALSE(ictest::isMapped(bad));
    ictest::fs::remove(bad);
    tree_.addFP("fp_one");
    ASSERT_EQ(reload().getStatus(), 0);
    tree_.addFP("fp_code");
    cap.clear();
    expectError(reload(), 0, IC::Number(1u), "Count of FPs that did not load");
    EXPECT_EQ(cap.count(kLogFP, 3000, " reloadFPs: Done adding FPs"), 1u);
    EXPECT_EQ(fps_.size(), 1u);
}

} // namespace
