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

#include <map>

namespace {

namespace fs = std::filesystem;
using IC::Alert;
using IC::Node;

constexpr int kDeadlineMs = 15000; // a sanitizer build on a busy 2-core machine

// A port of 127.0.0.1 that nothing uses now (type: SOCK_DGRAM or SOCK_STREAM).
unsigned int freePort(int type)
{
    int const fd = ::socket(AF_INET, type, 0);
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof a;
    unsigned int port = 0;
    if (::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0 &&
        ::getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len) == 0)
        port = ntohs(a.sin_port);
    ::close(fd);
    return port;
}

std::string run(std::string const& command)
{
    std::string out;
    if (FILE* p = ::popen(command.c_str(), "r")) {
        char buf[4096];
        while (std::size_t n = std::fread(buf, 1, sizeof buf, p))
            out.append(buf, n);
        ::pclose(p);
    }
    return out;
}

bool installed(char const* program)
{
    return std::system(("command -v " + std::string(program) + " >/dev/null 2>&1").c_str()) == 0;
}

class IpmiTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        if (!installed("ipmi_sim") || !installed("sdrcomp") || !installed("ipmi-sensors"))
            GTEST_SKIP() << "ipmi_sim, sdrcomp or ipmi-sensors is not installed (Debian packages openipmi and "
                            "freeipmi-tools; scripts/install-deps.sh installs them)";
        ictest::Recorder::get().reset();
        fs::create_directories(tmp_.path("fp"));
        fs::create_directories(tmp_.path("mi"));
        fs::create_directories(tmp_.path("data"));
        fs::create_directories(tmp_.path("sim"));
        fs::create_directories(tmp_.path("cache"));
        fs::create_symlink(IPMI_PLUGIN, tmp_.path("mi/ipmi.so"));
        lan_ = freePort(SOCK_DGRAM);
        std::string const pw = tmp_.write("pw", "icbmc-secret\n");
        ::chmod(pw.c_str(), 0600);
        section_ = "[bmc sim]\nhost = 127.0.0.1:" + std::to_string(lan_) +
                   "\nuser = monitor\npassword_file = " + pw + "\nworkarounds = opensesspriv\n";
        config(section_);
        ASSERT_EQ(sim("start " + tmp_.path("sim") + " " + std::to_string(lan_) + " " +
                      std::to_string(freePort(SOCK_STREAM))), 0)
            << run("cat " + tmp_.path("sim/ipmi_sim.log"));
    }
    void TearDown() override
    {
        close();
        if (lan_)
            sim("stop " + tmp_.path("sim"));
    }

    int sim(std::string const& args) { return std::system((IPMI_EXAMPLES "/bmcsim.sh " + args + " >/dev/null").c_str()); }
    void console(std::string const& command) { ASSERT_EQ(sim("cmd " + tmp_.path("sim") + " '" + command + "'"), 0); }
    pid_t simPid() { return static_cast<pid_t>(std::stol(run("cat " + tmp_.path("sim/pid")))); }
    void config(std::string const& text) { tmp_.write("ipmi.conf", text); }

    void open()
    {
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

    Node* byName(std::string const& description) const
    {
        std::vector<Node*> all;
        ic_->getAllNodes(all);
        for (Node* n : all)
            if (n->getDescription() == description)
                return n;
        return nullptr;
    }
    std::string prop(std::string const& description, std::string const& name) const
    {
        Node::Property p;
        Node* n = byName(description);
        return n && n->getProperty(name, &p) ? p.value : "-";
    }
    // The alerts on a node so far, as "class/status".
    std::vector<std::string> alerts(std::string const& description) const
    {
        std::vector<std::string> out;
        Node* n = byName(description);
        for (ictest::AlertCall const& call : ictest::Recorder::get().calls(this))
            for (Alert const& a : call.alerts)
                if (n && a.getClass() != 3 && std::count(a.nodePaths().begin(), a.nodePaths().end(), n->getPath()))
                    out.push_back(std::to_string(a.getClass()) + "/" + std::to_string(a.getStatus()));
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
    IC::InstrumentationControl* ic_ = nullptr;
    unsigned int lan_ = 0;
    std::string section_;
};

// Every sensor ipmi-sensors lists is a node with its reading, thresholds and
// state class; the faults present at start are on the nodes for health.
TEST_F(IpmiTest, NodesMatchIpmiSensorsAndStartFaultsAreShown)
{
    open();
    std::string const rows =
        run("ipmi-sensors -h 127.0.0.1:" + std::to_string(lan_) + " -u monitor -p icbmc-secret -W opensesspriv "
            "-l operator --quiet-cache --sdr-cache-directory " + tmp_.path("cache") +
            " --output-sensor-thresholds --comma-separated-output --no-header-output --output-sensor-state");
    std::map<std::string, Node::SensorType> const types{
        {"Temperature", Node::TemperatureSensor}, {"Fan", Node::Fan}, {"Voltage", Node::VoltageSensor},
        {"Power Supply", Node::PowerSupply}};
    std::map<std::string, std::string> const states{{"Nominal", "ok"}, {"Warning", "warning"}, {"Critical", "critical"}};
    // ID,Name,Type,State,Reading,Units,Lower NR,Lower C,Lower NC,Upper NC,Upper C,Upper NR,Event
    std::pair<int, char const*> const columns[] = {
        {4, "reading"}, {7, "lower_critical"}, {8, "lower_warning"}, {9, "upper_warning"}, {10, "upper_critical"}};
    std::istringstream in(rows);
    std::string line;
    int sensors = 0;
    while (std::getline(in, line)) {
        std::vector<std::string> f;
        std::istringstream cells(line);
        for (std::string c; std::getline(cells, c, ',');)
            f.push_back(c);
        ASSERT_GE(f.size(), 12u) << line;
        ++sensors;
        Node* n = byName(f[1]);
        ASSERT_NE(n, nullptr) << f[1];
        EXPECT_EQ(n->getSensor(), types.at(f[2])) << f[1];
        EXPECT_EQ(prop(f[1], "state"), states.at(f[3])) << f[1];
        for (auto const& [col, name] : columns)
            if (f[col] == "N/A")
                EXPECT_EQ(prop(f[1], name), "-") << f[1] << " " << name;
            else
                EXPECT_NEAR(std::stod(prop(f[1], name)), std::stod(f[col]), 0.005) << f[1] << " " << name;
        // A fault present at start is the node's condition, so health asserts it.
        EXPECT_EQ(prop(f[1], "condition_class"), f[3] == "Nominal" ? "-" : "5") << f[1];
    }
    EXPECT_EQ(sensors, 8);
    Node* bmc = byName("BMC sim (127.0.0.1:" + std::to_string(lan_) + ")");
    ASSERT_NE(bmc, nullptr);
    EXPECT_EQ(ic_->getNodeHierarchy(bmc).rfind("ROOT:00000000->Chassis:", 0), 0u) << ic_->getNodeHierarchy(bmc);
    EXPECT_EQ(byName("Inlet Temp")->getLinkedId(), bmc->getLinkedId());
    std::string const bmcName = bmc->getDescription();
    EXPECT_EQ(prop(bmcName, "version") + " " + prop(bmcName, "ipmi_version"), "9.08 2.0"); // as bmc-info says
}

// With linuxhw (loaded after ipmi, by file name) there is one ROOT and one
// Chassis 0: linuxhw adopts what ipmi reported.
TEST_F(IpmiTest, OneTreeWithLinuxhw)
{
    fs::create_symlink(LINUXHW_PLUGIN, tmp_.path("mi/linuxhw.so"));
    ictest::EnvGuard sysfs("IC_SYSFS_ROOT", LINUXHW_EXAMPLES "/small");
    ictest::EnvGuard poll("IC_LINUXHW_POLL_MS", "100");
    open();
    std::vector<Node*> all;
    ic_->getAllNodes(all);
    std::multiset<std::string> top;
    for (Node* n : all)
        if (n->getSensor() == Node::ROOT || n->getSensor() == Node::Chassis)
            top.insert(ic_->getNodeHierarchy(n));
    Node* bmc = byName("BMC sim (127.0.0.1:" + std::to_string(lan_) + ")");
    ASSERT_NE(bmc, nullptr);
    Node* bmcChassis = nullptr;
    ASSERT_EQ(ic_->getNode(bmc->getLinkedId(), &bmcChassis).getStatus(), 0);
    EXPECT_EQ(top, (std::multiset<std::string>{"ROOT:00000000", "ROOT:00000000->Chassis:00000000",
                                               ic_->getNodeHierarchy(bmcChassis)}));
    EXPECT_EQ(ic_->getNodeHierarchy(byName("CPU 0 core 0")),
              "ROOT:00000000->Chassis:00000000->CPU:00000000->CPU Core:00000000");

    // ipmi removed by a reload: linuxhw announces its nodes again below a
    // ROOT and Chassis of its own, so that none is left without its parent.
    fs::remove(tmp_.path("mi/ipmi.so"));
    IC::InstCtrl::TimedReload();
    EXPECT_TRUE(ictest::eventually([&] { return byName("System Acme Computers Edge E10") != nullptr; }, kDeadlineMs));
    Node* core = byName("CPU 0 core 0");
    ASSERT_NE(core, nullptr);
    EXPECT_EQ(ic_->getNodeHierarchy(core), "ROOT:00000000->Chassis:00000000->CPU:00000000->CPU Core:00000000");
    Node* parent = nullptr;
    EXPECT_EQ(ic_->getNode(core->getLinkedId(), &parent).getStatus(), 0);
}

// Each change made through the simulator's console raises exactly one
// alert; a reading that stays raises nothing more.
TEST_F(IpmiTest, ConsoleChangesRaiseExactlyOneAlertEach)
{
    open();
    struct Step {
        char const* command;
        char const* sensor;
        char const* alert;
    } const steps[] = {
        {"sensor_set_value 0x20 0 1 85 0", "CPU1 Temp", "5/2"},
        {"sensor_set_value 0x20 0 1 95 0", "CPU1 Temp", "5/3"},
        {"sensor_set_value 0x20 0 1 45 0", "CPU1 Temp", "5/1"},
        {"sensor_set_value 0x20 0 4 60 0", "System Fan 2", "5/1"},
        {"sensor_set_bit 0x20 0 7 3 1 0", "PS1 Status", "5/3"},
        {"sensor_set_bit 0x20 0 8 3 0 0", "PS2 Status", "5/1"},
    };
    std::map<std::string, std::vector<std::string>> expected;
    for (Step const& s : steps) {
        console(s.command);
        expected[s.sensor].push_back(s.alert);
        expectAlerts(s.sensor, expected[s.sensor]);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(600)); // three more polls
    for (auto const& [sensor, list] : expected)
        EXPECT_EQ(alerts(sensor), list) << sensor;
}

// A stopped BMC: its sensors go unknown with one alert on the BMC node, and
// Open returns within its bound; it comes back with one alert and readings.
TEST_F(IpmiTest, StoppedBmcIsUnknownAndComesBack)
{
    std::string const bmc = "BMC sim (127.0.0.1:" + std::to_string(lan_) + ")";
    open();
    ASSERT_EQ(::kill(simPid(), SIGSTOP), 0);
    expectAlerts(bmc, {"5/3"});
    EXPECT_EQ(prop("CPU1 Temp", "state"), "unknown");
    EXPECT_EQ(prop("Inlet Temp", "condition_class"), "5"); // the condition last reported stands
    close();

    ictest::Recorder::get().reset();
    auto const start = std::chrono::steady_clock::now();
    open();
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(8)); // bound 5 s, with slack
    EXPECT_EQ(byName("CPU1 Temp"), nullptr);
    EXPECT_EQ(prop(bmc, "state"), "critical");
    ASSERT_EQ(::kill(simPid(), SIGCONT), 0);
    expectAlerts(bmc, {"5/1"});
    EXPECT_TRUE(ictest::eventually([&] { return prop("CPU1 Temp", "state") == "ok"; }, kDeadlineMs));
    // Sensors that arrive late say what is wrong with them once.
    expectAlerts("Inlet Temp", {"5/3"});
}

// A record added to the event log raises one event-log alert on the BMC;
// a restart does not raise it again.
TEST_F(IpmiTest, SelRecordRaisesOnceAcrossRestarts)
{
    std::string const bmc = "BMC sim (127.0.0.1:" + std::to_string(lan_) + ")";
    open();
    console("sel_add 0x20 0x02 0 0 0 0 0x20 0x00 0x04 0x08 0x07 0x6f 0x01 0xff 0xff");
    expectAlerts(bmc, {"9/1"});
    std::vector<std::string> messages;
    for (ictest::AlertCall const& call : ictest::Recorder::get().calls(this))
        for (Alert const& a : call.alerts)
            if (a.getClass() == 9)
                messages.push_back(std::to_string(a.getSeverity()) + " " + a.getMessage());
    EXPECT_EQ(messages, (std::vector<std::string>{"2 " + bmc + " SEL record 1: PS1 Status: Power Supply Failure detected"}));
    close();
    ictest::Recorder::get().reset();
    open();
    std::this_thread::sleep_for(std::chrono::milliseconds(1000)); // five polls
    EXPECT_EQ(alerts(bmc), std::vector<std::string>{});
}

// No /dev/ipmi0 and no configuration: loaded, no node, one information line.
TEST_F(IpmiTest, NoBmcLoadsWithNoNodes)
{
    if (fs::exists("/dev/ipmi0"))
        GTEST_SKIP() << "this machine has an in-band BMC";
    ictest::EnvGuard none("IC_IPMI_CONFIG", tmp_.path("missing.conf"));
    ictest::LogCapture log;
    open();
    std::vector<Node*> all;
    ic_->getAllNodes(all);
    EXPECT_EQ(all.size(), 0u);
    std::vector<std::string> lines;
    for (HGLog::Record const& r : log.logs("Helmgard.Plugins.IPMI"))
        lines.push_back(std::to_string(r.level) + " " + r.message);
    EXPECT_EQ(lines, std::vector<std::string>{"3000 no BMC: no /dev/ipmi0 and no BMC configured in " +
                                              tmp_.path("missing.conf") + "; reporting nothing"});
}

// Bad sections are each one error line naming the file and line; the good
// BMC still loads; a wrong password is a condition on its BMC, not a crash.
TEST_F(IpmiTest, ConfigurationErrorsLeaveOutOnlyTheirBmc)
{
    std::string const pw644 = tmp_.write("pw644", "icbmc-secret\n");
    ::chmod(pw644.c_str(), 0644);
    std::string const wrong = tmp_.write("wrong", "nope\n");
    ::chmod(wrong.c_str(), 0600);
    std::string const host = "host = 127.0.0.1:" + std::to_string(lan_) + "\n";
    struct Case {
        std::string text;
        std::string error; // "" : loads
    } const cases[] = {
        {"[bmc a]\nhost = 127.0.0.1:70000\n", ":2: bad port in '127.0.0.1:70000'; BMC a left out"},
        {"[bmc b]\n" + host + "colour = blue\n", ":3: unknown key 'colour'; BMC b left out"},
        {"[bmc c]\n" + host + "password_file = /nonexistent/pw\n", ":1: BMC c left out: password_file /nonexistent/pw does not exist"},
        {"[bmc d]\n" + host + "password_file = " + pw644 + "\n", ":1: BMC d left out: password_file " + pw644 + " is readable by group or others (chmod 600 it)"},
        {"[bmc e]\n" + host + "user = monitor\nprivilege = root\n", ":4: privilege must be user, operator or admin, not 'root'; BMC e left out"},
        {"[bmc wrong]\n" + host + "user = monitor\npassword_file = " + wrong + "\nworkarounds = opensesspriv\n", ""},
        {section_, ""},
    };
    std::string text;
    std::vector<std::string> expected;
    unsigned int line = 0;
    for (Case const& c : cases) {
        if (!c.error.empty()) {
            std::string const at = c.error.substr(1, c.error.find(':', 1) - 1);
            expected.push_back(tmp_.path("ipmi.conf") + ":" + std::to_string(line + std::stoul(at)) +
                               c.error.substr(c.error.find(':', 1)));
        }
        text += c.text;
        line += static_cast<unsigned int>(std::count(c.text.begin(), c.text.end(), '\n'));
    }
    config(text);
    ictest::LogCapture log;
    open();
    std::vector<std::string> errors;
    for (HGLog::Record const& r : log.logs("Helmgard.Plugins.IPMI"))
        if (r.level == HGLog::HGLogger::LEVEL_ERROR && r.message.find("ipmi.conf:") != std::string::npos)
            errors.push_back(r.message);
    EXPECT_EQ(errors, expected);
    std::vector<Node*> all;
    ic_->getAllNodes(all);
    EXPECT_EQ(std::count_if(all.begin(), all.end(), [](Node* n) { return n->getSensor() == Node::Chassis; }),
              3); // this server's and the two BMCs' 
    EXPECT_NE(byName("Inlet Temp"), nullptr);
    std::string const wrongBmc = "BMC wrong (127.0.0.1:" + std::to_string(lan_) + ")";
    EXPECT_EQ(prop(wrongBmc, "state"), "critical");
    EXPECT_NE(prop(wrongBmc, "condition").find("password"), std::string::npos) << prop(wrongBmc, "condition");
}

} // namespace
