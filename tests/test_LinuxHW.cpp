// The shipped Linux hardware management interface, loaded through the real
// library from a temporary plug-in directory and pointed at a copy of an
// example sysfs tree (examples/sysfs), which the tests then change under it.
#include "Recorders.h"
#include "TestSupport.h"

#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include <map>

namespace {

namespace fs = std::filesystem;
using IC::Alert;
using IC::Node;

// Long enough for a slow sanitizer build; polls come every 50 ms.
constexpr int kDeadlineMs = 8000;

class LinuxHwTest : public ::testing::Test {
protected:
    LinuxHwTest()
    {
        ictest::Recorder::get().reset();
        for (char const* dir : {"fp", "mi"})
            fs::create_directories(tmp_.path(dir));
        fs::create_symlink(LINUXHW_PLUGIN, tmp_.path("mi/linuxhw.so"));
    }
    ~LinuxHwTest() override { close(); }

    std::string root() const { return tmp_.path("root"); }
    void useTree(std::string const& name)
    {
        fs::copy(fs::path(LINUXHW_EXAMPLES) / name, root(),
                 fs::copy_options::recursive | fs::copy_options::copy_symlinks);
    }
    // Opens the library on root() (a copy of tree first, if given); the
    // recorder gets the alerts on every sensor type as a functional plug-in would.
    void open(std::string const& tree = "")
    {
        if (!tree.empty())
            useTree(tree);
        ictest::EnvGuard sysfs("IC_SYSFS_ROOT", root());
        IC::Error* err = nullptr;
        ASSERT_EQ(Open(&ic_, &err), 0);
        for (unsigned int t = 0; t < Node::invalid; ++t)
            ASSERT_EQ(IC::InstCtrl::regFPsensorAlerts(ictest::recAlert, static_cast<Node::SensorType>(t), this)
                          .getStatus(), 0);
    }
    void close()
    {
        if (ic_)
            Unloadlib();
        ic_ = nullptr;
    }

    // Replaced whole, so that no poll reads half a value.
    void write(std::string const& rel, std::string const& text)
    {
        std::ofstream(root() + "/" + rel + ".new") << text << '\n';
        fs::rename(root() + "/" + rel + ".new", root() + "/" + rel);
    }
    // A directory made beside the tree and moved into place in one step.
    void install(std::string const& rel, std::map<std::string, std::string> const& files)
    {
        fs::remove_all(tmp_.path("stage"));
        fs::create_directories(tmp_.path("stage/device"));
        for (auto const& [name, text] : files)
            std::ofstream(tmp_.path("stage/" + name)) << text << '\n';
        fs::rename(tmp_.path("stage"), root() + "/" + rel);
    }

    std::vector<Node*> nodes() const
    {
        std::vector<Node*> all;
        EXPECT_EQ(ic_->getAllNodes(all).getStatus(), 0);
        return all;
    }
    std::string pathOf(std::string const& description) const
    {
        for (Node* n : nodes())
            if (n->getDescription() == description)
                return n->getPath();
        return "<no node " + description + ">";
    }
    Node* node(std::string const& path) const { Node* n = nullptr; return ic_->getNode(path, &n).getStatus() ? nullptr : n; }
    // "value unit" of a property of the node with that description.
    std::string prop(std::string const& description, std::string const& name) const
    {
        Node::Property p;
        Node* n = node(pathOf(description));
        if (!n || !n->getProperty(name, &p))
            return "<none>";
        return p.unit.empty() ? p.value : p.value + " " + p.unit;
    }
    static bool eventually(std::function<bool()> const& pred) { return ictest::eventually(pred, kDeadlineMs); }

    // The alerts on path so far, as "class/status/severity/message".
    std::vector<std::string> alerts(std::string const& path) const
    {
        std::vector<std::string> out;
        for (ictest::AlertCall const& call : ictest::Recorder::get().calls(this))
            for (Alert const& a : call.alerts)
                if (std::find(a.nodePaths().begin(), a.nodePaths().end(), path) != a.nodePaths().end())
                    out.push_back(std::to_string(a.getClass()) + "/" + std::to_string(a.getStatus()) + "/" +
                                  std::to_string(a.getSeverity()) + "/" + a.getMessage());
        return out;
    }
    void expectAlerts(std::string const& path, std::vector<std::string> const& expected) const
    {
        EXPECT_TRUE(eventually([&] { return alerts(path) == expected; })) << ::testing::PrintToString(alerts(path));
    }

    ictest::TempDir tmp_{"ic_linuxhw"};
    ictest::EnvGuard miDir_{"IC_MI_DIR", tmp_.path("mi")};
    ictest::EnvGuard fpDir_{"IC_FP_DIR", tmp_.path("fp")};
    ictest::EnvGuard poll_{"IC_LINUXHW_POLL_MS", "50"};
    IC::InstrumentationControl* ic_ = nullptr;
};

std::string const kPackage = "CPU 0 Package id 0 temperature";

// ------------------------------------------------------------------ the tree

// The small tree: its layout and properties; readings and alarms raise one
// alert per change, odd files make a value unknown; devices arrive, leave and
// come back under their path.
TEST_F(LinuxHwTest, SmallTreeLayoutAlertsAndDevices)
{
    ictest::LogCapture log;
    open("small");
    std::string const chassis = "ROOT:00000000->Chassis:00000000";
    std::string const cpu = chassis + "->CPU:00000000";
    std::vector<std::string> layout;
    for (Node* n : nodes())
        layout.push_back(ic_->getNodeHierarchy(n) + " | " + ic_->pathToPrintablePath(n->getPath()) + " | " +
                         n->getDescription());
    std::sort(layout.begin(), layout.end());
    EXPECT_EQ(layout, (std::vector<std::string>{
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
    }));
    std::vector<std::string> shown;
    for (auto const& p : node(pathOf(kPackage))->getProperties())
        shown.push_back(p.name + "=" + p.value + (p.unit.empty() ? "" : " " + p.unit));
    EXPECT_EQ(shown, (std::vector<std::string>{"label=Package id 0", "chip=coretemp", "reading=45.0 C",
                                               "upper_warning=80.0 C", "upper_critical=100.0 C", "state=ok"}));
    std::string const up = "Network port enp1s0 (3c:ec:ef:10:00:01)";
    std::string const down = "Network port enp2s0 (3c:ec:ef:10:00:02)";
    std::string const disk = "Disk nvme0n1: Samsung SSD 980 PRO 1TB (1000 GB)";
    std::string const props[][3] = {
        {"System Acme Computers Edge E10", "serial", "E10-000123"},
        {"CPU 0: Intel(R) Xeon(R) E-2224 CPU @ 3.40GHz", "vendor", "GenuineIntel"},
        {"CPU 0 core 2", "threads", "2"},
        {"System memory 15.5 GB", "size", "15921 MB"},
        {up, "link", "up"}, {down, "speed", "unknown"}, {down, "state", "no link"},
        {disk, "size", "1000204886016 bytes"}, {disk, "media", "ssd"},
    };
    for (auto const& p : props)
        EXPECT_EQ(prop(p[0], p[1]), p[2]) << p[0];

    std::string const pkg = pathOf(kPackage);
    std::string const warning = "5/2/1/CPU 0 Package id 0 temperature 100.0 C above warning 80.0 C";
    // At the critical limit is not above it.
    write("sys/class/hwmon/hwmon0/temp1_input", "100000");
    expectAlerts(pkg, {warning});
    std::string const critical = "5/3/2/CPU 0 Package id 0 temperature 101.0 C above critical 100.0 C";
    write("sys/class/hwmon/hwmon0/temp1_input", "101000");
    expectAlerts(pkg, {warning, critical});
    write("sys/class/hwmon/hwmon0/temp1_input", "45000");
    expectAlerts(pkg, {warning, critical, "5/1/0/CPU 0 Package id 0 temperature back to normal at 45.0 C"});
    EXPECT_EQ(prop(kPackage, "state"), "ok");

    std::string const core = pathOf("CPU 0 Core 1 temperature");
    write("sys/class/hwmon/hwmon0/temp3_crit_alarm", "1");
    expectAlerts(core, {"5/3/2/CPU 0 Core 1 temperature: hwmon alarm temp3_crit_alarm is set"});
    EXPECT_EQ(prop("CPU 0 Core 1 temperature", "state"), "critical");
    write("sys/class/hwmon/hwmon0/temp3_crit_alarm", "0");
    expectAlerts(core, {"5/3/2/CPU 0 Core 1 temperature: hwmon alarm temp3_crit_alarm is set",
                        "5/1/0/CPU 0 Core 1 temperature back to normal at 44.0 C"});
    // An upper limit of 0 was never programmed; sensors that did not move
    // raised nothing.
    write("sys/class/hwmon/hwmon0/temp4_max", "0");
    EXPECT_TRUE(eventually([&] { return prop("CPU 0 Core 2 temperature", "upper_warning") == "<none>"; }));

    // Odd files make a value unknown and are logged once, not on every poll;
    // good values come back without an alert.
    auto logged = [&](std::string const& file) {
        std::size_t n = 0;
        for (HGLog::Record const& r : log.logs("Helmgard.Plugins.LinuxHW"))
            n += r.message.find(file) != std::string::npos;
        return n;
    };
    write("sys/class/hwmon/hwmon0/temp2_input", "hot!");
    EXPECT_TRUE(eventually([&] { return prop("CPU 0 Core 0 temperature", "state") == "unknown"; }));
    // A directory where a file should be cannot be read, by root either.
    std::string const odd = root() + "/sys/class/hwmon/hwmon0/temp4_input";
    fs::remove(odd);
    fs::create_directory(odd);
    EXPECT_TRUE(eventually([&] { return prop("CPU 0 Core 2 temperature", "reading") == "unknown"; }));
    write("sys/class/hwmon/hwmon0/temp2_input", "43000");
    EXPECT_TRUE(eventually([&] { return prop("CPU 0 Core 0 temperature", "reading") == "43.0 C"; }));
    EXPECT_EQ(logged("temp2_input"), 1u);
    EXPECT_EQ(logged("temp4_input"), 1u);
    EXPECT_TRUE(alerts(pathOf("CPU 0 Core 0 temperature")).empty());
    EXPECT_TRUE(alerts(pathOf("CPU 0 Core 2 temperature")).empty());

    // A new port, gone again, back again; a disk that goes.
    std::size_t const before = nodes().size();
    std::map<std::string, std::string> const eth9 = {
        {"device/uevent", "PCI_SLOT_NAME=0000:03:00.0"}, {"address", "00:1b:21:aa:bb:cc"}, {"carrier", "1"},
        {"speed", "10000"}};
    install("sys/class/net/eth9", eth9);
    std::string const description = "Network port eth9 (00:1b:21:aa:bb:cc)";
    ASSERT_TRUE(eventually([&] { return nodes().size() == before + 1; }));
    std::string const path = pathOf(description);
    EXPECT_EQ(ic_->getNodeHierarchy(node(path)).rfind("ROOT:00000000->Chassis:00000000->Network Port:", 0), 0u);
    EXPECT_EQ(prop(description, "speed"), "10000 Mb/s");
    std::string const arrival = "3/1/0/" + description;
    std::string const removal = "4/1/1/" + description + " was removed";
    expectAlerts(path, {arrival});
    fs::remove_all(root() + "/sys/class/net/eth9");
    expectAlerts(path, {arrival, removal});
    EXPECT_TRUE(eventually([&] { return node(path) == nullptr && nodes().size() == before; }));
    // It comes back under the same path.
    install("sys/class/net/eth9", eth9);
    expectAlerts(path, {arrival, removal, arrival});

    std::string const diskPath = pathOf(disk);
    fs::remove_all(root() + "/sys/block/nvme0n1");
    expectAlerts(diskPath, {"4/1/1/" + disk + " was removed"});
    EXPECT_TRUE(eventually([&] { return node(diskPath) == nullptr; }));
}

// The large tree: instances, units and the alert classes of fans, supplies,
// memory and links; paths survive a reopen.
TEST_F(LinuxHwTest, LargeTreeInstancesUnitsAlertsAndStablePaths)
{
    open("large");
    std::map<Node::SensorType, std::size_t> counts;
    for (Node* n : nodes())
        ++counts[n->getSensor()];
    EXPECT_EQ(counts, (std::map<Node::SensorType, std::size_t>{
                          {Node::ROOT, 1}, {Node::Chassis, 1}, {Node::BIOS, 1}, {Node::CPU, 2},
                          {Node::CPUCore, 16}, {Node::RAM, 1}, {Node::DIMM, 8}, {Node::NetworkPort, 4},
                          {Node::HardDrive, 4}, {Node::PowerSupply, 2}, {Node::TemperatureSensor, 21},
                          {Node::Fan, 6}, {Node::VoltageSensor, 9}}));
    // Core ids with gaps; coretemp sensors below their package by input
    // index; DIMMs by mc << 8 | dimm; board sensors by chip digest << 8 | index.
    std::string const chassis = "ROOT:00000000->Chassis:00000000->";
    std::pair<char const*, std::string> const places[] = {
        {"CPU 1 core 11", chassis + "CPU:00000001->CPU Core:0000000b"},
        {"CPU 1 Core 11 temperature", chassis + "CPU:00000001->Temperature Sensor:0000000d"},
        {"DIMM CPU_SrcID#1_MC#0_Chan#2_DIMM#0", chassis + "RAM:00000000->DIMM:00000102"},
        {"nct6779 fan1 speed", chassis + "Fan:"},
    };
    for (auto const& [description, hierarchy] : places)
        EXPECT_EQ(ic_->getNodeHierarchy(node(pathOf(description))).substr(0, hierarchy.size()), hierarchy);
    std::string const fan = ic_->getNodeHierarchy(node(pathOf("nct6779 fan1 speed")));
    EXPECT_EQ(fan.substr(fan.size() - 2), "01") << fan;
    std::string const props[][3] = {
        {"CPU 1 core 11", "threads", "15,31"},
        {"nct6779 fan1 speed", "reading", "5400 RPM"},
        {"nct6779 in1 voltage", "reading", "12.096 V"},
        {"DIMM CPU_SrcID#1_MC#0_Chan#2_DIMM#0", "corrected_errors", "2"},
        {"DIMM CPU_SrcID#1_MC#0_Chan#2_DIMM#0", "state", "warning"},
        {"Power supply PSU1 (Mains)", "reading", "184.0 W"},
        {"Network port ens1f0 (0c:42:a1:7e:20:00)", "speed", "25000 Mb/s"},
    };
    for (auto const& p : props)
        EXPECT_EQ(prop(p[0], p[1]), p[2]) << p[0];

    std::string const psu = "Power supply PSU2 (Mains)";
    std::string const dimm = "DIMM CPU_SrcID#0_MC#0_Chan#1_DIMM#0";
    std::string const port = "Network port eno1 (b4:96:91:4a:10:01)";
    std::string const edac = "sys/devices/system/edac/mc/mc0/dimm1/dimm_";
    // alert: "" when the step raises none
    struct Step { std::string file, value, node, alert; } const steps[] = {
        {"sys/class/hwmon/hwmon2/fan3_input", "300", "nct6779 fan3 speed",
         "5/2/1/nct6779 fan3 speed 300 RPM below warning 600 RPM"},
        {"sys/class/power_supply/PSU2/online", "0", psu, "5/3/2/" + psu + " has no input power"},
        {"sys/class/power_supply/PSU2/online", "1", psu, "5/1/0/" + psu + " is back to normal"},
        {edac + "ce_count", "3", dimm, "6/2/1/" + dimm + ": 3 new corrected memory errors (3 in all)"},
        {edac + "ue_count", "1", dimm, "6/3/2/" + dimm + ": 1 new uncorrected memory errors (1 in all)"},
        {edac + "ce_count", "0", dimm, ""},
        {edac + "ue_count", "0", dimm, "6/1/0/" + dimm + ": error counters were reset"},
        {"sys/class/net/eno1/carrier", "0", port, "7/2/1/" + port + " lost its link"},
        {"sys/class/net/eno1/carrier", "1", port, "7/1/0/" + port + " has its link back"},
    };
    std::map<std::string, std::vector<std::string>> expected;
    for (Step const& step : steps) {
        write(step.file, step.value);
        if (!step.alert.empty())
            expected[step.node].push_back(step.alert);
        expectAlerts(pathOf(step.node), expected[step.node]);
    }
    EXPECT_EQ(prop(dimm, "corrected_errors"), "0");
    // Old news raises nothing: a port without a cable, errors counted before
    // the start, an empty fan header.
    for (char const* quiet : {"Network port eno2 (b4:96:91:4a:10:02)", "DIMM CPU_SrcID#1_MC#0_Chan#2_DIMM#0",
                              "nct6779 fan6 speed"})
        EXPECT_TRUE(alerts(pathOf(quiet)).empty()) << quiet;

    // Paths survive a reopen, hwmon renumbering and a new device.
    auto byDescription = [this] {
        std::map<std::string, std::string> out;
        for (Node* n : nodes())
            out[n->getDescription()] = n->getPath();
        return out;
    };
    std::map<std::string, std::string> const before = byDescription();
    close();
    // The kernel numbers hwmon chips in driver load order, and another card
    // may come with the next boot: neither moves the others.
    fs::rename(root() + "/sys/class/hwmon/hwmon0", root() + "/sys/class/hwmon/hwmon7");
    fs::rename(root() + "/sys/class/hwmon/hwmon2", root() + "/sys/class/hwmon/hwmon0");
    install("sys/class/net/eno3", {{"device/uevent", "PCI_SLOT_NAME=0000:19:00.2"},
                                   {"address", "b4:96:91:4a:10:03"}, {"carrier", "1"}});
    open();
    std::map<std::string, std::string> after = byDescription();
    EXPECT_EQ(after.size(), before.size() + 1);
    for (auto const& [description, path] : before)
        EXPECT_EQ(after[description], path) << description;
}

// ------------------------------------------------------------------ bad input

TEST_F(LinuxHwTest, HostileNumbersAreUnknownAndNeverCrash)
{
    using namespace std::string_literals;
    useTree("small");
    std::string const chip = "sys/class/hwmon/hwmon9/", mc = "sys/devices/system/edac/mc/mc0/dimm";
    struct Row { std::string file, value, node, property, expected; };
    std::vector<Row> rows = {
        // Sizes in sectors: the product with 512, the rounding to GB; below, 64-bit limits, forms that are no number.
        {"sys/block/h1/size", "18014398509481983", "Disk h1 (9223372037 GB)", "size", "9223372036854775296 bytes"},
        // Readings: negative where the quantity can be, never for a fan.
        {chip + "temp1_input", "4\0"s "5000", "hostile temp1 temperature", "reading", "unknown"},
        {chip + "temp1_max", "80000", "hostile temp1 temperature", "state", "unknown"},
        {chip + "temp2_input", "45000\0"s, "hostile temp2 temperature", "reading", "unknown"},
        {chip + "temp3_input", "-5000", "hostile temp3 temperature", "reading", "-5.0 C"},
        {chip + "temp4_input", "-9223372036854775808", "hostile temp4 temperature", "reading", "-9223372036854775.8 C"},
        {chip + "temp5_input", "9223372036854775807", "hostile temp5 temperature", "reading", "9223372036854775.8 C"},
        {chip + "temp6_input", "-9223372036854775809", "hostile temp6 temperature", "reading", "unknown"},
        {chip + "temp7_input", "4.5e4", "hostile temp7 temperature", "reading", "unknown"},
        {chip + "temp8_input", "50000", "hostile temp8 temperature", "upper_warning", "<none>"},
        {chip + "temp8_max", "99999999999999999999", "hostile temp8 temperature", "state", "ok"},
        {chip + "temp9_input", "50000", "hostile temp9 temperature", "state", "ok"},
        {chip + "temp9_crit_alarm", "-1", "hostile temp9 temperature", "reading", "50.0 C"},
        {chip + "fan1_input", "-1", "hostile fan1 speed", "reading", "unknown"},
        {chip + "fan2_input", "18446744073709551615", "hostile fan2 speed", "reading", "unknown"},
        {chip + "in1_input", "-12000", "hostile in1 voltage", "reading", "-12.000 V"},
        // Counts and sizes of DIMMs, of memory; a supply's percentage; a port's speed.
        {mc + "0/size", "-1", "DIMM h0", "size", "unknown"},
        {mc + "1/dimm_ce_count", "-3", "DIMM h1", "corrected_errors", "unknown"},
        {mc + "2/dimm_ce_count", "18446744073709551616", "DIMM h2", "corrected_errors", "unknown"},
        {mc + "3/dimm_ue_count", "1\0"s "1", "DIMM h3", "uncorrected_errors", "unknown"},
        {mc + "3/size", "4294967296", "DIMM h3", "size", "4294967296 MB"},
        {"proc/meminfo", "MemTotal: 99999999999999999999 kB", "System memory", "size", "unknown"},
        {"sys/class/power_supply/BAT0/capacity", "101", "Power supply BAT0", "capacity", "unknown"},
        {"sys/class/power_supply/BAT1/capacity", "-9223372036854775808", "Power supply BAT1", "capacity", "unknown"},
        {"sys/class/net/h0/speed", "99999999999999999999", "Network port h0", "speed", "unknown"},
    };
    for (std::string const& size : {"99999999999999999"s, "9223372036854775807"s, "9223372036854775808"s,
                                    "18446744073709551616"s, "-1"s, "+512"s, "1e9"s, "0x200"s, ""s, "4\0"s + "096"})
        rows.push_back({"sys/block/s" + std::to_string(rows.size()) + "/size", size,
                        "Disk s" + std::to_string(rows.size()), "size", "unknown"});
    fs::create_directories(root() + "/" + chip);
    std::ofstream(root() + "/" + chip + "name") << "hostile\n";
    for (Row const& r : rows) {
        fs::path const file = root() + "/" + r.file;
        fs::create_directories(file.parent_path());
        std::ofstream(file, std::ios::binary) << r.value << '\n';
        if (r.file.rfind("sys/block/", 0) == 0 || r.file.rfind("sys/class/net/", 0) == 0)
            fs::create_directories(file.parent_path() / "device");
        if (r.file.rfind(mc, 0) == 0) {
            std::ofstream(file.parent_path() / "dimm_label") << "h" << r.file[mc.size()] << '\n';
            if (!fs::exists(file.parent_path() / "size"))
                std::ofstream(file.parent_path() / "size") << "16384\n";
        }
    }
    open();
    for (Row const& r : rows)
        EXPECT_EQ(prop(r.node, r.property), r.expected) << r.file << " = '" << r.value << "'";
    // A poll reads them all again.
    write(chip + "temp3_input", "-6000");
    EXPECT_TRUE(eventually([&] { return prop("hostile temp3 temperature", "reading") == "-6.0 C"; }));
}

// Without hwmon, thermal zones stand in. Unloading must wake the poller that
// waits for its interval, and the nodes' code leaves with the plug-in: the
// library forgets every node. Without any tree, the host, its chassis and its
// memory are still there, whatever the interval says.
TEST_F(LinuxHwTest, ThermalZonesStandInAndUnloadingForgetsEveryNode)
{
    useTree("small");
    fs::remove_all(root() + "/sys/class/hwmon");
    {
        ictest::EnvGuard slow("IC_LINUXHW_POLL_MS", "600000");
        open();
    }
    std::string const zone = "Thermal zone 0 (x86_pkg_temp)";
    EXPECT_EQ(ic_->getNodeHierarchy(node(pathOf(zone))), "ROOT:00000000->Chassis:00000000->Temperature Sensor:00000000");
    EXPECT_EQ(prop(zone, "reading"), "45.0 C");
    {
        ictest::Watchdog guard(30, "unloading while the polling thread waits");
        close();
    }
    std::vector<Node*> left;
    IC::InstCtrl::nodestore.getAllNodes(left);
    EXPECT_TRUE(left.empty());

    fs::remove_all(root());
    ictest::EnvGuard fast("IC_LINUXHW_POLL_MS", "fast"); // not a number: the default interval
    open();
    std::vector<std::string> types;
    for (Node* n : nodes())
        types.push_back(ic_->getNodeHierarchy(n));
    std::sort(types.begin(), types.end());
    EXPECT_EQ(types, (std::vector<std::string>{"ROOT:00000000", "ROOT:00000000->Chassis:00000000",
                                               "ROOT:00000000->Chassis:00000000->RAM:00000000"}));
}

} // namespace
