// The health functional plug-in, loaded by the real library from temporary
// plug-in directories next to the fake management interface (fakehw), whose
// alerts the tests raise through its control functions. Delivery is
// synchronous: when fakehw_raise returns, every client has its alerts.
#include <IC/AlertRegister.h>
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>
#include <SD/Mutex.h>

#include "Recorders.h"
#include "ShippedAlerts.h"
#include "TestSupport.h"

#include <dlfcn.h>

namespace fs = std::filesystem;

namespace {

using IC::Alert;
using IC::Node;

// fakehw_raise of the fakehw image the library loaded from file.
using RaiseFn = int (*)(unsigned int, unsigned int, unsigned char, unsigned int, unsigned int, char const*);
RaiseFn raiseOf(fs::path const& file)
{
    // Our reference goes at once: the library alone decides when the image
    // is unmapped.
    void* h = dlopen(file.c_str(), RTLD_NOW | RTLD_NOLOAD);
    EXPECT_NE(h, nullptr) << file;
    auto const f = reinterpret_cast<RaiseFn>(dlsym(h, "fakehw_raise"));
    dlclose(h);
    return f;
}

class HealthTest : public ::testing::Test {
protected:
    HealthTest()
    {
        ictest::Recorder::get().reset();
        for (fs::path const& d : {mi_, fp_})
            fs::create_directories(d);
        fs::create_symlink(FAKEHW_PLUGIN, mi_ / "fakehw.so");
        addHealth();
    }
    ~HealthTest() override
    {
        if (ic_)
            Unloadlib();
    }

    void addHealth() { fs::create_symlink(HEALTH_PLUGIN, fp_ / "health.so"); }

    void open()
    {
        IC::Error* err = nullptr;
        ASSERT_EQ(Open(&ic_, &err), 0);
        hw_ = raiseOf(mi_ / "fakehw.so");
        temp_ = ic_->printablePathToPath("1f2b01f501f201f5c0");
        fan_ = ic_->printablePathToPath("2f2901f201f5c0");
        chassis_ = ic_->printablePathToPath("1f201f5c");
    }

    void raise(Node::SensorType type, unsigned int instance, unsigned char severity, unsigned int cls,
               unsigned int status, char const* message, RaiseFn hw = nullptr)
    {
        ASSERT_EQ((hw ? hw : hw_)(type, instance, severity, cls, status, message), 0);
    }

    // What the asserted store holds, as "class/status/message" by path.
    std::map<std::string, std::string> asserted() const
    {
        std::vector<Alert> all;
        EXPECT_EQ(ic_->getAssertedAlerts(all).getStatus(), 0);
        std::map<std::string, std::string> out;
        for (Alert const& a : all)
            for (std::string const& p : a.nodePaths())
                out[p] = std::to_string(a.getClass()) + "/" + std::to_string(a.getStatus()) + "/" +
                         (a.getClass() == shipped::kHealthRollup ? "" : a.getMessage());
        return out;
    }

    // A client registration by class or by sensor type; what it receives
    // is recorded under the context returned.
    void const* watch(Alert::ClassType cls)
    {
        void const* context = reinterpret_cast<void const*>(++contexts_);
        EXPECT_EQ(IC::InstCtrl::registerForAlerts(ictest::recAlert, cls, context).getStatus(), 0);
        return context;
    }
    void const* watch(Node::SensorType type)
    {
        void const* context = reinterpret_cast<void const*>(++contexts_);
        EXPECT_EQ(ic_->registerForAlerts(ictest::recAlert, type, context).getStatus(), 0);
        return context;
    }
    static std::vector<std::string> got(void const* context)
    {
        std::vector<std::string> out;
        for (ictest::AlertCall const& call : ictest::Recorder::get().calls(context))
            for (Alert const& a : call.alerts)
                out.push_back(ictest::sig(a));
        return out;
    }

    ictest::TempDir dir_{"ic-health"};
    fs::path mi_ = dir_.path("mi");
    fs::path fp_ = dir_.path("fp");
    ictest::EnvGuard miEnv_{"IC_MI_DIR", mi_.string()};
    ictest::EnvGuard fpEnv_{"IC_FP_DIR", fp_.string()};
    IC::InstrumentationControl* ic_ = nullptr;
    RaiseFn hw_ = nullptr;
    std::string temp_, fan_, chassis_;
    std::uintptr_t contexts_ = 0;
};

// ---------------------------------------------------------------- relaying

TEST_F(HealthTest, RelaysOnceTheAssertedStoreFollowsTheStatusAndAReloadedPlugInTakesOver)
{
    open();
    void const* temps = watch(Node::TemperatureSensor);
    void const* fans = watch(Node::Fan);
    raise(Node::TemperatureSensor, 0, 2, shipped::kThreshold, 3, "hot");
    // Once: the plug-in does not relay its own relay.
    EXPECT_EQ(got(temps), std::vector<std::string>{ictest::sig(Alert(2, shipped::kThreshold, {temp_}, 3, "hot"))});
    EXPECT_TRUE(got(fans).empty());
    EXPECT_EQ(asserted()[temp_], "5/3/hot");
    // The store holds one alert per path: the roll-up takes its place back
    // after one on the chassis itself.
    raise(Node::Chassis, 0, 1, 9, 2, "chassis warm");
    EXPECT_EQ(asserted()[chassis_], "8/3/");
    raise(Node::Chassis, 0, 0, 9, 1, "chassis ok");
    raise(Node::TemperatureSensor, 0, 1, shipped::kThreshold, 2, "warm");
    EXPECT_EQ(asserted()[temp_], "5/2/warm");
    raise(Node::TemperatureSensor, 0, 0, shipped::kThreshold, 1, "normal");
    EXPECT_TRUE(asserted().empty()) << "the roll-up is cleared with the last alert";

    // A removal whose status asserts: nothing may stay on a path that is gone.
    void const* removals = watch(Alert::NodeRemoval);
    raise(Node::Fan, 1, 2, shipped::kThreshold, 3, "fan stopped");
    raise(Node::Fan, 1, 1, Alert::NodeRemoval, 2, "fan removed");
    EXPECT_EQ(got(removals),
              std::vector<std::string>{ictest::sig(Alert(1, Alert::NodeRemoval, {fan_}, 2, "fan removed"))});
    EXPECT_TRUE(asserted().empty());

    // Released, it relays nothing any more (a registration left behind would
    // call into the unloaded image).
    raise(Node::TemperatureSensor, 0, 2, shipped::kThreshold, 3, "hot");
    fs::remove(fp_ / "health.so");
    IC::InstCtrl::TimedReload();
    std::size_t const relayed = got(temps).size();
    raise(Node::TemperatureSensor, 0, 2, shipped::kThreshold, 3, "hotter");
    EXPECT_EQ(got(temps).size(), relayed);
    // The new instance clears the roll-up the old one raised.
    addHealth();
    IC::InstCtrl::TimedReload();
    void const* rollups = watch(shipped::kHealthRollup);
    raise(Node::TemperatureSensor, 0, 0, shipped::kThreshold, 1, "normal");
    EXPECT_TRUE(asserted().empty());
    EXPECT_EQ(got(rollups), std::vector<std::string>{ictest::sig(Alert(0, shipped::kHealthRollup, {chassis_}, 1,
                                                                       "health: all clear, no asserted alerts"))});
}

// ---------------------------------------------------------------- roll-up

TEST_F(HealthTest, RollUpCarriesTheWorstAssertedConditionAndARemovedInterfaceIsWithdrawn)
{
    open();
    void const* rollups = watch(shipped::kHealthRollup);
    std::string const temp = " on " + ic_->pathToPrintablePath(temp_) + ": ";
    std::string const fan = " on " + ic_->pathToPrintablePath(fan_) + ": ";
    std::string const two = "health: 2 asserted alerts, worst ";
    // A raise, then how many roll-ups so far and the last one.
    struct Step { Node::SensorType type; unsigned char severity; unsigned int status; char const* message;
                  std::size_t count; unsigned char rollupSeverity; unsigned int rollupStatus; std::string rollupMessage;
    } const steps[] = {
        {Node::Fan, 1, 2, "fan slow", 1, 1, 2, "health: 1 asserted alert, worst warning" + fan + "fan slow"},
        {Node::Fan, 1, 2, "fan still slow", 1, 1, 2, "health: 1 asserted alert, worst warning" + fan + "fan slow"},
        {Node::TemperatureSensor, 2, 3, "hot", 2, 2, 3, two + "critical" + temp + "hot"},
        {Node::TemperatureSensor, 0, 2, "warm", 3, 1, 2, two + "warning" + fan + "fan still slow"},
        // Critical by its severity alone, or by its status alone.
        {Node::Fan, 2, 2, "fan failing", 4, 2, 3, two + "critical" + fan + "fan failing"},
        {Node::Fan, 0, 3, "fan odd", 5, 0, 3, two + "information" + fan + "fan odd"},
        {Node::TemperatureSensor, 0, 1, "temp ok", 5, 0, 3, two + "information" + fan + "fan odd"},
        {Node::Fan, 0, 1, "fan ok", 6, 0, 1, "health: all clear, no asserted alerts"},
    };
    for (Step const& s : steps) {
        raise(s.type, s.type == Node::Fan ? 1 : 0, s.severity, shipped::kThreshold, s.status, s.message);
        std::vector<std::string> const all = got(rollups);
        ASSERT_EQ(all.size(), s.count) << s.message;
        EXPECT_EQ(all.back(), ictest::sig(Alert(s.rollupSeverity, shipped::kHealthRollup, {chassis_},
                                                s.rollupStatus, s.rollupMessage)));
        EXPECT_EQ(asserted()[chassis_], s.rollupStatus == 1 ? "" : "8/" + std::to_string(s.rollupStatus) + "/");
    }

    // Concurrent alerts that both end normal: the last roll-up delivered and
    // the store agree.
    std::size_t const before = got(rollups).size();
    auto storm = [this](Node::SensorType type, unsigned int instance) {
        for (int i = 0; i < 200; ++i)
            hw_(type, instance, i % 2 ? 0 : 2, shipped::kThreshold, i % 2 ? 1 : 3, "storm");
    };
    {
        ictest::JoinedThread a(storm, Node::TemperatureSensor, 0);
        ictest::JoinedThread b(storm, Node::Fan, 1);
    }
    EXPECT_TRUE(asserted().empty());
    ASSERT_GT(got(rollups).size(), before);
    EXPECT_EQ(got(rollups).back().substr(0, 6), "0/8/1/");

    // What an interface asserted is withdrawn when it goes.
    fs::create_symlink(FAKEHW2_PLUGIN, mi_ / "fakehw2.so");
    IC::InstCtrl::TimedReload();
    RaiseFn const second = raiseOf(mi_ / "fakehw2.so");
    std::string const temp2 = ic_->printablePathToPath("1f2b01f501f202f5c0");
    raise(Node::TemperatureSensor, 0, 2, shipped::kThreshold, 3, "second hot", second);
    raise(Node::Fan, 1, 1, shipped::kThreshold, 2, "first fan slow");
    EXPECT_EQ(asserted(), (std::map<std::string, std::string>{
                              {temp2, "5/3/second hot"}, {fan_, "5/2/first fan slow"}, {chassis_, "8/3/"}}));

    // Told, as a reload would, that the second interface went: its nodes
    // stay, so only the plug-in's own bookkeeping knows what it asserted.
    SD::MutexGuard g(IC::InstCtrl::loadlock);
    IC::ManagementInterface* gone = nullptr;
    for (IC::libstruct const& lib : IC::InstCtrl::mymilibs)
        if (lib.name == "fakehw2.so")
            gone = static_cast<IC::ManagementInterface*>(lib.plugin);
    ASSERT_NE(gone, nullptr);
    ASSERT_EQ(IC::InstCtrl::myfps.size(), 1u);
    EXPECT_EQ(IC::InstCtrl::myfps[0]->updatedMis({}, {gone}).getStatus(), 0);
    EXPECT_EQ(asserted(), (std::map<std::string, std::string>{{fan_, "5/2/first fan slow"}, {chassis_, "8/2/"}}));
}

// ------------------------------------------------ with the Linux interface

#ifdef LINUXHW_PLUGIN

TEST_F(HealthTest, LinuxHwConditionsPresentAtStartAreAssertedWhenOpenReturns)
{
    fs::remove(mi_ / "fakehw.so");
    fs::create_symlink(LINUXHW_PLUGIN, mi_ / "linuxhw.so");
    ictest::EnvGuard poll("IC_LINUXHW_POLL_MS", "50");
    std::string const dimm = "DIMM CPU_SrcID#1_MC#0_Chan#2_DIMM#0";
    std::string const chassis = "System Acme Computers Rack R720";
    // What getAssertedAlerts lists at once, by node description.
    std::map<std::string, std::map<std::string, std::string>> const trees = {
        {"small", {}},
        {"degraded",
         {{chassis, "8/3/"},
          {dimm, "6/2/" + dimm + ": 2 corrected memory errors counted"},
          {"DIMM CPU_SrcID#0_MC#0_Chan#3_DIMM#0", "6/3/DIMM CPU_SrcID#0_MC#0_Chan#3_DIMM#0: 1 uncorrected memory errors counted"},
          {"Power supply PSU2 (Mains)", "5/3/Power supply PSU2 (Mains) has no input power"},
          {"Disk sdb: ST4000NM0035-1V4 (4001 GB)", "5/3/Disk sdb: ST4000NM0035-1V4 (4001 GB) is offline"},
          {"nct6779 fan3 speed", "5/2/nct6779 fan3 speed 0 RPM below warning 600 RPM"},
          {"CPU 1 Core 1 temperature", "5/3/CPU 1 Core 1 temperature: hwmon alarm temp3_crit_alarm is set"}}},
    };
    for (auto const& [tree, expected] : trees) {
        SCOPED_TRACE(tree);
        fs::path const root = dir_.path("root-" + tree);
        fs::copy(fs::path(IC_EXAMPLES_DIR) / tree, root, fs::copy_options::recursive | fs::copy_options::copy_symlinks);
        ictest::EnvGuard sysfs("IC_SYSFS_ROOT", root.string());
        IC::Error* err = nullptr;
        ASSERT_EQ(Open(&ic_, &err), 0);
        std::map<std::string, std::string> const now = asserted();
        std::map<std::string, std::string> byNode;
        std::vector<Node*> all;
        ic_->getAllNodes(all);
        for (Node* n : all) {
            // Every node's state agrees with what is asserted on it.
            Node::Property state;
            n->getProperty("state", &state);
            auto const a = now.find(n->getPath());
            if (a != now.end())
                byNode[n->getDescription()] = a->second;
            std::string const level = a == now.end() || a->second[0] == '8' ? "" : a->second.substr(2, 1);
            EXPECT_EQ(level, state.value == "critical" ? "3" : state.value == "warning" ? "2" : "") << n->getDescription();
        }
        EXPECT_EQ(byNode, expected);
        // A poll has run (the reading moved) and raised nothing again.
        void const* conditions = watch(shipped::kThreshold);
        void const* memory = watch(shipped::kMemoryErrors);
        std::ofstream(root / "t.new") << "41000\n";
        fs::rename(root / "t.new", root / "sys/class/hwmon/hwmon0/temp2_input");
        Node* core = *std::find_if(all.begin(), all.end(), [](Node* n) { return n->getDescription() == "CPU 0 Core 0 temperature"; });
        Node::Property reading;
        EXPECT_TRUE(ictest::eventually([&] { return core->getProperty("reading", &reading) && reading.value == "41.0"; }, 8000));
        EXPECT_TRUE(got(conditions).empty() && got(memory).empty()) << ::testing::PrintToString(got(conditions));
        EXPECT_EQ(asserted(), now);
        Unloadlib();
        ic_ = nullptr;
    }
}

#endif // LINUXHW_PLUGIN

} // namespace
