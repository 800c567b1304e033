// Functional plug-in loading, removal and reload (IC::FPControl), driven
// directly with local lists, against real plug-ins.
#include <IC/FPControl.h>
#include <IC/LoadControl.h>
#include <IC/NodeStore.h>
#include <SD/PlatformUtilities.h>

#include "PluginTest.h"

#include <typeinfo>

namespace {

using ictest::expectError;
using ictest::fp;
using ictest::kLogFP;
using ictest::recs;
using ictestprobe::count;
using Strings = std::vector<std::string>;

// The loader fills no store, so a reload announces nothing; a call would
// show as this error in the reload's result.
IC::Error sink(std::vector<IC::Alert> const&)
{
    return IC::Error(1, IC::Number(99u), "not expected");
}

class FPControlTest : public testing::Test {
protected:
    void SetUp() override { ictestprobe::reset(); }
    void TearDown() override
    {
        for (auto& r : libs_) {
            static_cast<IC::FunctionalPlugIn*>(r.plugin)->release();
            SD::PlatformUtilities::unloadLibrary(r.handle);
        }
        EXPECT_EQ(ictestprobe::liveImages(), 0);
    }
    IC::Error load()
    {
        toLoad_ = ictest::discover(tree_.fpDir(), loadedNames());
        return IC::FPControl().myloadFPs(counter_, libs_, fps_, store_, services_, toLoad_);
    }
    std::set<std::string> loadedNames() const
    {
        std::set<std::string> out;
        for (auto const& r : libs_)
            out.insert(r.name);
        return out;
    }
    IC::Error reload()
    {
        return IC::FPControl().reLoadFPs(counter_, libs_, fps_, store_, services_, IC::AlertSink(&sink), names_);
    }
    std::string at(std::string const& name) const { return tree_.fpDir() + "/" + name; }

    ictest::TempTree tree_;
    ictest::EnvGuard fpEnv_{"IC_FP_DIR", tree_.fpDir()};
    IC::InstrumentationControl facade_;
    // Stand-ins: the loader passes them on, nobody calls them.
    std::vector<IC::ManagementInterface*> someMis_{reinterpret_cast<IC::ManagementInterface*>(&facade_), nullptr};
    IC::ICforFP services_ = ictest::makeServices(someMis_, &facade_);
    unsigned short counter_ = 40;
    std::vector<IC::libstruct> libs_, toLoad_;
    std::vector<IC::FunctionalPlugIn*> fps_;
    std::set<std::string> names_;
    IC::NodeStore store_;
};

// Of three, the second fails: the others take consecutive numbers and get
// the services as given; the failed one was initialised and is abandoned
// (closed, not released). With FPs loaded, a failure is only counted.
TEST_F(FPControlTest, LoadsEachWithTheNextNumberAndCountsTheFailures)
{
    tree_.addFP("fp_one", "a1.so");
    tree_.addFP("fp_initfails", "a2.so");
    std::string const path = tree_.addFP("fp_two", "a3.so");
    ictest::LogCapture cap;
    expectError(load(), 0, IC::Number(1u), "Count of FPs that did not load");
    EXPECT_EQ(cap.count(kLogFP, 6000, "myloadFPs count of FPs that did not load 1"), 1u);
    EXPECT_EQ(ictest::callsOf("fp_two"), (Strings{"fp_two:OpenFP", "fp_two:Initialize base=2686976"}));
    EXPECT_TRUE(count("fp_initfails:Initialize base=2686976") == 1u && count("fp_initfails:release") == 0u);
    auto const one = fp("fp_one"), two = fp("fp_two");
    EXPECT_TRUE(one.base == 40u << 16 && two.base == 41u << 16 && counter_ == 42);
    ASSERT_TRUE(two.services);
    ictest::expectServices(*two.services, someMis_, &facade_);
    EXPECT_TRUE(fps_.size() == 2u && fps_[0] == one.object && fps_[1] == two.object);
    EXPECT_EQ(recs(toLoad_), (Strings{"a1.so 40", "a3.so 41"}));
    EXPECT_EQ(recs(libs_), (Strings{"a1.so 40", "a3.so 41"}));
    EXPECT_TRUE(libs_[1].handle == toLoad_[1].handle && libs_[1].path == path && libs_[1].plugin == two.object);
    EXPECT_EQ(toLoad_[1].plugin, two.object);
    ictest::expectInOrder(ictest::timeline(cap), {"myloadFPs: " + path + " Initialize",
                                                  "fp_two:Initialize base=2686976",
                                                  "myloadFPs: " + path + " Initialize Done"});
    for (std::string const line : {" Initialize", " Initialize Done"})
        ictest::expectEvent(cap, {kLogFP, "FPControl"}, "myloadFPs: " + path + line, 3000, "myloadFPs");
    ictest::fs::remove(at("a2.so"));
    tree_.addFP("fp_code");
    expectError(load(), 0, IC::Number(1u), "Count of FPs that did not load");
    EXPECT_TRUE(fps_.size() == 2u && counter_ == 42 && toLoad_.empty());

    // Only a full path names a record to delete. A plug-in missing from the
    // list still goes, and is reported after its library was closed.
    ictestprobe::reset();
    cap.clear();
    IC::FPControl().deleteFP(libs_, "a1.so", fps_);
    ictest::expectEvent(cap, {kLogFP, "FPControl"}, "deleteFP: FP not found in FP vector", 6000, "deleteFP");
    cap.clear();
    IC::FPControl().deleteFP(libs_, at("a1.so"), fps_);
    EXPECT_TRUE(cap.logs(kLogFP).empty());
    fps_.clear();
    IC::FPControl().deleteFP(libs_, path, fps_);
    EXPECT_EQ(ictest::timeline(cap), (Strings{"fp_one:release", "fp_one:image unloaded", "fp_two:release",
                                              "fp_two:image unloaded", "deleteFP: FP not found in FP vector"}));
    EXPECT_TRUE(libs_.empty());
}

// One library that fails, each way it can: its line, the whole load failed,
// no number used, the library closed, its object (if any) abandoned.
TEST_F(FPControlTest, EveryWayToFailIsLoggedUnloadedAndCounted)
{
    auto const err = [](unsigned int code, char const* text) {
        return ictest::errText(IC::Error(1, IC::Number(code), text));
    };
    std::string const thrown = std::string("Exception fp init exploded Type=") + typeid(std::runtime_error).name();
    struct Case {
        char const* module;
        std::string message; // {path} stands for the library's path
        char const* function;
        bool madeObject;
    } const cases[] = {{"fp_noentry", "myloadFPs: {path} OpenFP not found", "myloadFPs", false},
                       {"fp_code", "myloadFPs: {path} OpenFP failed, code=X", "myloadFPs", false},
                       {"fp_nullerror", "myloadFPs: {path} Pointer to Error is NULL", "myloadFPs", true},
                       {"fp_errstatus", "OpenFP(): " + err(8, "fp refused"), "diagError", true},
                       {"fp_nullobject", "myloadFPs: {path} OpenFP pointer is NULL", "myloadFPs", false},
                       {"fp_initfails", "FP Initialize(): " + err(5, "fp init refused"), "diagError", true},
                       {"fp_throwinit", "myloadFPs: " + thrown + " for {path}", "myloadFPs", true},
                       {"fp_throwint", "myloadFPs Caught exception for {path}", "myloadFPs", false}};
    for (auto const& c : cases) {
        SCOPED_TRACE(c.module);
        ictestprobe::reset();
        std::string const path = tree_.addFP(c.module);
        ictest::LogCapture cap;
        expectError(load(), 1, IC::Number(1u), "No FPs were loaded");
        std::string message = c.message;
        if (message.find("{path}") != std::string::npos)
            message.replace(message.find("{path}"), 6, path);
        ictest::expectEvent(cap, {kLogFP, "FPControl"}, message, 6000, c.function);
        EXPECT_TRUE(counter_ == 40 && toLoad_.empty() && libs_.empty() && fps_.empty());
        EXPECT_EQ(ictestprobe::liveImages(), 0);
        EXPECT_EQ(count(std::string(c.module) + ":release"), 0u);
        EXPECT_EQ(ictestprobe::fps().size(), c.madeObject ? 1u : 0u);
        ictest::fs::remove(path);
    }
}

// Loaded in name order; unchanged, nothing happens and the scan's handles
// are closed again; removed, released; renamed, loaded again with a new
// number. The loader fills no store, so no node is announced.
TEST_F(FPControlTest, AReloadFollowsTheDirectory)
{
    std::string const one = tree_.addFP("fp_one"), two = tree_.addFP("fp_two");
    ictest::LogCapture cap;
    expectError(reload(), 0);
    EXPECT_EQ(recs(libs_), (Strings{"fp_one.so 40", "fp_two.so 41"}));
    EXPECT_EQ(cap.messages(kLogFP),
              (Strings{" reLoadFPs:", "myloadFPs: " + one + " Initialize", "myloadFPs: " + one + " Initialize Done",
                       "myloadFPs: " + two + " Initialize", "myloadFPs: " + two + " Initialize Done",
                       "reloadFPs: NodeStore::getMap", " reloadFPs: Done adding FPs"}));
    ictestprobe::reset();
    cap.clear();
    expectError(reload(), 0);
    EXPECT_EQ(cap.messages(kLogFP), (Strings{" reLoadFPs:", " reloadFPs: Done - no additions"}));
    EXPECT_TRUE(ictestprobe::fps().empty() && ictestprobe::liveImages() == 2);
    ictest::fs::remove(two);
    expectError(reload(), 0);
    EXPECT_TRUE(count("fp_two:release") == 1u && !ictest::isMapped(two));
    ictest::fs::rename(one, at("fp_renamed.so"));
    expectError(reload(), 0);
    EXPECT_EQ(count("fp_one:release"), 1u);
    EXPECT_EQ(fp("fp_one").base, 42u << 16);
    EXPECT_EQ(recs(libs_), Strings{"fp_renamed.so 42"});
    EXPECT_EQ(fps_.size(), 1u);
    // Additions that fail are counted, or fail the reload when none is left.
    tree_.addFP("fp_code");
    expectError(reload(), 0, IC::Number(1u), "Count of FPs that did not load");
    ictest::fs::remove(at("fp_renamed.so"));
    ictest::fs::remove(at("fp_code.so"));
    tree_.addFP("fp_initfails");
    cap.clear();
    expectError(reload(), 1, IC::Number(1u), "No FPs were loaded");
    EXPECT_EQ(cap.count(kLogFP, 3000, "reloadFPs: NodeStore::getMap"), 0u);
    EXPECT_EQ(cap.count(kLogFP, 3000, " reloadFPs: Done adding FPs"), 1u);
    EXPECT_TRUE(fps_.empty() && libs_.empty());
}

} // namespace
