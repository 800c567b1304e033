// The shipped ipmi management interface against a simulated BMC
// (examples/bmc: ipmi_sim of Debian's openipmi on 127.0.0.1), loaded through
// the real library. Every test starts its own simulator with its own ports
// and state directory and stops it, whatever the outcome.
#include "Recorders.h"
#include "TestSupport.h"

#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <map>
#include <utility>

namespace {

namespace fs = std::filesystem;
using IC::Alert;
using IC::Node;
using ictest::run;

constexpr int kDeadlineMs = 15000; // a sanitizer build on a busy 2-core machine

// A port of 127.0.0.1 that nothing uses now (type: SOCK_DGRAM or SOCK_STREAM).
unsigned int freePort(int type)
{
    int const fd = ::socket(AF_INET, type, 0);
    sockaddr_in a{AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}};
    socklen_t len = sizeof a;
    bool const bound = ::bind(fd, reinterpret_cast<sockaddr*>(&a), len) == 0 &&
                       ::getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len) == 0;
    ::close(fd);
    return bound ? ntohs(a.sin_port) : 0;
}

class IpmiTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        if (run("for p in ipmi_sim sdrcomp ipmi-sensors; do command -v $p; done | wc -l") != "3\n")
            GTEST_SKIP() << "ipmi_sim, sdrcomp or ipmi-sensors is not installed (Debian packages openipmi and "
                            "freeipmi-tools; scripts/install-deps.sh installs them)";
        ictest::Recorder::get().reset();
        for (char const* dir : {"fp", "mi", "data", "sim", "cache"})
            fs::create_directories(tmp_.path(dir));
        fs::create_symlink(IPMI_PLUGIN, tmp_.path("mi/ipmi.so"));
        lan_ = freePort(SOCK_DGRAM);
        bmc_ = "BMC sim (127.0.0.1:" + std::to_string(lan_) + ")";
        section_ = "[bmc sim]\nhost = 127.0.0.1:" + std::to_string(lan_) + "\nuser = monitor\npassword_file = " +
                   secret("pw", "icbmc-secret", 0600) + "\nworkarounds = opensesspriv\n";
        tmp_.write("ipmi.conf", section_);
        ASSERT_EQ(sim("start " + tmp_.path("sim") + " " + std::to_string(lan_) + " " +
                      std::to_string(freePort(SOCK_STREAM))), 0)
            << run("cat " + tmp_.path("sim/ipmi_sim.log"));
    }
    void TearDown() override { close(); if (lan_) sim("stop " + tmp_.path("sim")); }

    int sim(std::string const& args) { return std::system((IPMI_EXAMPLES "/bmcsim.sh " + args + " >/dev/null").c_str()); }
    void console(std::string const& command) { ASSERT_EQ(sim("cmd " + tmp_.path("sim") + " '" + command + "'"), 0); }
    void signalSim(int sig) { ASSERT_EQ(::kill(static_cast<pid_t>(std::stol(run("cat " + tmp_.path("sim/pid")))), sig), 0); }
    std::string secret(std::string const& name, std::string const& password, mode_t mode)
    {
        std::string const path = tmp_.write(name, password + "\n");
        ::chmod(path.c_str(), mode);
        return path;
    }

    // A fresh library with a recorder on every sensor type.
    void open()
    {
        close();
        ictest::Recorder::get().reset();
        IC::Error* err = nullptr;
        ASSERT_EQ(Open(&ic_, &err), 0);
        for (unsigned int t = 0; t < Node::invalid; ++t)
            ASSERT_EQ(IC::InstCtrl::regFPsensorAlerts(ictest::recAlert, static_cast<Node::SensorType>(t), this)
                          .getStatus(), 0);
    }
    void close() { if (std::exchange(ic_, nullptr)) Unloadlib(); }

    std::vector<Node*> nodes() const { std::vector<Node*> all; ic_->getAllNodes(all); return all; }
    Node* byName(std::string const& description) const
    {
        for (Node* n : nodes())
            if (n->getDescription() == description)
                return n;
        return nullptr;
    }
    Node* parentOf(Node const* n) const
    {
        Node* p = nullptr;
        return n && ic_->getNode(n->getLinkedId(), &p).getStatus() == 0 ? p : nullptr;
    }
    // The description of the ROOT above a node; "" when a parent is missing.
    std::string rootOf(std::string const& description) const
    {
        Node* n = byName(description);
        while (n && n->getSensor() != Node::ROOT)
            n = parentOf(n);
        return n ? n->getDescription() : "";
    }
    std::string prop(std::string const& description, std::string const& name) const
    {
        Node::Property p;
        Node* n = byName(description);
        return n && n->getProperty(name, &p) ? p.value : "-";
    }
    // The alerts on a node so far, as "class/status" (with "severity message" for the event log).
    std::vector<std::string> alerts(std::string const& description) const
    {
        std::vector<std::string> out;
        Node* n = byName(description);
        for (ictest::AlertCall const& call : ictest::Recorder::get().calls(this))
            for (Alert const& a : call.alerts)
                if (n && a.getClass() != 3 && std::count(a.nodePaths().begin(), a.nodePaths().end(), n->getPath()))
                    out.push_back(std::to_string(a.getClass()) + "/" + std::to_string(a.getStatus()) +
                                  (a.getClass() == 9 ? " " + std::to_string(a.getSeverity()) + " " + a.getMessage() : ""));
        return out;
    }
    void expectAlerts(std::string const& description, std::vector<std::string> const& expected) const
    {
        EXPECT_TRUE(ictest::eventually([&] { return alerts(description) == expected; }, kDeadlineMs))
            << description << ": " << ::testing::PrintToString(alerts(description));
    }

    ictest::TempDir tmp_{"ic_ipmi"};
    ictest::EnvGuard miDir_{"IC_MI_DIR", tmp_.path("mi")};
    ictest::EnvGuard fpDir_{"IC_FP_DIR", tmp_.path("fp")};
    ictest::EnvGuard dataDir_{"IC_DATA_DIR", tmp_.path("data")};
    ictest::EnvGuard config_{"IC_IPMI_CONFIG", tmp_.path("ipmi.conf")};
    ictest::EnvGuard poll_{"IC_IPMI_POLL_MS", "200"};
    ictest::LogCapture log_; // outlives the library, whose threads log to it
    IC::InstrumentationControl* ic_ = nullptr;
    unsigned int lan_ = 0;
    std::string bmc_, section_;
};

// Every sensor ipmi-sensors lists is a node with its reading, thresholds and
// state class, the faults present at start on the nodes for health; then each
// console change raises exactly one alert, and an event-log record one alert
// that a restart does not raise again.
TEST_F(IpmiTest, NodesMatchIpmiSensorsAndEachChangeRaisesOneAlert)
{
    open();
    std::vector<std::string> const table = ictest::lines(run("ipmi-sensors -h 127.0.0.1:" + std::to_string(lan_) +
                              " -u monitor -p icbmc-secret -W opensesspriv -l operator --quiet-cache "
                              "--sdr-cache-directory " + tmp_.path("cache") + " --output-sensor-thresholds "
                              "--comma-separated-output --no-header-output --output-sensor-state"));
    std::map<std::string, Node::SensorType> const types{{"Temperature", Node::TemperatureSensor}, {"Fan", Node::Fan},
        {"Voltage", Node::VoltageSensor}, {"Power Supply", Node::PowerSupply}};
    std::map<std::string, std::string> const states{{"Nominal", "ok"}, {"Warning", "warning"}, {"Critical", "critical"}};
    // ID,Name,Type,State,Reading,Units,Lower NR,Lower C,Lower NC,Upper NC,Upper C,Upper NR,Event
    std::pair<int, char const*> const columns[] = {
        {4, "reading"}, {7, "lower_critical"}, {8, "lower_warning"}, {9, "upper_warning"}, {10, "upper_critical"}};
    for (std::string line : table) {
        std::replace(line.begin(), line.end(), ',', '\n');
        std::vector<std::string> const f = ictest::lines(line);
        ASSERT_GE(f.size(), 12u) << line;
        ASSERT_NE(byName(f[1]), nullptr) << f[1];
        EXPECT_EQ(byName(f[1])->getSensor(), types.at(f[2])) << f[1];
        EXPECT_EQ(prop(f[1], "state"), states.at(f[3])) << f[1];
        for (auto const& [col, name] : columns)
            if (f[col] == "N/A")
                EXPECT_EQ(prop(f[1], name), "-") << f[1] << " " << name;
            else
                EXPECT_NEAR(std::stod(prop(f[1], name)), std::stod(f[col]), 0.005) << f[1] << " " << name;
        EXPECT_EQ(prop(f[1], "condition_class"), f[3] == "Nominal" ? "-" : "5") << f[1];
    }
    EXPECT_EQ(table.size(), 8u);
    ASSERT_NE(byName(bmc_), nullptr);
    EXPECT_EQ(ic_->getNodeHierarchy(byName(bmc_)).rfind("ROOT:00000000->Chassis:", 0), 0u) << ic_->getNodeHierarchy(byName(bmc_));
    // Sensors below their entity's node, which has the entity's FRU inventory.
    std::pair<char const*, char const*> const entities[] = {{"CPU1 Temp", "Processor 1: - - -"}, {"PS2 Status",
        "Power Supply 2: Voltra VP-800 PSU2-0043"}, {"Inlet Temp", "System Board 1: Icebox Systems ICB-2U Board BRD0001234"}};
    for (auto const& [sensor, entity] : entities) {
        Node* e = parentOf(byName(sensor));
        ASSERT_NE(e, nullptr) << sensor;
        std::string const d = e->getDescription();
        EXPECT_EQ(d + ": " + prop(d, "vendor") + " " + prop(d, "model") + " " + prop(d, "serial"), entity);
        EXPECT_EQ(e->getLinkedId(), byName(bmc_)->getLinkedId()) << sensor;
    }
    std::string const ps2 = byName("PS2 Status")->getPath();
    EXPECT_EQ(prop(bmc_, "version") + " " + prop(bmc_, "ipmi_version"), "9.08 2.0"); // as bmc-info says

    std::pair<char const*, char const*> const steps[] = {
        {"sensor_set_value 0x20 0 1 85 0", "CPU1 Temp"}, {"sensor_set_value 0x20 0 1 95 0", "CPU1 Temp"},
        {"sensor_set_value 0x20 0 1 45 0", "CPU1 Temp"}, {"sensor_set_value 0x20 0 4 60 0", "System Fan 2"},
        {"sensor_set_bit 0x20 0 7 3 1 0", "PS1 Status"}, {"sensor_set_bit 0x20 0 8 3 0 0", "PS2 Status"},
        {"sel_add 0x20 0x02 0 0 0 0 0x20 0x00 0x04 0x08 0x07 0x6f 0x01 0xff 0xff", bmc_.c_str()}};
    std::map<std::string, std::vector<std::string>> expected{
        {"CPU1 Temp", {"5/2", "5/3", "5/1"}}, {"System Fan 2", {"5/1"}}, {"PS1 Status", {"5/3"}},
        {"PS2 Status", {"5/1"}}, {bmc_, {"9/1 2 " + bmc_ + " SEL record 1: PS1 Status: Power Supply Failure detected"}}};
    std::map<std::string, std::size_t> seen;
    for (auto const& [command, sensor] : steps) {
        console(command);
        expectAlerts(sensor, std::vector<std::string>(expected[sensor].begin(), expected[sensor].begin() + ++seen[sensor]));
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(600)); // three more polls
    for (auto const& [sensor, list] : expected)
        EXPECT_EQ(alerts(sensor), list) << sensor;
    open();
    std::this_thread::sleep_for(std::chrono::milliseconds(1000)); // five polls
    EXPECT_EQ(alerts(bmc_), std::vector<std::string>{});
    EXPECT_EQ(byName("PS2 Status")->getPath(), ps2);
}

// A stopped BMC: its sensors go unknown with one alert on the BMC node, and
// Open returns within its bound; it comes back with one alert and readings.
TEST_F(IpmiTest, StoppedBmcIsUnknownAndComesBack)
{
    open();
    signalSim(SIGSTOP);
    expectAlerts(bmc_, {"5/3"});
    EXPECT_EQ(prop("CPU1 Temp", "state"), "unknown");
    EXPECT_EQ(prop("Inlet Temp", "condition_class"), "5"); // the condition last reported stands

    auto const start = std::chrono::steady_clock::now();
    open();
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(8)); // bound 5 s, with slack
    EXPECT_EQ(byName("CPU1 Temp"), nullptr);
    EXPECT_EQ(prop(bmc_, "state"), "critical");
    signalSim(SIGCONT);
    expectAlerts(bmc_, {"5/1"});
    EXPECT_TRUE(ictest::eventually([&] { return prop("CPU1 Temp", "state") == "ok"; }, kDeadlineMs));
    expectAlerts("Inlet Temp", {"5/3"}); // sensors that arrive late say what is wrong with them once
}

// No /dev/ipmi0 and no configuration: loaded, no node, one information line.
// Bad sections are each one error line naming the file and line; the good
// BMC still loads; a wrong password is a condition on its BMC, not a crash;
// with linuxhw there is one tree.
TEST_F(IpmiTest, NoBmcBadSectionsAndOneTreeWithLinuxhw)
{
    std::vector<std::string> expected;
    if (!fs::exists("/dev/ipmi0")) { // else this machine has an in-band BMC
        ictest::EnvGuard none("IC_IPMI_CONFIG", tmp_.path("missing.conf"));
        open();
        EXPECT_EQ(nodes().size(), 0u);
        expected.push_back("3000 no BMC: no /dev/ipmi0 and no BMC configured in " + tmp_.path("missing.conf") + "; reporting nothing");
    }
    std::string const pw644 = secret("pw644", "icbmc-secret", 0644), wrong = secret("wrong", "nope", 0600);
    std::string const host = "host = 127.0.0.1:" + std::to_string(lan_) + "\n", e = std::to_string(HGLog::HGLogger::LEVEL_ERROR) + " " + tmp_.path("ipmi.conf");
    tmp_.write("ipmi.conf", "[bmc a]\nhost = 127.0.0.1:70000\n"
                            "[bmc b]\n" + host + "colour = blue\n"
                            "[bmc c]\n" + host + "password_file = /nonexistent/pw\n"
                            "[bmc d]\n" + host + "password_file = " + pw644 + "\n"
                            "[bmc e]\n" + host + "user = monitor\nprivilege = root\n"
                            "[bmc wrong]\n" + host + "user = monitor\npassword_file = " + wrong +
                            "\nworkarounds = opensesspriv\n" + section_);
    fs::create_symlink(LINUXHW_PLUGIN, tmp_.path("mi/linuxhw.so"));
    ictest::EnvGuard sysfs("IC_SYSFS_ROOT", LINUXHW_EXAMPLES "/small"), poll("IC_LINUXHW_POLL_MS", "100");
    open();
    std::vector<std::string> logged;
    for (HGLog::Record const& r : log_.logs("Helmgard.Plugins.IPMI"))
        if (r.message.find(".conf") != std::string::npos)
            logged.push_back(std::to_string(r.level) + " " + r.message);
    expected.insert(expected.end(), {e + ":2: bad port in '127.0.0.1:70000'; BMC a left out",
                               e + ":5: unknown key 'colour'; BMC b left out",
                               e + ":6: BMC c left out: password_file /nonexistent/pw does not exist",
                               e + ":9: BMC d left out: password_file " + pw644 + " is readable by group or others (chmod 600 it)",
                               e + ":15: privilege must be user, operator or admin, not 'root'; BMC e left out"});
    EXPECT_EQ(logged, expected);
    EXPECT_NE(byName("Inlet Temp"), nullptr);
    std::string const wrongBmc = "BMC wrong (127.0.0.1:" + std::to_string(lan_) + ")";
    EXPECT_EQ(prop(wrongBmc, "state"), "critical");
    EXPECT_NE(prop(wrongBmc, "condition").find("password"), std::string::npos) << prop(wrongBmc, "condition");

    // linuxhw (loaded after ipmi, by file name) adopts the ROOT and Chassis 0.
    std::multiset<std::string> top, roots{"ROOT:00000000", "ROOT:00000000->Chassis:00000000"};
    for (Node* n : nodes())
        if (n->getSensor() == Node::ROOT || n->getSensor() == Node::Chassis)
            top.insert(ic_->getNodeHierarchy(n));
    for (std::string const& b : {bmc_, wrongBmc})
        roots.insert(parentOf(byName(b)) ? ic_->getNodeHierarchy(parentOf(byName(b))) : "no chassis above " + b);
    EXPECT_EQ(top, roots);
    // ipmi replaced in one reload: linuxhw joins the ROOT the new one reports.
    std::string const ours = "Server with a BMC", core = "CPU 0 core 0";
    fs::rename(tmp_.path("mi/ipmi.so"), tmp_.path("mi/ipmi2.so"));
    IC::InstCtrl::TimedReload();
    EXPECT_TRUE(ictest::eventually([&] { return rootOf(core) == ours && rootOf(bmc_) == ours; }, kDeadlineMs));
    // ipmi removed by a reload: linuxhw announces its nodes again below a
    // ROOT and Chassis of its own, so that none is left without its parent.
    fs::remove(tmp_.path("mi/ipmi2.so"));
    IC::InstCtrl::TimedReload();
    EXPECT_TRUE(ictest::eventually([&] { return !byName(bmc_) && rootOf(core) != "" && rootOf(core) != ours; }, kDeadlineMs));
    EXPECT_EQ(ic_->getNodeHierarchy(byName(core)), "ROOT:00000000->Chassis:00000000->CPU:00000000->CPU Core:00000000");
    // The mirror image: ipmi, loaded after linuxhw, adopts its ROOT; linuxhw
    // removed, ipmi announces every node again below a ROOT of its own.
    fs::create_symlink(IPMI_PLUGIN, tmp_.path("mi/ipmi.so"));
    IC::InstCtrl::TimedReload();
    EXPECT_TRUE(ictest::eventually([&] { return rootOf(bmc_) == rootOf(core) && rootOf(core) != ""; }, kDeadlineMs));
    // linuxhw replaced in one reload: ipmi joins the ROOT the new one reports.
    fs::rename(tmp_.path("mi/linuxhw.so"), tmp_.path("mi/linuxhw2.so"));
    IC::InstCtrl::TimedReload();
    EXPECT_TRUE(ictest::eventually([&] { return rootOf("Inlet Temp") == rootOf(core) && rootOf(core) != ""; }, kDeadlineMs));
    fs::remove(tmp_.path("mi/linuxhw2.so"));
    IC::InstCtrl::TimedReload();
    EXPECT_TRUE(ictest::eventually([&] { return !byName(core) && rootOf("Inlet Temp") == ours; }, kDeadlineMs));
}

} // namespace
