// Functional plug-in loading, removal and reload (IC::FPControl), driven
// directly with local lists, against real plug-ins.
#include <IC/FPControl.h>
#include <IC/NodeStore.h>

#include "PluginHarness.h"
#include "Recorders.h"

#include <typeinfo>

namespace {

using ictest::expectError;
using ictest::kLogFP;
using ictest::recs;
using ictest::seen;
using Strings = std::vector<std::string>;

// The loader fills no store, so a reload announces nothing; a call would
// show as this error in the reload's result.
IC::Error sink(std::vector<IC::Alert> const&) { return IC::Error(1, IC::Number(99u), "not expected"); }
std::size_t count(Strings const& v, std::string const& s) { return static_cast<std::size_t>(std::count(v.begin(), v.end(), s)); }

class FPControlTest : public testing::Test {
protected:
    void TearDown() override
    {
        for (auto& r : libs_) {
            static_cast<IC::FunctionalPlugIn*>(r.plugin)->release();
            SD::PlatformUtilities::unloadLibrary(r.handle);
        }
        EXPECT_FALSE(ictest::isMapped(tree_.root()));
    }
    IC::Error load()
    {
        std::set<std::string> loaded;
        for (auto const& r : libs_)
            loaded.insert(r.name);
        toLoad_ = ictest::discover(tree_.fpDir(), loaded);
        return IC::FPControl().myloadFPs(counter_, libs_, fps_, store_, services_, toLoad_);
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
// the services as given; the failed one is abandoned (closed, not
// released). With FPs loaded, a failure is only counted.
TEST_F(FPControlTest, LoadsEachWithTheNextNumberAndCountsTheFailures)
{
    tree_.addFP("fp_one", "a1.so");
    tree_.addFP("fp_initfails", "a2.so");
    std::string const path = tree_.addFP("fp_two", "a3.so");
    ictest::LogCapture cap;
    expectError(load(), 0, IC::Number(1u), "Count of FPs that did not load");
    EXPECT_EQ(ictest::calls(cap, "fp_two"), (Strings{"fp_two:OpenFP", "fp_two:Initialize base=2686976"}));
    EXPECT_EQ(count(ictest::calls(cap), "fp_initfails:release"), 0u);
    auto const &one = seen("fp_one"), &two = seen("fp_two");
    EXPECT_TRUE(one.base == 40u << 16 && two.base == 41u << 16 && counter_ == 42);
    ASSERT_TRUE(two.services);
    ictest::expectServices(*two.services, someMis_, &facade_);
    EXPECT_TRUE(fps_.size() == 2u && fps_[0] == one.object && fps_[1] == two.object);
    EXPECT_EQ(recs(toLoad_), (Strings{"a1.so 40", "a3.so 41"}));
    EXPECT_EQ(recs(libs_), recs(toLoad_));
    EXPECT_TRUE(libs_[1].handle == toLoad_[1].handle && libs_[1].path == path && libs_[1].plugin == two.object);
    ictest::expectEvent(cap, {kLogFP, "FPControl"}, "myloadFPs: " + path + " Initialize Done", 3000, "myloadFPs");
    ictest::fs::remove(at("a2.so"));
    tree_.addFP("fp_code");
    expectError(load(), 0, IC::Number(1u), "Count of FPs that did not load");
    EXPECT_TRUE(fps_.size() == 2u && counter_ == 42 && toLoad_.empty());

    // Only a full path names a record to delete. A plug-in missing from the
    // list still goes, and is reported.
    cap.clear();
    IC::FPControl().deleteFP(libs_, "a1.so", fps_);
    IC::FPControl().deleteFP(libs_, at("a1.so"), fps_);
    fps_.clear();
    IC::FPControl().deleteFP(libs_, path, fps_);
    EXPECT_EQ(ictest::calls(cap), (Strings{"fp_one:release", "fp_one:image unloaded", "fp_two:release",
                                           "fp_two:image unloaded"}));
    EXPECT_EQ(cap.messages(kLogFP), (Strings{"deleteFP: FP not found in FP vector", "deleteFP: FP not found in FP vector"}));
    EXPECT_TRUE(libs_.empty());
}

// One library that fails, each way it can: its line, the whole load failed,
// no number used, the library closed, never released.
TEST_F(FPControlTest, EveryWayToFailIsLoggedUnloadedAndCounted)
{
    auto const err = [](char const* text) { return ictest::errText(IC::Error(1, IC::Number(7u), text)); };
    std::string const thrown = std::string("Exception init exploded Type=") + typeid(std::runtime_error).name();
    struct Case {
        char const* module;
        std::string message; // {path} stands for the library's path
    } const cases[] = {{"fp_noentry", "myloadFPs: {path} OpenFP not found"},
                       {"fp_code", "myloadFPs: {path} OpenFP failed, code=X"},
                       {"fp_nullerror", "myloadFPs: {path} Pointer to Error is NULL"},
                       {"fp_errstatus", "OpenFP(): " + err("fp refused")},
                       {"fp_nullobject", "myloadFPs: {path} OpenFP pointer is NULL"},
                       {"fp_initfails", "FP Initialize(): " + err("fp init refused")},
                       {"fp_throwinit", "myloadFPs: " + thrown + " for {path}"},
                       {"fp_throwint", "myloadFPs Caught exception for {path}"}};
    for (auto const& c : cases) {
        SCOPED_TRACE(c.module);
        std::string const path = tree_.addFP(c.module);
        ictest::LogCapture cap;
        expectError(load(), 1, IC::Number(1u), "No FPs were loaded");
        std::string message = c.message;
        if (message.find("{path}") != std::string::npos)
            message.replace(message.find("{path}"), 6, path);
        EXPECT_EQ(cap.count(kLogFP, 6000, message), 1u) << message;
        EXPECT_TRUE(counter_ == 40 && toLoad_.empty() && libs_.empty() && fps_.empty());
        EXPECT_FALSE(ictest::isMapped(path));
        EXPECT_EQ(count(ictest::calls(cap), std::string(c.module) + ":release"), 0u);
        ictest::fs::remove(path);
    }
}

// Loaded in name order; unchanged, nothing happens; removed, released;
// renamed, loaded again with a new number. Additions that fail are counted,
// or fail the reload when no FP is left.
TEST_F(FPControlTest, AReloadFollowsTheDirectory)
{
    std::string const one = tree_.addFP("fp_one"), two = tree_.addFP("fp_two");
    ictest::LogCapture cap;
    expectError(reload(), 0);
    EXPECT_EQ(recs(libs_), (Strings{"fp_one.so 40", "fp_two.so 41"}));
    EXPECT_EQ(cap.count(kLogFP, 3000, " reloadFPs: Done adding FPs"), 1u);
    cap.clear();
    expectError(reload(), 0);
    EXPECT_EQ(cap.messages(kLogFP), (Strings{" reLoadFPs:", " reloadFPs: Done - no additions"}));
    ictest::fs::remove(two);
    expectError(reload(), 0);
    EXPECT_TRUE(count(ictest::calls(cap), "fp_two:release") == 1u && !ictest::isMapped(two));
    ictest::fs::rename(one, at("fp_renamed.so"));
    expectError(reload(), 0);
    EXPECT_EQ(count(ictest::calls(cap), "fp_one:release"), 1u);
    EXPECT_EQ(seen("fp_one").base, 42u << 16);
    EXPECT_EQ(recs(libs_), Strings{"fp_renamed.so 42"});
    EXPECT_EQ(fps_.size(), 1u);
    tree_.addFP("fp_code");
    expectError(reload(), 0, IC::Number(1u), "Count of FPs that did not load");
    ictest::fs::remove(at("fp_renamed.so"));
    ictest::fs::remove(at("fp_code.so"));
    tree_.addFP("fp_initfails");
    expectError(reload(), 1, IC::Number(1u), "No FPs were loaded");
    EXPECT_TRUE(fps_.empty() && libs_.empty());
}

} // namespace
