// Plug-in discovery (IC::LoadControl), and loading, removal and reload of
// management interfaces (IC::MIControl) and functional plug-ins
// (IC::FPControl), driven directly with local lists and a local node store,
// against real plug-ins.
#include <IC/FPControl.h>
#include <IC/MIControl.h>
#include <IC/NodeStore.h>

#include "PluginHarness.h"
#include "Recorders.h"

#include <sys/stat.h>
#include <typeinfo>
#include <unistd.h>

namespace {

using namespace ictest;
using Strings = std::vector<std::string>;
using MIs = std::vector<IC::ManagementInterface*>;

int const kContext = 0; // stands for the facade
IC::Number const kIV(IC::Version2{1, 0}), kMV(IC::Version2{2, 3});

std::string err(char const* text) { return ictest::errText(IC::Error(1, IC::Number(7u), text)); }
IC::ManagementInterface* object(ictest::Seen const& s) { return static_cast<IC::ManagementInterface*>(s.object); }
// A reload of FPs announces nothing here (their nodes are not in the
// store); a call would show as this error in its result.
IC::Error sink(std::vector<IC::Alert> const&) { return IC::Error(1, IC::Number(99u), "not expected"); }

// Records follow those already there, in the directory's name order; what
// does not open is left out. Every scan opens the libraries again, and a
// separator after the directory changes only the paths.
TEST(FindLibs, OpensEveryLibraryOfTheDirectoryInNameOrder)
{
    ictest::TempTree tree;
    std::string const dir = tree.miDir();
    tree.install(dir, "mi_alpha", "c.so");
    tree.install(dir, "mi_beta", "a.so");
    tree.write("mi/b.so", "this is not an ELF file");
    tree.write("mi/readme.txt", "not a plug-in");
    ASSERT_EQ(mkdir((dir + "/d.so").c_str(), 0700) + symlink((dir + "/c.so").c_str(), (dir + "/e.so").c_str()), 0);
    std::vector<IC::libstruct> libs(1);
    libs[0].name = "earlier.so";
    std::set<std::string> names{"kept"};
    ictest::expectError(IC::LoadControl().findLibs(dir, libs, names), 0);
    ictest::expectError(IC::LoadControl().findLibs(dir + "/", libs, names), 0);
    EXPECT_EQ(names, std::set<std::string>{"kept"});
    ASSERT_EQ(libs.size(), 7u);
    for (std::size_t i = 1; i < libs.size(); ++i) {
        std::string const name = std::string(1, "ace"[(i - 1) % 3]) + ".so";
        EXPECT_EQ(libs[i].path, dir + (i > 3 ? "//" : "/") + name);
        EXPECT_TRUE(libs[i].name == name && libs[i].handle && !libs[i].plugin && libs[i].idbase == 0u);
    }
    EXPECT_TRUE(ictest::isMapped(dir));
    for (auto& r : libs)
        SD::PlatformUtilities::unloadLibrary(r.handle);
    EXPECT_FALSE(ictest::isMapped(dir));
    libs.clear();
    ictest::expectError(IC::LoadControl().findLibs(tree.path("none"), libs, names), 0);
    EXPECT_TRUE(libs.empty());
}

// Only the bare name counts, compared byte by byte as unsigned characters,
// a prefix first.
TEST(LibOrder, BothLoadersCompareBareNamesByteWise)
{
    for (auto lt : {&IC::MI_CONTROL::libLT, &IC::FP_CONTROL::libLT}) {
        // {handle, path, name}
        std::vector<IC::libstruct> v{{nullptr, "/a", "mi_b.so"}, {nullptr, "/e", "\xe2\x82\xac.so"},
                                     {nullptr, "/z", "mi_a.so"}, {nullptr, "/m", "MI.so"}, {nullptr, "/n", "mi_a"},
                                     {nullptr, "/p", "\x7f"}};
        std::sort(v.begin(), v.end(), lt);
        std::string names;
        for (auto const& r : v)
            names += r.name + " ";
        EXPECT_EQ(names, "MI.so mi_a mi_a.so mi_b.so \x7f \xe2\x82\xac.so ");
        EXPECT_FALSE(lt({nullptr, "/one", "same.so"}, {nullptr, "/two", "same.so"}));
    }
}

class Loaders : public testing::Test {
protected:
    void SetUp() override { ictest::Recorder::get().reset(); }
    void TearDown() override
    {
        for (auto& r : fplibs_)
            static_cast<IC::FunctionalPlugIn*>(r.plugin)->release();
        for (auto& r : libs_)
            static_cast<IC::ManagementInterface*>(r.plugin)->release();
        for (auto* list : {&fplibs_, &libs_})
            for (auto& r : *list)
                SD::PlatformUtilities::unloadLibrary(r.handle);
        EXPECT_FALSE(ictest::isMapped(tree_.root())) << "every library the loader opened is closed again";
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
    IC::Error loadFPs(std::set<std::string> skip = {})
    {
        for (auto const& r : fplibs_)
            skip.insert(r.name);
        toLoad_ = ictest::discover(tree_.fpDir(), skip);
        return IC::FPControl().myloadFPs(counter_, fplibs_, fps_, store_, services_, toLoad_);
    }
    IC::Error reloadFPs()
    {
        return IC::FPControl().reLoadFPs(counter_, fplibs_, fps_, store_, services_, IC::AlertSink(&sink), names_);
    }

    ictest::TempTree tree_;
    ictest::EnvGuard miEnv_{"IC_MI_DIR", tree_.miDir()}, fpEnv_{"IC_FP_DIR", tree_.fpDir()};
    unsigned short counter_ = 7;
    std::vector<IC::libstruct> libs_, fplibs_, toLoad_;
    MIs mis_;
    std::vector<IC::FunctionalPlugIn*> fps_;
    std::set<std::string> names_;
    IC::NodeStore store_;
    IC::InstrumentationControl facade_;
    IC::ICforFP services_ = ictest::makeServices(mis_, &facade_);
};

// Of three interfaces and three FPs, the second of each fails in Initialize:
// the others take consecutive numbers, an interface every callback in order,
// an FP the services as given; the failures are counted.
TEST_F(Loaders, LoadsEachWithTheNextNumberAndItsCallbacksAndCountsTheFailures)
{
    std::string const path = tree_.addMI("mi_alpha", "a1.so");
    tree_.addMI("mi_initfails", "a2.so");
    tree_.addMI("mi_beta", "a3.so");
    tree_.addFP("fp_one", "a1.so");
    tree_.addFP("fp_initfails", "a2.so");
    std::string const fpPath = tree_.addFP("fp_two", "a3.so");
    ictest::LogCapture cap;
    expectError(load(), 0, IC::Number(1u), "Count of MIs that did not load");
    EXPECT_EQ(ictest::calls(cap, "mi_alpha"),
              (Strings{"mi_alpha:OpenMI", "mi_alpha:registerNodeCallBacks", "mi_alpha:Initialize base=458752 iv=1.0 mv=2.3",
                       "mi_alpha:registerForAlerts", "mi_alpha:getMap"}));
    ictest::expectEvent(cap, {kLogMI, "MIControl"}, "myloadMIs: " + path + " Initialize Done", 3000, "myloadMIs");
    auto const& a = seen("mi_alpha");
    EXPECT_TRUE(a.arrival == &ictest::recArrival && a.arrivalContext == &kContext && a.lookup == &ictest::recLookup);
    EXPECT_TRUE(a.alert == &ictest::recAlert && a.alertContext == a.object) << "alerts come back with the interface";
    EXPECT_TRUE(a.base == 7u << 16 && seen("mi_beta").base == 8u << 16 && counter_ == 9);
    EXPECT_EQ(mis_, (MIs{object(a), object(seen("mi_beta"))}));
    EXPECT_EQ(recs(toLoad_), (Strings{"a1.so 7", "a3.so 8"}));
    EXPECT_EQ(recs(libs_), recs(toLoad_));
    EXPECT_TRUE(libs_[0].handle == toLoad_[0].handle && libs_[0].path == path && libs_[0].plugin == a.object);

    expectError(loadFPs(), 0, IC::Number(1u), "Count of FPs that did not load");
    EXPECT_EQ(ictest::calls(cap, "fp_two"), (Strings{"fp_two:OpenFP", "fp_two:Initialize base=655360"}));
    auto const &one = seen("fp_one"), &two = seen("fp_two");
    EXPECT_TRUE(one.base == 9u << 16 && two.base == 10u << 16 && counter_ == 11);
    ASSERT_TRUE(two.services);
    EXPECT_TRUE(two.services->getAlertCallBackFP() == &svAlert && two.services->getInstrumentationControl() == &facade_);
    EXPECT_TRUE(fps_.size() == 2u && fps_[0] == one.object && fps_[1] == two.object);
    EXPECT_EQ(recs(toLoad_), (Strings{"a1.so 9", "a3.so 10"}));
    EXPECT_EQ(recs(fplibs_), recs(toLoad_));
    EXPECT_TRUE(fplibs_[1].handle == toLoad_[1].handle && fplibs_[1].path == fpPath && fplibs_[1].plugin == two.object);
}

// One library that fails, each way it can: its line, the whole load failed,
// no number used, the library closed, never released.
TEST_F(Loaders, EveryWayToFailIsLoggedUnloadedAndCounted)
{
    // A few of the error lines, each kind of failure once; the others are
    // only counted.
    std::string const thrown = std::string(" exploded Type=") + typeid(std::runtime_error).name();
    struct Case {
        char const* module;
        std::string message; // {path} stands for the library's path
    } const cases[] = {{"mi_noentry", "myloadMIs: {path} OpenMI() function is missing."},
                       {"mi_errstatus", "OpenMI() failed: " + err("mi refused")},
                       {"mi_initfails", "MI Initialize: " + err("mi init refused")},
                       {"mi_regfails", "MIControl MI registerForAlerts: " + err("mi alerts refused")},
                       {"mi_throwinit", "myloadMIs: Exception init" + thrown + " for {path}"},
                       {"fp_nullobject", "myloadFPs: {path} OpenFP pointer is NULL"},
                       {"fp_throwint", "myloadFPs Caught exception for {path}"},
                       {"mi_code", ""}, {"mi_nullerror", ""}, {"mi_nullobject", ""},
                       {"mi_throwint", ""}, {"fp_noentry", ""}, {"fp_code", ""}, {"fp_nullerror", ""},
                       {"fp_errstatus", ""}, {"fp_initfails", ""}, {"fp_throwinit", ""}};
    for (auto const& c : cases) {
        SCOPED_TRACE(c.module);
        bool const isMI = c.module[0] == 'm';
        std::string const path = isMI ? tree_.addMI(c.module) : tree_.addFP(c.module);
        ictest::LogCapture cap;
        expectError(isMI ? load() : loadFPs(), 1, IC::Number(1u), isMI ? "No MIs were loaded" : "No FPs were loaded");
        std::string message = c.message;
        if (message.find("{path}") != std::string::npos)
            message.replace(message.find("{path}"), 6, path);
        EXPECT_TRUE(message.empty() || cap.count(isMI ? kLogMI : kLogFP, 6000, message) == 1u) << message;
        EXPECT_TRUE(counter_ == 7 && toLoad_.empty() && libs_.empty() && mis_.empty() && fplibs_.empty() && fps_.empty());
        EXPECT_FALSE(ictest::isMapped(path));
        EXPECT_EQ(count(ictest::calls(cap), std::string(c.module) + ":release"), 0u);
        ictest::fs::remove(path);
    }
}

// A map that cannot be read leaves the interface loaded; known nodes pass
// silently (status 6).
TEST_F(Loaders, AnInterfaceWhoseMapCannotBeReadIsKept)
{
    for (char const* m : {"mi_alpha", "mi_mapfails", "mi_mapthrows"})
        tree_.addMI(m);
    ictest::LogCapture cap;
    expectError(load(), 0);
    EXPECT_EQ(cap.count(kLogMI, 6000, "MIControl MI getMap() Failed: " + err("mi map refused")), 1u);
    EXPECT_EQ(cap.count(kLogMI, 6000, std::string("getMINodeSensors getMap(): Exception map exploded Type=") +
                                          typeid(std::runtime_error).name()), 1u);
    EXPECT_EQ(mis_.size(), 3u);
    EXPECT_EQ(IC::MIControl().getMINodeSensors(mis_[0], store_).getStatus(), 6);
}

// ---- reload ----

class ReloadMIs : public Loaders {
protected:
    // alpha and beta loaded by a first reload, in name order, which tells
    // nobody; then fp_two.
    void SetUp() override
    {
        Loaders::SetUp();
        betaPath_ = tree_.addMI("mi_beta");
        alphaPath_ = tree_.addMI("mi_alpha");
        ASSERT_EQ(reload().getStatus(), 0);
        ASSERT_EQ(recs(libs_), (Strings{"mi_alpha.so 7", "mi_beta.so 8"}));
        tree_.addFP("fp_two");
        services_ = ictest::makeServices(mis_, nullptr);
        loadFPs();
        ASSERT_TRUE(fps_.size() == 1u && ictest::Recorder::get().calls().empty());
    }
    std::string alphaPath_, betaPath_;
};

// A removal releases without shutdown; the FPs are told, and their nodes new
// to the store announced as one batch without context. A renamed library is
// one removal and one addition with a new number.
TEST_F(ReloadMIs, ChangesAreToldToTheFPsAndTheirNewNodesAnnouncedOnce)
{
    auto const beta = object(seen("mi_beta"));
    ictest::fs::remove(betaPath_);
    ictest::LogCapture cap;
    expectError(reload(), 0);
    Strings const c = ictest::calls(cap);
    EXPECT_EQ(c, (Strings{"mi_beta:release", "mi_beta:image unloaded", "fp_two:updatedMis added=0 removed=1",
                          "fp_two:getMap"}));
    EXPECT_EQ(recs(libs_), Strings{"mi_alpha.so 7"});
    EXPECT_EQ(mis_.size(), 1u);
    EXPECT_TRUE(seen("fp_two").added.empty() && seen("fp_two").removed == MIs{beta});
    auto const calls = ictest::Recorder::get().calls();
    ASSERT_EQ(calls.size(), 1u);
    EXPECT_EQ(calls[0].context, nullptr);
    Strings want;
    for (IC::Node* n : seen("fp_two").nodes)
        want.push_back(ictest::sig(IC::Alert(3, IC::Alert::NodeArrival, {store_.getNodePath(n)}, n->getNodeNumber(),
                                             "MIControl")));
    EXPECT_EQ(ictest::sigs(calls[0].alerts), want);
    std::vector<IC::Node*> listed;
    store_.getMap(listed);
    EXPECT_EQ(listed, seen("fp_two").nodes);

    auto const oldAlpha = object(seen("mi_alpha"));
    ictest::fs::rename(alphaPath_, tree_.miDir() + "/zz_alpha.so");
    cap.clear();
    expectError(reload(), 0);
    EXPECT_TRUE(seen("mi_alpha").base == 10u << 16 && counter_ == 11);
    EXPECT_EQ(recs(libs_), Strings{"zz_alpha.so 10"});
    EXPECT_TRUE(seen("fp_two").added == MIs{object(seen("mi_alpha"))} && seen("fp_two").removed == MIs{oldAlpha});
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
    auto const c = ictest::calls(cap);
    for (char const* fp : {"fp_two", "fp_updatefails", "fp_mapfails"})
        EXPECT_EQ(count(c, std::string(fp) + ":updatedMis added=1 removed=0"), 1u) << fp;
    EXPECT_EQ(count(c, "fp_updatefails:getMap"), 0u);
    EXPECT_EQ(cap.count(kLogMI, 6000, "MIControl FP getMap(): " + err("fp map refused")), 1u);
    EXPECT_EQ(cap.count(kLogMI, 6000, "MIControl Throw Load Alerts: " + ictest::errText(refused)), 1u);
    ASSERT_EQ(ictest::Recorder::get().calls().size(), 1u);
    EXPECT_EQ(ictest::Recorder::get().calls()[0].alerts.size(), 2u) << "fp_two's nodes only";
}

// A file replaced under a loaded name is not reloaded. Without FPs a change
// ends in success. When no interface is left, the reload fails before
// telling the FPs.
TEST_F(ReloadMIs, WhenNothingChangesOrNobodyIsLeftNobodyIsTold)
{
    ictest::fs::remove(alphaPath_);
    tree_.install(tree_.miDir(), "mi_gamma", "mi_alpha.so");
    ictest::LogCapture cap;
    expectError(reload(), 0);
    EXPECT_EQ(counter_, 10);
    EXPECT_EQ(ictest::calls(cap), Strings{"mi_gamma:image unloaded"}) << "only mi_gamma's image came and went";
    std::vector<IC::FunctionalPlugIn*> none;
    std::swap(fps_, none);
    ictest::fs::remove(alphaPath_);
    expectError(reload(), 0);
    std::swap(fps_, none);
    ictest::fs::remove(betaPath_);
    tree_.addMI("mi_code");
    expectError(reload(), 1, IC::Number(1u), "No MIs were loaded");
    auto const c = ictest::calls(cap);
    EXPECT_EQ(count(c, "mi_alpha:release") + count(c, "mi_beta:release"), 2u);
    EXPECT_TRUE(mis_.empty() && libs_.empty() && ictest::calls(cap, "fp_two").empty());
    EXPECT_TRUE(ictest::Recorder::get().calls().empty());
}

// Loaded in name order; unchanged, nothing happens; removed, released;
// renamed, loaded again with a new number. Additions that fail are counted,
// or fail the reload when no FP is left.
TEST_F(Loaders, AReloadFollowsTheDirectory)
{
    std::string const one = tree_.addFP("fp_one"), two = tree_.addFP("fp_two");
    ictest::LogCapture cap;
    expectError(reloadFPs(), 0);
    EXPECT_EQ(recs(fplibs_), (Strings{"fp_one.so 7", "fp_two.so 8"}));
    expectError(reloadFPs(), 0);
    EXPECT_EQ(cap.count(kLogFP, 3000, " reloadFPs: Done - no additions"), 1u);
    ictest::fs::remove(two);
    expectError(reloadFPs(), 0);
    EXPECT_TRUE(count(ictest::calls(cap), "fp_two:release") == 1u && !ictest::isMapped(two));
    ictest::fs::rename(one, tree_.fpDir() + "/fp_renamed.so");
    expectError(reloadFPs(), 0);
    EXPECT_EQ(count(ictest::calls(cap), "fp_one:release"), 1u);
    EXPECT_EQ(seen("fp_one").base, 9u << 16);
    EXPECT_EQ(recs(fplibs_), Strings{"fp_renamed.so 9"});
    EXPECT_EQ(fps_.size(), 1u);
    tree_.addFP("fp_code");
    expectError(reloadFPs(), 0, IC::Number(1u), "Count of FPs that did not load");
    ictest::fs::remove(tree_.fpDir() + "/fp_renamed.so");
    ictest::fs::remove(tree_.fpDir() + "/fp_code.so");
    tree_.addFP("fp_initfails");
    expectError(reloadFPs(), 1, IC::Number(1u), "No FPs were loaded");
    EXPECT_TRUE(fps_.empty() && fplibs_.empty());
}

} // namespace
