// The health functional plug-in, loaded by the real library from temporary
// plug-in directories next to the fake management interface (fakehw), whose
// alerts the tests raise through its control functions. Delivery is
// synchronous: when fakehw_raise returns, every client has its alerts.
#include <IC/AlertRegister.h>
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>
#include <SD/Mutex.h>

#include "ShippedAlerts.h"

#include <gtest/gtest.h>

#include <dlfcn.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace fs = std::filesystem;

namespace {

using IC::Alert;
using IC::Node;

// ---- the control functions of a fakehw image ----
struct FakeHw {
    int (*raise)(unsigned int, unsigned int, unsigned char, unsigned int, unsigned int,
                 char const*) = nullptr;
    int (*addNode)(unsigned int, unsigned int, unsigned int, unsigned int, char const*) = nullptr;
    int (*removeNode)(unsigned int, unsigned int, unsigned int) = nullptr;
    int (*path)(unsigned int, unsigned int, char*, int) = nullptr;

    // Binds to the image the library loaded from file; false when it is not
    // loaded.
    bool bind(std::string const& file)
    {
        void* h = dlopen(file.c_str(), RTLD_NOW | RTLD_NOLOAD);
        if (!h)
            return false;
        raise = reinterpret_cast<decltype(raise)>(dlsym(h, "fakehw_raise"));
        addNode = reinterpret_cast<decltype(addNode)>(dlsym(h, "fakehw_add_node"));
        removeNode = reinterpret_cast<decltype(removeNode)>(dlsym(h, "fakehw_remove_node"));
        path = reinterpret_cast<decltype(path)>(dlsym(h, "fakehw_path"));
        // Our reference goes again: the library alone decides when the
        // image is unmapped.
        dlclose(h);
        return raise && addNode && removeNode && path;
    }

    std::string pathOf(Node::SensorType type, unsigned int instance) const
    {
        char buf[256];
        int const n = path(type, instance, buf, sizeof buf);
        return n > 0 ? std::string(buf, static_cast<std::size_t>(n)) : std::string();
    }
};

// ---- a client's registration ----
struct Received {
    std::mutex m;
    std::vector<Alert> alerts;
    int batches = 0; // non-empty deliveries

    std::vector<Alert> all()
    {
        std::lock_guard<std::mutex> g(m);
        return alerts;
    }
    std::vector<Alert> ofClass(unsigned int cls)
    {
        std::vector<Alert> out;
        for (Alert const& a : all())
            if (a.getClass() == cls)
                out.push_back(a);
        return out;
    }
};

IC::Error collect(std::vector<Alert> const& alerts, void const* context)
{
    auto* r = static_cast<Received*>(const_cast<void*>(context));
    std::lock_guard<std::mutex> g(r->m);
    if (!alerts.empty())
        ++r->batches;
    r->alerts.insert(r->alerts.end(), alerts.begin(), alerts.end());
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

// Asserted alerts stored under path.
std::vector<Alert> assertedAt(IC::InstrumentationControl* ic, std::string const& path)
{
    std::vector<Alert> all;
    ic->getAssertedAlerts(all);
    std::vector<Alert> out;
    for (Alert const& a : all)
        for (std::string const& p : a.nodePaths())
            if (p == path)
                out.push_back(a);
    return out;
}

// Registers of functional plug-ins, and how many sensor types they hold.
struct FPRegistrations {
    int registers = 0;
    std::size_t sensorTypes = 0;
};
FPRegistrations fpRegistrations()
{
    SD::MutexGuard g(IC::InstCtrl::registerlock);
    FPRegistrations out;
    for (auto const& entry : IC::InstCtrl::callbacks) {
        if (entry.second->getRegType() != IC::FP_REGISTRATION)
            continue;
        ++out.registers;
        out.sensorTypes += entry.second->getSensorTypes().size();
    }
    return out;
}

class HealthTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        char templ[] = "/tmp/ic-health-XXXXXX";
        ASSERT_NE(mkdtemp(templ), nullptr);
        dir_ = templ;
        miDir_ = dir_ / "mi";
        fpDir_ = dir_ / "fp";
        fs::create_directories(miDir_);
        fs::create_directories(fpDir_);
        fs::create_symlink(FAKEHW_PLUGIN, miDir_ / "fakehw.so");
        setenv("IC_MI_DIR", miDir_.c_str(), 1);
        setenv("IC_FP_DIR", fpDir_.c_str(), 1);
    }

    void TearDown() override
    {
        if (opened_)
            Unloadlib();
        std::error_code ec;
        fs::remove_all(dir_, ec);
        unsetenv("IC_MI_DIR");
        unsetenv("IC_FP_DIR");
    }

    void addHealth() { fs::create_symlink(HEALTH_PLUGIN, fpDir_ / "health.so"); }
    void removeHealth() { fs::remove(fpDir_ / "health.so"); }

    void open()
    {
        IC::Error* err = nullptr;
        ASSERT_EQ(Open(&ic_, &err), 0);
        opened_ = true;
        ASSERT_TRUE(hw_.bind((miDir_ / "fakehw.so").string()));
        temp_ = hw_.pathOf(Node::TemperatureSensor, 0);
        fan_ = hw_.pathOf(Node::Fan, 1);
        chassis_ = hw_.pathOf(Node::Chassis, 0);
        ASSERT_FALSE(temp_.empty());
        ASSERT_FALSE(fan_.empty());
        ASSERT_FALSE(chassis_.empty());
    }

    // Raises through fakehw and checks that it was sent.
    void raise(Node::SensorType type, unsigned int instance, unsigned char severity,
               IC::Alert::ClassType cls, unsigned int status, char const* message)
    {
        ASSERT_EQ(hw_.raise(type, instance, severity, cls, status, message), 0);
    }

    fs::path dir_;
    fs::path miDir_;
    fs::path fpDir_;
    bool opened_ = false;
    IC::InstrumentationControl* ic_ = nullptr;
    FakeHw hw_;
    std::string temp_;
    std::string fan_;
    std::string chassis_;
};

// ---------------------------------------------------------------- relaying

TEST_F(HealthTest, WithoutThePlugInClientsSeeNoInterfaceAlerts)
{
    open();
    Received r;
    ASSERT_EQ(ic_->registerForAlerts(collect, Node::TemperatureSensor, &r).getStatus(), 0);
    raise(Node::TemperatureSensor, 0, 2, shipped::kThreshold, 3, "hot");
    EXPECT_TRUE(r.all().empty());
    EXPECT_TRUE(assertedAt(ic_, temp_).empty());
}

TEST_F(HealthTest, RelaysAnInterfaceAlertToASensorRegistrationUnchanged)
{
    addHealth();
    open();
    Received temp;
    Received fan;
    ASSERT_EQ(ic_->registerForAlerts(collect, Node::TemperatureSensor, &temp).getStatus(), 0);
    ASSERT_EQ(ic_->registerForAlerts(collect, Node::Fan, &fan).getStatus(), 0);

    raise(Node::TemperatureSensor, 0, shipped::kSeverityCritical, shipped::kThreshold,
          shipped::kStatusCritical, "CPU temperature 97 C above 95 C");

    std::vector<Alert> const got = temp.all();
    ASSERT_EQ(got.size(), 1u); // once: the plug-in does not relay its own relay
    EXPECT_EQ(temp.batches, 1);
    EXPECT_EQ(got[0].getClass(), shipped::kThreshold);
    EXPECT_EQ(got[0].getSeverity(), shipped::kSeverityCritical);
    EXPECT_EQ(got[0].getStatus(), shipped::kStatusCritical);
    EXPECT_EQ(got[0].getMessage(), "CPU temperature 97 C above 95 C");
    EXPECT_EQ(got[0].getNodePaths(), std::vector<std::string>{temp_});
    EXPECT_TRUE(fan.all().empty());
}

TEST_F(HealthTest, RelayedAlertsReachClassAndPathRegistrations)
{
    addHealth();
    open();
    Received byClass;
    Received byPath;
    ASSERT_EQ(IC::InstCtrl::registerForAlerts(collect, shipped::kLink, &byClass).getStatus(), 0);
    ASSERT_EQ(IC::InstCtrl::registerForAlerts(collect, std::vector<std::string>{fan_}, &byPath)
                  .getStatus(),
              0);
    std::string const port = hw_.pathOf(Node::NetworkPort, 0);
    ASSERT_EQ(hw_.raise(Node::NetworkPort, 0, 1, shipped::kLink, 2, "eth0 link down"), 0);
    raise(Node::Fan, 1, 1, shipped::kThreshold, 2, "fan slow");

    std::vector<Alert> const link = byClass.all();
    ASSERT_EQ(link.size(), 1u);
    EXPECT_EQ(link[0].getNodePaths(), std::vector<std::string>{port});
    EXPECT_EQ(link[0].getMessage(), "eth0 link down");
    std::vector<Alert> const fan = byPath.ofClass(shipped::kThreshold);
    ASSERT_EQ(fan.size(), 1u);
    EXPECT_EQ(fan[0].getMessage(), "fan slow");
}

TEST_F(HealthTest, AssertedStoreFollowsTheStatus)
{
    addHealth();
    open();
    raise(Node::TemperatureSensor, 0, 2, shipped::kThreshold, 3, "hot");
    std::vector<Alert> at = assertedAt(ic_, temp_);
    ASSERT_EQ(at.size(), 1u);
    EXPECT_EQ(at[0].getMessage(), "hot");
    EXPECT_EQ(at[0].getStatus(), 3u);

    raise(Node::TemperatureSensor, 0, 1, shipped::kThreshold, 2, "warm");
    at = assertedAt(ic_, temp_);
    ASSERT_EQ(at.size(), 1u);
    EXPECT_EQ(at[0].getMessage(), "warm");

    raise(Node::TemperatureSensor, 0, 0, shipped::kThreshold, 1, "normal");
    EXPECT_TRUE(assertedAt(ic_, temp_).empty());
    std::vector<Alert> all;
    ic_->getAssertedAlerts(all);
    EXPECT_TRUE(all.empty()) << "the roll-up is cleared with the last alert";
}

TEST_F(HealthTest, NodeArrivalsAreRelayed)
{
    addHealth();
    open();
    Received r;
    ASSERT_EQ(IC::InstCtrl::registerForAlerts(collect, Alert::NodeArrival, &r).getStatus(), 0);
    ASSERT_EQ(hw_.addNode(Node::Fan, 7, Node::Chassis, 0, "System fan 7"), 0);
    std::string const added = hw_.pathOf(Node::Fan, 7);
    ASSERT_FALSE(added.empty());
    std::vector<Alert> const got = r.all();
    ASSERT_EQ(got.size(), 1u);
    EXPECT_EQ(got[0].getNodePaths(), std::vector<std::string>{added});
    EXPECT_EQ(got[0].getStatus(), 1u);
}

TEST_F(HealthTest, ARemovedNodeKeepsNoAssertedAlert)
{
    addHealth();
    open();
    Received removals;
    ASSERT_EQ(IC::InstCtrl::registerForAlerts(collect, Alert::NodeRemoval, &removals).getStatus(),
              0);
    raise(Node::Fan, 1, 2, shipped::kThreshold, 3, "fan stopped");
    ASSERT_EQ(assertedAt(ic_, fan_).size(), 1u);

    // A removal with a status that asserts: still nothing may stay asserted.
    ASSERT_EQ(hw_.removeNode(Node::Fan, 1, 2), 0);
    std::vector<Alert> const got = removals.all();
    ASSERT_EQ(got.size(), 1u);
    EXPECT_EQ(got[0].getNodePaths(), std::vector<std::string>{fan_});
    EXPECT_TRUE(assertedAt(ic_, fan_).empty());
    std::vector<Alert> all;
    ic_->getAssertedAlerts(all);
    EXPECT_TRUE(all.empty());
    Node* node = nullptr;
    EXPECT_NE(ic_->getNode(fan_, &node).getStatus(), 0);
}

// ---------------------------------------------------------------- roll-up

TEST_F(HealthTest, RollUpFollowsTheWorstAssertedAlertOnTheChassis)
{
    addHealth();
    open();
    Received r;
    ASSERT_EQ(IC::InstCtrl::registerForAlerts(collect, shipped::kHealthRollup, &r).getStatus(), 0);

    raise(Node::Fan, 1, shipped::kSeverityWarning, shipped::kThreshold, 2, "fan slow");
    std::vector<Alert> got = r.all();
    ASSERT_EQ(got.size(), 1u);
    EXPECT_EQ(got.back().getNodePaths(), std::vector<std::string>{chassis_});
    EXPECT_EQ(got.back().getStatus(), shipped::kStatusWarning);
    EXPECT_EQ(got.back().getSeverity(), shipped::kSeverityWarning);
    EXPECT_NE(got.back().getMessage().find("fan slow"), std::string::npos);

    // The same level again changes nothing.
    raise(Node::Fan, 1, shipped::kSeverityWarning, shipped::kThreshold, 2, "fan still slow");
    EXPECT_EQ(r.all().size(), 1u);

    raise(Node::TemperatureSensor, 0, shipped::kSeverityCritical, shipped::kThreshold, 3, "hot");
    got = r.all();
    ASSERT_EQ(got.size(), 2u);
    EXPECT_EQ(got.back().getStatus(), shipped::kStatusCritical);
    EXPECT_EQ(got.back().getSeverity(), shipped::kSeverityCritical);
    EXPECT_NE(got.back().getMessage().find("2 asserted alerts"), std::string::npos);
    EXPECT_NE(got.back().getMessage().find(ic_->pathToPrintablePath(temp_)), std::string::npos);
    std::vector<Alert> stored = assertedAt(ic_, chassis_);
    ASSERT_EQ(stored.size(), 1u);
    EXPECT_EQ(stored[0].getClass(), shipped::kHealthRollup);
    EXPECT_EQ(stored[0].getStatus(), shipped::kStatusCritical);

    raise(Node::TemperatureSensor, 0, 0, shipped::kThreshold, 1, "normal");
    got = r.all();
    ASSERT_EQ(got.size(), 3u);
    EXPECT_EQ(got.back().getStatus(), shipped::kStatusWarning);
    EXPECT_EQ(got.back().getSeverity(), shipped::kSeverityWarning);

    raise(Node::Fan, 1, 0, shipped::kThreshold, 1, "fan normal");
    got = r.all();
    ASSERT_EQ(got.size(), 4u);
    EXPECT_EQ(got.back().getStatus(), shipped::kStatusNormal);
    EXPECT_EQ(got.back().getNodePaths(), std::vector<std::string>{chassis_});
    EXPECT_TRUE(assertedAt(ic_, chassis_).empty());
}

TEST_F(HealthTest, AStatusThreeAlertIsCriticalWhateverItsSeverity)
{
    addHealth();
    open();
    Received r;
    ASSERT_EQ(IC::InstCtrl::registerForAlerts(collect, shipped::kHealthRollup, &r).getStatus(), 0);
    raise(Node::Fan, 1, shipped::kSeverityInfo, shipped::kThreshold, 3, "odd");
    std::vector<Alert> const got = r.all();
    ASSERT_EQ(got.size(), 1u);
    EXPECT_EQ(got[0].getStatus(), shipped::kStatusCritical);
    EXPECT_EQ(got[0].getSeverity(), shipped::kSeverityInfo);
}

TEST_F(HealthTest, RollUpTakesItsPlaceBackAfterAnAlertOnTheChassisItself)
{
    addHealth();
    open();
    raise(Node::TemperatureSensor, 0, 2, shipped::kThreshold, 3, "hot");
    // The store holds one alert per path: this one replaces the roll-up.
    raise(Node::Chassis, 0, 1, static_cast<IC::Alert::ClassType>(9), 2, "chassis warm");
    std::vector<Alert> const stored = assertedAt(ic_, chassis_);
    ASSERT_EQ(stored.size(), 1u);
    EXPECT_EQ(stored[0].getClass(), shipped::kHealthRollup);
    EXPECT_EQ(stored[0].getStatus(), shipped::kStatusCritical);
}

// ---------------------------------------------------------- plug-ins changing

TEST_F(HealthTest, FollowsManagementInterfacesAddedAndRemoved)
{
    addHealth();
    open();
    Received rollups;
    ASSERT_EQ(IC::InstCtrl::registerForAlerts(collect, shipped::kHealthRollup, &rollups)
                  .getStatus(),
              0);
    Received temps;
    ASSERT_EQ(ic_->registerForAlerts(collect, Node::TemperatureSensor, &temps).getStatus(), 0);

    fs::create_symlink(FAKEHW2_PLUGIN, miDir_ / "fakehw2.so");
    IC::InstCtrl::TimedReload();
    FakeHw second;
    ASSERT_TRUE(second.bind((miDir_ / "fakehw2.so").string()));
    std::string const temp2 = second.pathOf(Node::TemperatureSensor, 0);
    ASSERT_FALSE(temp2.empty());
    ASSERT_NE(temp2, temp_);

    ASSERT_EQ(second.raise(Node::TemperatureSensor, 0, 2, shipped::kThreshold, 3, "second hot"),
              0);
    std::vector<Alert> got = temps.ofClass(shipped::kThreshold);
    ASSERT_EQ(got.size(), 1u);
    EXPECT_EQ(got[0].getNodePaths(), std::vector<std::string>{temp2});
    ASSERT_EQ(assertedAt(ic_, temp2).size(), 1u);
    ASSERT_FALSE(rollups.all().empty());
    EXPECT_EQ(rollups.all().back().getStatus(), shipped::kStatusCritical);

    // The second interface goes: nothing it asserted may stay, and the
    // roll-up is all clear again.
    fs::remove(miDir_ / "fakehw2.so");
    IC::InstCtrl::TimedReload();
    EXPECT_TRUE(assertedAt(ic_, temp2).empty());
    std::vector<Alert> all;
    ic_->getAssertedAlerts(all);
    EXPECT_TRUE(all.empty());
    ASSERT_FALSE(rollups.all().empty());
    EXPECT_EQ(rollups.all().back().getStatus(), shipped::kStatusNormal);

    // The first one still works.
    raise(Node::TemperatureSensor, 0, 1, shipped::kThreshold, 2, "first warm");
    EXPECT_EQ(rollups.all().back().getStatus(), shipped::kStatusWarning);
}

TEST_F(HealthTest, UpdatedMisWithdrawsWhatARemovedInterfaceAsserted)
{
    addHealth();
    fs::create_symlink(FAKEHW2_PLUGIN, miDir_ / "fakehw2.so");
    open();
    FakeHw second;
    ASSERT_TRUE(second.bind((miDir_ / "fakehw2.so").string()));
    std::string const temp2 = second.pathOf(Node::TemperatureSensor, 0);
    ASSERT_EQ(second.raise(Node::TemperatureSensor, 0, 2, shipped::kThreshold, 3, "second hot"),
              0);
    raise(Node::Fan, 1, 1, shipped::kThreshold, 2, "first fan slow");
    ASSERT_EQ(assertedAt(ic_, temp2).size(), 1u);
    ASSERT_EQ(assertedAt(ic_, chassis_).at(0).getStatus(), shipped::kStatusCritical);

    // Tell the plug-in, as a reload would, that the second interface went;
    // its nodes stay where they are, so only the plug-in's own bookkeeping
    // can find what the interface had asserted.
    SD::MutexGuard g(IC::InstCtrl::loadlock);
    IC::ManagementInterface* gone = nullptr;
    for (IC::libstruct const& lib : IC::InstCtrl::mymilibs)
        if (lib.name == "fakehw2.so")
            gone = static_cast<IC::ManagementInterface*>(lib.plugin);
    ASSERT_NE(gone, nullptr);
    ASSERT_EQ(IC::InstCtrl::myfps.size(), 1u);
    EXPECT_EQ(IC::InstCtrl::myfps[0]->updatedMis({}, {gone}).getStatus(), 0);

    EXPECT_TRUE(assertedAt(ic_, temp2).empty());
    ASSERT_EQ(assertedAt(ic_, fan_).size(), 1u);
    std::vector<Alert> const rollup = assertedAt(ic_, chassis_);
    ASSERT_EQ(rollup.size(), 1u);
    EXPECT_EQ(rollup[0].getClass(), shipped::kHealthRollup);
    EXPECT_EQ(rollup[0].getStatus(), shipped::kStatusWarning);
}

TEST_F(HealthTest, ReleaseDeregistersEverything)
{
    addHealth();
    open();
    FPRegistrations before = fpRegistrations();
    EXPECT_EQ(before.registers, 1);
    EXPECT_EQ(before.sensorTypes, static_cast<std::size_t>(Node::invalid));

    Received r;
    ASSERT_EQ(ic_->registerForAlerts(collect, Node::TemperatureSensor, &r).getStatus(), 0);
    removeHealth();
    IC::InstCtrl::TimedReload();
    FPRegistrations after = fpRegistrations();
    EXPECT_EQ(after.registers, 0);
    EXPECT_EQ(after.sensorTypes, 0u);
    {
        SD::MutexGuard g(IC::InstCtrl::registerlock);
        for (auto const& entry : IC::InstCtrl::sensortypeTOalertregister)
            EXPECT_NE(entry.second->getRegType(), static_cast<unsigned int>(IC::FP_REGISTRATION));
    }
    // Nothing relays any more; the client's own registration is intact.
    raise(Node::TemperatureSensor, 0, 2, shipped::kThreshold, 3, "hot");
    EXPECT_TRUE(r.all().empty());
    SD::MutexGuard g(IC::InstCtrl::registerlock);
    EXPECT_EQ(IC::InstCtrl::callbacks.size(), 1u);
}

TEST_F(HealthTest, AReloadedPlugInTakesOverWhatIsAsserted)
{
    addHealth();
    open();
    raise(Node::TemperatureSensor, 0, 2, shipped::kThreshold, 3, "hot");
    ASSERT_EQ(assertedAt(ic_, chassis_).size(), 1u);

    removeHealth();
    IC::InstCtrl::TimedReload();
    addHealth();
    IC::InstCtrl::TimedReload();
    ASSERT_EQ(fpRegistrations().registers, 1);

    Received r;
    ASSERT_EQ(IC::InstCtrl::registerForAlerts(collect, shipped::kHealthRollup, &r).getStatus(), 0);
    raise(Node::TemperatureSensor, 0, 0, shipped::kThreshold, 1, "normal");
    std::vector<Alert> all;
    ic_->getAssertedAlerts(all);
    EXPECT_TRUE(all.empty()) << "the new instance clears the roll-up the old one raised";
    ASSERT_EQ(r.all().size(), 1u);
    EXPECT_EQ(r.all()[0].getStatus(), shipped::kStatusNormal);
}

TEST_F(HealthTest, ConcurrentAlertsLeaveAConsistentRollUp)
{
    addHealth();
    open();
    Received r;
    ASSERT_EQ(IC::InstCtrl::registerForAlerts(collect, shipped::kHealthRollup, &r).getStatus(), 0);
    auto storm = [this](Node::SensorType type, unsigned int instance) {
        for (int i = 0; i < 200; ++i)
            hw_.raise(type, instance, i % 2 ? 0 : 2, shipped::kThreshold, i % 2 ? 1 : 3, "storm");
    };
    std::thread a(storm, Node::TemperatureSensor, 0);
    std::thread b(storm, Node::Fan, 1);
    a.join();
    b.join();
    // Both end normal: the last roll-up delivered and the store agree.
    std::vector<Alert> all;
    ic_->getAssertedAlerts(all);
    EXPECT_TRUE(all.empty());
    ASSERT_FALSE(r.all().empty());
    EXPECT_EQ(r.all().back().getStatus(), shipped::kStatusNormal);
}

// ------------------------------------------------ with the Linux interface

#ifdef LINUXHW_PLUGIN

// The shipped interface reading a copy of the small example tree, polled
// quickly; the tests change readings in the copy.
class LinuxHwHealthTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        char templ[] = "/tmp/ic-health-hw-XXXXXX";
        ASSERT_NE(mkdtemp(templ), nullptr);
        dir_ = templ;
        fs::create_directories(dir_ / "mi");
        fs::create_directories(dir_ / "fp");
        fs::copy(fs::path(IC_EXAMPLES_DIR) / "small", dir_ / "root",
                 fs::copy_options::recursive | fs::copy_options::copy_symlinks);
        fs::create_symlink(LINUXHW_PLUGIN, dir_ / "mi" / "linuxhw.so");
        fs::create_symlink(HEALTH_PLUGIN, dir_ / "fp" / "health.so");
        setenv("IC_MI_DIR", (dir_ / "mi").c_str(), 1);
        setenv("IC_FP_DIR", (dir_ / "fp").c_str(), 1);
        setenv("IC_SYSFS_ROOT", (dir_ / "root").c_str(), 1);
        setenv("IC_LINUXHW_POLL_MS", "50", 1);
    }

    void TearDown() override
    {
        if (opened_)
            Unloadlib();
        for (char const* v : {"IC_MI_DIR", "IC_FP_DIR", "IC_SYSFS_ROOT", "IC_LINUXHW_POLL_MS"})
            unsetenv(v);
        std::error_code ec;
        fs::remove_all(dir_, ec);
    }

    // Replaced whole, so that a poll never reads half a value.
    void write(std::string const& file, std::string const& value)
    {
        fs::path const target = dir_ / "root" / file;
        fs::path const next = target.string() + ".new";
        std::ofstream(next) << value << '\n';
        fs::rename(next, target);
    }

    // Waits until the registration holds an alert of class 5 with status on
    // path.
    static bool waitForStatus(Received& r, std::string const& path, unsigned int status)
    {
        for (int i = 0; i < 1000; ++i) {
            for (Alert const& a : r.ofClass(shipped::kThreshold))
                if (a.getStatus() == status && a.getNodePaths() == std::vector<std::string>{path})
                    return true;
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        return false;
    }

    fs::path dir_;
    bool opened_ = false;
};

TEST_F(LinuxHwHealthTest, AReadingCrossingAThresholdIsAssertedAndCleared)
{
    IC::InstrumentationControl* ic = nullptr;
    IC::Error* err = nullptr;
    ASSERT_EQ(Open(&ic, &err), 0);
    opened_ = true;

    // The package sensor of the coretemp chip (hwmon0 temp1: max 80 C, crit 100 C).
    std::vector<Node*> nodes;
    ASSERT_EQ(ic->getAllNodes(nodes).getStatus(), 0);
    std::string sensor;
    std::string chassis;
    for (Node* n : nodes) {
        if (n->getSensor() == Node::TemperatureSensor &&
            n->getDescription().find("Package id 0") != std::string::npos)
            sensor = n->getPath();
        if (n->getSensor() == Node::Chassis)
            chassis = n->getPath();
    }
    ASSERT_FALSE(sensor.empty());
    ASSERT_FALSE(chassis.empty());

    Received r;
    ASSERT_EQ(ic->registerForAlerts(collect, Node::TemperatureSensor, &r).getStatus(), 0);

    write("sys/class/hwmon/hwmon0/temp1_input", "101000");
    ASSERT_TRUE(waitForStatus(r, sensor, shipped::kStatusCritical));
    std::vector<Alert> at = assertedAt(ic, sensor);
    ASSERT_EQ(at.size(), 1u);
    EXPECT_EQ(at[0].getClass(), shipped::kThreshold);
    EXPECT_EQ(at[0].getStatus(), shipped::kStatusCritical);
    std::vector<Alert> rollup = assertedAt(ic, chassis);
    ASSERT_EQ(rollup.size(), 1u);
    EXPECT_EQ(rollup[0].getClass(), shipped::kHealthRollup);
    EXPECT_EQ(rollup[0].getStatus(), shipped::kStatusCritical);

    write("sys/class/hwmon/hwmon0/temp1_input", "85000");
    ASSERT_TRUE(waitForStatus(r, sensor, shipped::kStatusWarning));
    at = assertedAt(ic, sensor);
    ASSERT_EQ(at.size(), 1u);
    EXPECT_EQ(at[0].getStatus(), shipped::kStatusWarning);

    write("sys/class/hwmon/hwmon0/temp1_input", "45000");
    ASSERT_TRUE(waitForStatus(r, sensor, shipped::kStatusNormal));
    EXPECT_TRUE(assertedAt(ic, sensor).empty());
    std::vector<Alert> all;
    ic->getAssertedAlerts(all);
    EXPECT_TRUE(all.empty());
}

#endif // LINUXHW_PLUGIN

} // namespace
