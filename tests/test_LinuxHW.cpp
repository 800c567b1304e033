// The shipped Linux hardware management interface, loaded through the real
// library from a temporary plug-in directory and pointed at a copy of an
// example sysfs tree (examples/sysfs), which the tests then change under it.
#include "LogCapture.h"
#include "ShippedAlerts.h"

#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include <linux/capability.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using IC::Alert;
using IC::Node;

// Long enough for a slow sanitizer build; polls come every 50 ms.
constexpr auto kDeadline = 8s;

// Alerts delivered to one registration of the functional plug-in form.
class AlertSink {
public:
    static IC::Error callback(std::vector<Alert> const& alerts, void const* context)
    {
        auto* self = static_cast<AlertSink*>(const_cast<void*>(context));
        {
            std::lock_guard<std::mutex> g(self->m_);
            self->alerts_.insert(self->alerts_.end(), alerts.begin(), alerts.end());
        }
        self->cv_.notify_all();
        return IC::Error(0, IC::Number(IC::Number::Generic), "");
    }

    // The first alert (since the last take) of that class and status on path.
    std::optional<Alert> waitFor(unsigned int cls, unsigned int status, std::string const& path)
    {
        std::unique_lock<std::mutex> g(m_);
        std::optional<Alert> found;
        cv_.wait_for(g, kDeadline, [&] {
            for (std::size_t i = taken_; i < alerts_.size(); ++i) {
                Alert const& a = alerts_[i];
                auto const& p = a.nodePaths();
                if (a.getClass() == cls && a.getStatus() == status &&
                    std::find(p.begin(), p.end(), path) != p.end()) {
                    found = a;
                    taken_ = i + 1;
                    return true;
                }
            }
            return false;
        });
        return found;
    }

    // The first alert of that class on any path.
    std::optional<Alert> waitForClass(unsigned int cls)
    {
        std::unique_lock<std::mutex> g(m_);
        std::optional<Alert> found;
        cv_.wait_for(g, kDeadline, [&] {
            for (Alert const& a : alerts_)
                if (a.getClass() == cls && !a.nodePaths().empty()) {
                    found = a;
                    return true;
                }
            return false;
        });
        return found;
    }

    std::vector<Alert> onPath(std::string const& path) const
    {
        std::lock_guard<std::mutex> g(m_);
        std::vector<Alert> out;
        for (Alert const& a : alerts_)
            if (std::find(a.nodePaths().begin(), a.nodePaths().end(), path) != a.nodePaths().end())
                out.push_back(a);
        return out;
    }

private:
    mutable std::mutex m_;
    std::condition_variable cv_;
    std::vector<Alert> alerts_;
    std::size_t taken_ = 0;
};

// Drops the file-permission override of the calling thread while it lives,
// so that root meets permission errors too; threads created meanwhile keep
// the reduced set.
class NoDacOverride {
public:
    NoDacOverride()
    {
        header_.version = _LINUX_CAPABILITY_VERSION_3;
        if (syscall(SYS_capget, &header_, saved_) != 0)
            return;
        __user_cap_data_struct reduced[2] = {saved_[0], saved_[1]};
        reduced[0].effective &= ~((1u << CAP_DAC_OVERRIDE) | (1u << CAP_DAC_READ_SEARCH));
        active_ = syscall(SYS_capset, &header_, reduced) == 0;
    }
    ~NoDacOverride()
    {
        if (active_)
            syscall(SYS_capset, &header_, saved_);
    }
    bool active() const { return active_; }

private:
    __user_cap_header_struct header_{};
    __user_cap_data_struct saved_[2]{};
    bool active_ = false;
};

class LinuxHwTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        char dir[] = "/tmp/ic_linuxhw_XXXXXX";
        ASSERT_NE(mkdtemp(dir), nullptr);
        tmp_ = dir;
        fs::create_directories(tmp_ / "mi");
        fs::create_directories(tmp_ / "fp");
        fs::create_symlink(LINUXHW_PLUGIN, tmp_ / "mi" / "linuxhw.so");
        setenv("IC_MI_DIR", (tmp_ / "mi").c_str(), 1);
        setenv("IC_FP_DIR", (tmp_ / "fp").c_str(), 1);
        setenv("IC_LINUXHW_POLL_MS", "50", 1);
    }

    void TearDown() override
    {
        close();
        unsetenv("IC_SYSFS_ROOT");
        unsetenv("IC_LINUXHW_POLL_MS");
        std::error_code ec;
        for (auto const& e : fs::recursive_directory_iterator(tmp_, ec))
            fs::permissions(e.path(), fs::perms::owner_all, fs::perm_options::add, ec);
        fs::remove_all(tmp_, ec);
    }

    void useTree(std::string const& name)
    {
        fs::copy(fs::path(LINUXHW_EXAMPLES) / name, root(),
                 fs::copy_options::recursive | fs::copy_options::copy_symlinks);
        setenv("IC_SYSFS_ROOT", root().c_str(), 1);
    }

    void open()
    {
        IC::Error* err = nullptr;
        ASSERT_EQ(Open(&ic_, &err), 0);
        ASSERT_NE(ic_, nullptr);
        opened_ = true;
    }

    void close()
    {
        if (opened_)
            Unloadlib();
        opened_ = false;
    }

    fs::path root() const { return tmp_ / "root"; }

    void write(std::string const& rel, std::string const& text)
    {
        fs::create_directories((root() / rel).parent_path());
        std::ofstream(root() / rel) << text << '\n';
    }

    // A directory of files made beside the tree and moved into place in one
    // step, so that no poll sees it half made.
    void install(std::string const& rel, std::map<std::string, std::string> const& files)
    {
        fs::path const stage = tmp_ / "stage";
        fs::remove_all(stage);
        for (auto const& [name, text] : files) {
            fs::create_directories((stage / name).parent_path());
            std::ofstream(stage / name) << text << '\n';
        }
        fs::rename(stage, root() / rel);
    }

    std::vector<Node*> nodes() const
    {
        std::vector<Node*> all;
        EXPECT_EQ(ic_->getAllNodes(all).getStatus(), 0);
        return all;
    }

    std::vector<Node*> ofType(Node::SensorType type) const
    {
        std::vector<Node*> out;
        for (Node* n : nodes())
            if (n->getSensor() == type)
                out.push_back(n);
        return out;
    }

    Node* find(std::string const& description) const
    {
        for (Node* n : nodes())
            if (n->getDescription() == description)
                return n;
        return nullptr;
    }

    static std::string prop(Node* n, std::string const& name)
    {
        Node::Property p;
        if (!n)
            return "<no node>";
        if (!n->getProperty(name, &p))
            return "<none>";
        return p.unit.empty() ? p.value : p.value + " " + p.unit;
    }

    template <class Pred>
    static bool eventually(Pred pred)
    {
        auto const end = std::chrono::steady_clock::now() + kDeadline;
        while (!pred()) {
            if (std::chrono::steady_clock::now() > end)
                return false;
            std::this_thread::sleep_for(10ms);
        }
        return true;
    }

    bool registered(std::string const& path) const
    {
        Node* n = nullptr;
        return ic_->getNode(path, &n).getStatus() == 0 && n != nullptr;
    }

    void watch(Node::SensorType type, AlertSink& sink)
    {
        ASSERT_EQ(IC::InstCtrl::regFPsensorAlerts(&AlertSink::callback, type, &sink).getStatus(), 0);
    }

    // "hierarchy | printable path | description", sorted.
    std::vector<std::string> layout() const
    {
        std::vector<std::string> out;
        for (Node* n : nodes())
            out.push_back(ic_->getNodeHierarchy(n) + " | " + ic_->pathToPrintablePath(n->getPath()) +
                          " | " + n->getDescription());
        std::sort(out.begin(), out.end());
        return out;
    }

    fs::path tmp_;
    IC::InstrumentationControl* ic_ = nullptr;
    bool opened_ = false;
    // Outlive close(): the plug-in delivers until the library shuts it down.
    AlertSink temps_, ports_, dimms_, supplies_, fans_, disks_;
};

// ------------------------------------------------------------------ layout

std::string const kSmallPackage = "CPU 0 Package id 0 temperature";

TEST_F(LinuxHwTest, SmallTreeLayoutIsExact)
{
    useTree("small");
    open();
    std::string const chassis = "ROOT:00000000->Chassis:00000000";
    std::string const cpu = chassis + "->CPU:00000000";
    std::vector<std::string> const expected = {
        "ROOT:00000000 | 1f5c | Linux host edge01",
        chassis + " | 1f201f5c | System Acme Computers Edge E10",
        chassis + "->BIOS:00000000 | 1f301f201f5c | BIOS Acme Firmware 1.4.2 (03/14/2023)",
        cpu + " | 1f501f201f5c | CPU 0: Intel(R) Xeon(R) E-2224 CPU @ 3.40GHz",
        cpu + "->CPU Core:00000000 | 1f4701f501f201f5c0 | CPU 0 core 0",
        cpu + "->CPU Core:00000001 | 2f4701f501f201f5c0 | CPU 0 core 1",
        cpu + "->CPU Core:00000002 | 3f4701f501f201f5c0 | CPU 0 core 2",
        cpu + "->CPU Core:00000003 | 4f4701f501f201f5c0 | CPU 0 core 3",
        cpu + "->Temperature Sensor:00000001 | 2f2b01f501f201f5c0 | CPU 0 Package id 0 temperature",
        cpu + "->Temperature Sensor:00000002 | 3f2b01f501f201f5c0 | CPU 0 Core 0 temperature",
        cpu + "->Temperature Sensor:00000003 | 4f2b01f501f201f5c0 | CPU 0 Core 1 temperature",
        cpu + "->Temperature Sensor:00000004 | 5f2b01f501f201f5c0 | CPU 0 Core 2 temperature",
        cpu + "->Temperature Sensor:00000005 | 6f2b01f501f201f5c0 | CPU 0 Core 3 temperature",
        chassis + "->Hard Drive:000066d4 | 243a9fc01f201f5c | Disk nvme0n1: Samsung SSD 980 PRO 1TB (1000 GB)",
        chassis + "->Network Port:0000260c | 6889f2101f201f5c | Network port enp1s0 (3c:ec:ef:10:00:01)",
        chassis + "->Network Port:000068d8 | 24759f2101f201f5c0 | Network port enp2s0 (3c:ec:ef:10:00:02)",
        chassis + "->RAM:00000000 | 1f2701f201f5c0 | System memory 15.5 GB",
    };
    EXPECT_EQ(layout(), expected);

    // Node ids carry the load number in their upper half, parents link up.
    for (Node* n : nodes()) {
        EXPECT_NE(n->getNodeId() & 0xFFFFu, 0u) << n->getDescription();
        EXPECT_EQ(n->getNodeId() & 0xFFFF0000u, nodes().front()->getNodeId() & 0xFFFF0000u);
        if (n->getSensor() == Node::ROOT) {
            EXPECT_EQ(n->getLinkedId(), 0u);
            continue;
        }
        Node* parent = nullptr;
        ASSERT_EQ(ic_->getNode(n->getLinkedId(), &parent).getStatus(), 0) << n->getDescription();
        EXPECT_EQ(parent->getPath(), n->getLinkedPath()) << n->getDescription();
    }
}

TEST_F(LinuxHwTest, SmallTreeProperties)
{
    useTree("small");
    open();
    Node* chassis = find("System Acme Computers Edge E10");
    ASSERT_NE(chassis, nullptr);
    EXPECT_EQ(prop(chassis, "vendor"), "Acme Computers");
    EXPECT_EQ(prop(chassis, "model"), "Edge E10");
    EXPECT_EQ(prop(chassis, "serial"), "E10-000123");
    Node* bios = find("BIOS Acme Firmware 1.4.2 (03/14/2023)");
    ASSERT_NE(bios, nullptr);
    EXPECT_EQ(prop(bios, "version"), "1.4.2");
    Node* cpu = find("CPU 0: Intel(R) Xeon(R) E-2224 CPU @ 3.40GHz");
    ASSERT_NE(cpu, nullptr);
    EXPECT_EQ(prop(cpu, "vendor"), "GenuineIntel");
    EXPECT_EQ(prop(cpu, "cores"), "4");
    EXPECT_EQ(prop(find("CPU 0 core 2"), "threads"), "2");
    EXPECT_EQ(prop(find("System memory 15.5 GB"), "size"), "15921 MB");

    Node* pkg = find(kSmallPackage);
    ASSERT_NE(pkg, nullptr);
    std::vector<Node::Property> const props = pkg->getProperties();
    std::vector<std::string> shown;
    for (auto const& p : props)
        shown.push_back(p.name + "=" + p.value + (p.unit.empty() ? "" : " " + p.unit));
    EXPECT_EQ(shown, (std::vector<std::string>{"label=Package id 0", "chip=coretemp", "reading=45.0 C",
                                               "upper_warning=80.0 C", "upper_critical=100.0 C",
                                               "state=ok"}));

    Node* up = find("Network port enp1s0 (3c:ec:ef:10:00:01)");
    ASSERT_NE(up, nullptr);
    EXPECT_EQ(prop(up, "speed"), "1000 Mb/s");
    EXPECT_EQ(prop(up, "link"), "up");
    Node* down = find("Network port enp2s0 (3c:ec:ef:10:00:02)");
    ASSERT_NE(down, nullptr);
    EXPECT_EQ(prop(down, "speed"), "unknown");
    EXPECT_EQ(prop(down, "link"), "down");

    Node* disk = find("Disk nvme0n1: Samsung SSD 980 PRO 1TB (1000 GB)");
    ASSERT_NE(disk, nullptr);
    EXPECT_EQ(prop(disk, "size"), "1000204886016 bytes");
    EXPECT_EQ(prop(disk, "serial"), "S5GXNF0R123456A");
    EXPECT_EQ(prop(disk, "version"), "5B2QGXA7");
    EXPECT_EQ(prop(disk, "media"), "ssd");
}

TEST_F(LinuxHwTest, VirtualAndRamDevicesAreLeftOut)
{
    for (std::string const tree : {"small", "large"}) {
        SCOPED_TRACE(tree);
        fs::remove_all(root());
        useTree(tree);
        open();
        for (Node* n : nodes()) {
            for (std::string const word :
                 {"loop", "zram", "ram0", "dm-0", "md0", " lo", "virbr0", "docker0", "bond0"})
                EXPECT_EQ(n->getDescription().find(word), std::string::npos) << n->getDescription();
        }
        // The thermal zones duplicate hwmon sensors and are not shown beside them.
        for (Node* n : ofType(Node::TemperatureSensor))
            EXPECT_EQ(n->getDescription().find("Thermal zone"), std::string::npos);
        close();
    }
}

TEST_F(LinuxHwTest, LargeTreeCounts)
{
    useTree("large");
    open();
    std::map<Node::SensorType, std::size_t> counts;
    for (Node* n : nodes())
        ++counts[n->getSensor()];
    std::map<Node::SensorType, std::size_t> const expected = {
        {Node::ROOT, 1},       {Node::Chassis, 1},           {Node::BIOS, 1},
        {Node::CPU, 2},        {Node::CPUCore, 16},          {Node::RAM, 1},
        {Node::DIMM, 8},       {Node::NetworkPort, 4},       {Node::HardDrive, 4},
        {Node::PowerSupply, 2}, {Node::TemperatureSensor, 21}, {Node::Fan, 6},
        {Node::VoltageSensor, 9}};
    EXPECT_EQ(counts, expected);

    // Core ids with gaps are kept as instances; coretemp sensors sit below
    // their package; board sensors below the chassis.
    Node* core = find("CPU 1 core 11");
    ASSERT_NE(core, nullptr);
    EXPECT_EQ(ic_->getNodeHierarchy(core), "ROOT:00000000->Chassis:00000000->CPU:00000001->CPU Core:0000000b");
    EXPECT_EQ(prop(core, "threads"), "15,31");
    Node* coreTemp = find("CPU 1 Core 11 temperature");
    ASSERT_NE(coreTemp, nullptr);
    EXPECT_EQ(ic_->getNodeHierarchy(coreTemp),
              "ROOT:00000000->Chassis:00000000->CPU:00000001->Temperature Sensor:0000000d");
    Node* fan = find("nct6779 fan1 speed");
    ASSERT_NE(fan, nullptr);
    std::string const fanText = ic_->getNodeHierarchy(fan);
    EXPECT_EQ(fanText.rfind("ROOT:00000000->Chassis:00000000->Fan:", 0), 0u) << fanText;
    EXPECT_EQ(fanText.substr(fanText.size() - 2), "01") << fanText;
    EXPECT_EQ(prop(fan, "reading"), "5400 RPM");
    EXPECT_EQ(prop(fan, "lower_warning"), "600 RPM");
    Node* volt = find("nct6779 in1 voltage");
    ASSERT_NE(volt, nullptr);
    EXPECT_EQ(prop(volt, "reading"), "12.096 V");
    EXPECT_EQ(prop(volt, "upper_warning"), "13.200 V");

    Node* dimm = find("DIMM CPU_SrcID#1_MC#0_Chan#2_DIMM#0");
    ASSERT_NE(dimm, nullptr);
    EXPECT_EQ(ic_->getNodeHierarchy(dimm), "ROOT:00000000->Chassis:00000000->RAM:00000000->DIMM:00000102");
    EXPECT_EQ(prop(dimm, "size"), "32768 MB");
    EXPECT_EQ(prop(dimm, "corrected_errors"), "2");
    EXPECT_EQ(prop(dimm, "state"), "warning");
    Node* psu = find("Power supply PSU1 (Mains)");
    ASSERT_NE(psu, nullptr);
    EXPECT_EQ(prop(psu, "reading"), "184.0 W");
    EXPECT_EQ(prop(psu, "state"), "ok");
    EXPECT_EQ(prop(find("Network port ens1f0 (0c:42:a1:7e:20:00)"), "speed"), "25000 Mb/s");
}

TEST_F(LinuxHwTest, ThermalZonesStandInWhenThereIsNoHwmon)
{
    useTree("small");
    fs::remove_all(root() / "sys/class/hwmon");
    open();
    std::vector<Node*> const temps = ofType(Node::TemperatureSensor);
    ASSERT_EQ(temps.size(), 1u);
    EXPECT_EQ(temps[0]->getDescription(), "Thermal zone 0 (x86_pkg_temp)");
    EXPECT_EQ(ic_->getNodeHierarchy(temps[0]),
              "ROOT:00000000->Chassis:00000000->Temperature Sensor:00000000");
    EXPECT_EQ(prop(temps[0], "reading"), "45.0 C");
}

// ------------------------------------------------------------------ identity

TEST_F(LinuxHwTest, PathsSurviveReopenRenumberingAndNewDevices)
{
    useTree("large");
    open();
    std::map<std::string, std::string> before;
    unsigned int const firstBase = nodes().front()->getNodeId() & 0xFFFF0000u;
    for (Node* n : nodes())
        before[n->getDescription()] = n->getPath();
    close();

    // The kernel numbers hwmon chips in driver load order, and another card
    // may come with the next boot: neither moves the others.
    fs::rename(root() / "sys/class/hwmon/hwmon0", root() / "sys/class/hwmon/hwmon7");
    fs::rename(root() / "sys/class/hwmon/hwmon2", root() / "sys/class/hwmon/hwmon0");
    install("sys/class/net/eno3", {{"device/uevent", "PCI_SLOT_NAME=0000:19:00.2"},
                                   {"address", "b4:96:91:4a:10:03"}, {"carrier", "1"},
                                   {"operstate", "up"}, {"speed", "1000"}});
    open();
    EXPECT_NE(nodes().front()->getNodeId() & 0xFFFF0000u, firstBase) << "not reloaded";
    std::map<std::string, std::string> after;
    for (Node* n : nodes())
        after[n->getDescription()] = n->getPath();
    EXPECT_EQ(after.size(), before.size() + 1);
    for (auto const& [description, path] : before)
        EXPECT_EQ(after[description], path) << description;
}

// ------------------------------------------------------------------ alerts

TEST_F(LinuxHwTest, TemperatureCrossingThresholdsRaisesAndClears)
{
    useTree("small");
    open();
    watch(Node::TemperatureSensor, temps_);
    Node* pkg = find(kSmallPackage);
    ASSERT_NE(pkg, nullptr);
    std::string const path = pkg->getPath();
    std::string const input = "sys/class/hwmon/hwmon0/temp1_input";

    write(input, "101000");
    std::optional<Alert> a = temps_.waitFor(shipped::kThreshold, shipped::kStatusCritical, path);
    ASSERT_TRUE(a);
    EXPECT_EQ(a->getSeverity(), shipped::kSeverityCritical);
    EXPECT_EQ(a->getMessage(), "CPU 0 Package id 0 temperature 101.0 C above critical 100.0 C");
    EXPECT_EQ(a->getNodePaths(), std::vector<std::string>{path});
    EXPECT_EQ(prop(pkg, "reading"), "101.0 C");
    EXPECT_EQ(prop(pkg, "state"), "critical");

    write(input, "85000");
    a = temps_.waitFor(shipped::kThreshold, shipped::kStatusWarning, path);
    ASSERT_TRUE(a);
    EXPECT_EQ(a->getSeverity(), shipped::kSeverityWarning);
    EXPECT_EQ(a->getMessage(), "CPU 0 Package id 0 temperature 85.0 C above warning 80.0 C");

    write(input, "45000");
    a = temps_.waitFor(shipped::kThreshold, shipped::kStatusNormal, path);
    ASSERT_TRUE(a);
    EXPECT_EQ(a->getSeverity(), shipped::kSeverityInfo);
    EXPECT_TRUE(eventually([&] { return prop(pkg, "state") == "ok"; }));
    // One alert per change, none for sensors that did not move.
    EXPECT_EQ(temps_.onPath(path).size(), 3u);
    for (Node* other : ofType(Node::TemperatureSensor)) {
        if (other != pkg) {
            EXPECT_TRUE(temps_.onPath(other->getPath()).empty()) << other->getDescription();
        }
    }
}

TEST_F(LinuxHwTest, HwmonAlarmFileRaisesAndClears)
{
    useTree("small");
    open();
    watch(Node::TemperatureSensor, temps_);
    Node* core = find("CPU 0 Core 1 temperature");
    ASSERT_NE(core, nullptr);
    write("sys/class/hwmon/hwmon0/temp3_crit_alarm", "1");
    std::optional<Alert> a = temps_.waitFor(shipped::kThreshold, shipped::kStatusCritical, core->getPath());
    ASSERT_TRUE(a);
    EXPECT_EQ(a->getMessage(), "CPU 0 Core 1 temperature: hwmon alarm temp3_crit_alarm is set");
    write("sys/class/hwmon/hwmon0/temp3_crit_alarm", "0");
    EXPECT_TRUE(temps_.waitFor(shipped::kThreshold, shipped::kStatusNormal, core->getPath()));
}

TEST_F(LinuxHwTest, FanBelowMinimumAndSupplyWithoutPower)
{
    useTree("large");
    open();
    watch(Node::Fan, fans_);
    watch(Node::PowerSupply, supplies_);
    Node* fan = find("nct6779 fan3 speed");
    Node* psu = find("Power supply PSU2 (Mains)");
    ASSERT_NE(fan, nullptr);
    ASSERT_NE(psu, nullptr);

    write("sys/class/hwmon/hwmon2/fan3_input", "300");
    std::optional<Alert> a = fans_.waitFor(shipped::kThreshold, shipped::kStatusWarning, fan->getPath());
    ASSERT_TRUE(a);
    EXPECT_EQ(a->getMessage(), "nct6779 fan3 speed 300 RPM below warning 600 RPM");

    write("sys/class/power_supply/PSU2/online", "0");
    a = supplies_.waitFor(shipped::kThreshold, shipped::kStatusCritical, psu->getPath());
    ASSERT_TRUE(a);
    EXPECT_EQ(a->getMessage(), "Power supply PSU2 (Mains) has no input power");
    EXPECT_EQ(prop(psu, "state"), "offline");
    write("sys/class/power_supply/PSU2/online", "1");
    EXPECT_TRUE(supplies_.waitFor(shipped::kThreshold, shipped::kStatusNormal, psu->getPath()));
    // The empty fan header (0 RPM, no minimum) never alerted.
    Node* empty = find("nct6779 fan6 speed");
    ASSERT_NE(empty, nullptr);
    EXPECT_TRUE(fans_.onPath(empty->getPath()).empty());
}

TEST_F(LinuxHwTest, GrowingEdacCountsRaiseMemoryErrors)
{
    useTree("large");
    open();
    watch(Node::DIMM, dimms_);
    Node* dimm = find("DIMM CPU_SrcID#0_MC#0_Chan#1_DIMM#0");
    ASSERT_NE(dimm, nullptr);
    std::string const dir = "sys/devices/system/edac/mc/mc0/dimm1/";

    write(dir + "dimm_ce_count", "3");
    std::optional<Alert> a = dimms_.waitFor(shipped::kMemoryErrors, shipped::kStatusWarning, dimm->getPath());
    ASSERT_TRUE(a);
    EXPECT_EQ(a->getMessage(), "DIMM CPU_SrcID#0_MC#0_Chan#1_DIMM#0: 3 new corrected memory errors (3 in all)");
    EXPECT_EQ(prop(dimm, "corrected_errors"), "3");

    write(dir + "dimm_ue_count", "1");
    a = dimms_.waitFor(shipped::kMemoryErrors, shipped::kStatusCritical, dimm->getPath());
    ASSERT_TRUE(a);
    EXPECT_EQ(a->getSeverity(), shipped::kSeverityCritical);
    EXPECT_TRUE(eventually([&] { return prop(dimm, "state") == "critical"; }));

    write(dir + "dimm_ce_count", "0");
    write(dir + "dimm_ue_count", "0");
    EXPECT_TRUE(dimms_.waitFor(shipped::kMemoryErrors, shipped::kStatusNormal, dimm->getPath()));
    // The DIMM that had errors before the start raised nothing.
    Node* old = find("DIMM CPU_SrcID#1_MC#0_Chan#2_DIMM#0");
    ASSERT_NE(old, nullptr);
    EXPECT_TRUE(dimms_.onPath(old->getPath()).empty());
}

TEST_F(LinuxHwTest, CarrierLossRaisesLinkAlert)
{
    useTree("large");
    open();
    watch(Node::NetworkPort, ports_);
    Node* port = find("Network port eno1 (b4:96:91:4a:10:01)");
    Node* idle = find("Network port eno2 (b4:96:91:4a:10:02)");
    ASSERT_NE(port, nullptr);
    ASSERT_NE(idle, nullptr);
    write("sys/class/net/eno1/carrier", "0");
    write("sys/class/net/eno1/operstate", "down");
    std::optional<Alert> a = ports_.waitFor(shipped::kLink, shipped::kStatusWarning, port->getPath());
    ASSERT_TRUE(a);
    EXPECT_EQ(a->getMessage(), "Network port eno1 (b4:96:91:4a:10:01) lost its link");
    EXPECT_EQ(prop(port, "link"), "down");
    write("sys/class/net/eno1/carrier", "1");
    write("sys/class/net/eno1/operstate", "up");
    EXPECT_TRUE(ports_.waitFor(shipped::kLink, shipped::kStatusNormal, port->getPath()));
    // A port without a cable from the start is no news.
    EXPECT_TRUE(ports_.onPath(idle->getPath()).empty());
}

TEST_F(LinuxHwTest, DevicesArriveAndLeave)
{
    useTree("small");
    open();
    watch(Node::NetworkPort, ports_);
    watch(Node::HardDrive, disks_);
    std::size_t const before = nodes().size();

    install("sys/class/net/eth9", {{"device/uevent", "PCI_SLOT_NAME=0000:03:00.0"},
                                   {"address", "00:1b:21:aa:bb:cc"}, {"carrier", "1"},
                                   {"operstate", "up"}, {"speed", "10000"}});
    std::optional<Alert> arrival = ports_.waitForClass(shipped::kNodeArrival);
    ASSERT_TRUE(arrival);
    ASSERT_EQ(arrival->getNodePaths().size(), 1u);
    std::string const path = arrival->getNodePaths()[0];
    Node* port = nullptr;
    ASSERT_EQ(ic_->getNode(path, &port).getStatus(), 0);
    EXPECT_EQ(port->getDescription(), "Network port eth9 (00:1b:21:aa:bb:cc)");
    EXPECT_EQ(ic_->getNodeHierarchy(port).rfind("ROOT:00000000->Chassis:00000000->Network Port:", 0), 0u);
    EXPECT_EQ(prop(port, "speed"), "10000 Mb/s");
    EXPECT_EQ(nodes().size(), before + 1);

    fs::remove_all(root() / "sys/class/net/eth9");
    std::optional<Alert> removal = ports_.waitFor(shipped::kNodeRemoval, shipped::kStatusNormal, path);
    ASSERT_TRUE(removal);
    EXPECT_EQ(removal->getMessage(), "Network port eth9 (00:1b:21:aa:bb:cc) was removed");
    EXPECT_TRUE(eventually([&] { return !registered(path); }));
    EXPECT_EQ(nodes().size(), before);

    // It comes back under the same path.
    install("sys/class/net/eth9", {{"device/uevent", "PCI_SLOT_NAME=0000:03:00.0"},
                                   {"address", "00:1b:21:aa:bb:cc"}, {"carrier", "1"},
                                   {"operstate", "up"}, {"speed", "10000"}});
    EXPECT_TRUE(ports_.waitFor(shipped::kNodeArrival, 1, path));
    EXPECT_TRUE(registered(path));

    Node* disk = find("Disk nvme0n1: Samsung SSD 980 PRO 1TB (1000 GB)");
    ASSERT_NE(disk, nullptr);
    std::string const diskPath = disk->getPath();
    fs::remove_all(root() / "sys/block/nvme0n1");
    EXPECT_TRUE(disks_.waitFor(shipped::kNodeRemoval, shipped::kStatusNormal, diskPath));
    EXPECT_TRUE(eventually([&] { return !registered(diskPath); }));
}

// ------------------------------------------------------------------ bad input

TEST_F(LinuxHwTest, OddAndUnreadableFilesAreSkippedWithALogLine)
{
    ictest::LogCapture log;
    useTree("small");
    open();
    watch(Node::TemperatureSensor, temps_);
    Node* core0 = find("CPU 0 Core 0 temperature");
    Node* core2 = find("CPU 0 Core 2 temperature");
    ASSERT_NE(core0, nullptr);
    ASSERT_NE(core2, nullptr);
    auto logged = [&](std::string const& rel, std::string const& why) {
        std::string const file = (root() / rel).string();
        for (HGLog::Record const& r : log.logs())
            if (r.logger == "Helmgard.Plugins.LinuxHW" && r.level >= 4000 &&
                r.message.find(file) != std::string::npos && r.message.find(why) != std::string::npos)
                return true;
        return false;
    };

    std::string const garbage = "sys/class/hwmon/hwmon0/temp2_input";
    write(garbage, "hot!");
    EXPECT_TRUE(eventually([&] { return logged(garbage, "not a number"); }));
    EXPECT_TRUE(eventually([&] { return prop(core0, "reading") == "unknown"; }));
    EXPECT_EQ(prop(core0, "state"), "unknown");

    // A directory where a file should be cannot be read, by root either.
    std::string const odd = "sys/class/hwmon/hwmon0/temp4_input";
    fs::remove(root() / odd);
    fs::create_directory(root() / odd);
    EXPECT_TRUE(eventually([&] { return logged(odd, "not a regular file"); }));
    EXPECT_TRUE(eventually([&] { return prop(core2, "reading") == "unknown"; }));

    // The line is written once, not on every poll.
    std::size_t lines = 0;
    for (HGLog::Record const& r : log.logs())
        lines += r.message.find((root() / garbage).string()) != std::string::npos;
    EXPECT_EQ(lines, 1u);
    // Nothing was taken for a removal, and good values come back.
    EXPECT_TRUE(registered(core0->getPath()));
    write(garbage, "43000");
    EXPECT_TRUE(eventually([&] { return prop(core0, "reading") == "43.0 C"; }));
    EXPECT_TRUE(temps_.onPath(core0->getPath()).empty());
}

TEST_F(LinuxHwTest, PermissionErrorsAreSkippedWithALogLine)
{
    ictest::LogCapture log;
    useTree("small");
    {
        // Root reads any file; without the override the polling thread
        // (created here, inheriting the set) meets the error as a user would.
        std::optional<NoDacOverride> drop;
        if (geteuid() == 0) {
            drop.emplace();
            if (!drop->active())
                GTEST_SKIP() << "cannot drop CAP_DAC_OVERRIDE";
        }
        open();
    }
    Node* core3 = find("CPU 0 Core 3 temperature");
    ASSERT_NE(core3, nullptr);
    fs::path const file = root() / "sys/class/hwmon/hwmon0/temp5_input";
    fs::permissions(file, fs::perms::none);
    EXPECT_TRUE(eventually([&] {
        for (HGLog::Record const& r : log.logs())
            if (r.level >= 4000 && r.message.find(file.string()) != std::string::npos &&
                r.message.find("Permission denied") != std::string::npos)
                return true;
        return false;
    }));
    EXPECT_TRUE(eventually([&] { return prop(core3, "reading") == "unknown"; }));
    fs::permissions(file, fs::perms::owner_read | fs::perms::owner_write);
    EXPECT_TRUE(eventually([&] { return prop(core3, "reading") == "41.0 C"; }));
}

TEST_F(LinuxHwTest, MissingRootStillLoads)
{
    ictest::LogCapture log;
    setenv("IC_SYSFS_ROOT", (tmp_ / "nowhere").c_str(), 1);
    open();
    std::vector<std::string> types;
    for (Node* n : nodes())
        types.push_back(ic_->getNodeHierarchy(n));
    std::sort(types.begin(), types.end());
    EXPECT_EQ(types, (std::vector<std::string>{"ROOT:00000000", "ROOT:00000000->Chassis:00000000",
                                               "ROOT:00000000->Chassis:00000000->RAM:00000000"}));
    bool said = false;
    for (HGLog::Record const& r : log.logs())
        said |= r.level >= 6000 && r.message.find((tmp_ / "nowhere").string()) != std::string::npos;
    EXPECT_TRUE(said);
}

TEST_F(LinuxHwTest, OddPollIntervalFallsBackWithALogLine)
{
    ictest::LogCapture log;
    useTree("small");
    setenv("IC_LINUXHW_POLL_MS", "fast", 1);
    open();
    EXPECT_TRUE(log.find("IC_LINUXHW_POLL_MS='fast' is not 10..3600000; polling every 5000 ms"));
    EXPECT_NE(find(kSmallPackage), nullptr);
}

// ------------------------------------------------------------------ lifecycle

TEST_F(LinuxHwTest, UnloadStopsTheThreadPromptly)
{
    useTree("small");
    setenv("IC_LINUXHW_POLL_MS", "600000", 1);
    open();
    auto const start = std::chrono::steady_clock::now();
    close();
    EXPECT_LT(std::chrono::steady_clock::now() - start, 2s);
}

TEST_F(LinuxHwTest, UnloadingMakesTheLibraryForgetEveryNode)
{
    // The nodes' code leaves with the plug-in, so no pointer may stay behind.
    useTree("small");
    open();
    std::vector<IC::Node*> nodes;
    ASSERT_EQ(ic_->getAllNodes(nodes).getStatus(), 0);
    ASSERT_EQ(nodes.size(), 17u);
    std::vector<std::string> paths;
    for (IC::Node* n : nodes)
        paths.push_back(n->getPath());
    close();
    std::vector<IC::Node*> left;
    IC::InstCtrl::nodestore.getAllNodes(left);
    EXPECT_TRUE(left.empty());
    for (std::string const& path : paths) {
        IC::Node* found = nullptr;
        EXPECT_EQ(IC::InstCtrl::nodestore.getNode(path, &found).getStatus(), 1);
    }
}

TEST_F(LinuxHwTest, RealMachineLoads)
{
    setenv("IC_SYSFS_ROOT", "/", 1);
    open();
    EXPECT_EQ(ofType(Node::ROOT).size(), 1u);
    EXPECT_GE(ofType(Node::CPU).size(), 1u);
    for (Node* n : nodes())
        EXPECT_FALSE(n->getPath().empty()) << n->getDescription();
    // A few polls of the real tree, then a clean unload.
    std::this_thread::sleep_for(300ms);
    close();
}

} // namespace
