// icctl run as a process by the shell, against temporary plug-in directories
// holding the fake management interface (fakehw) and the health plug-in.
// JSON output is parsed back; the exit status is checked for every kind of
// bad input.
#include "TestSupport.h"

#include <nlohmann/json.hpp>

#include <sys/wait.h>

#include <map>

namespace fs = std::filesystem;
using ictest::lines;
using ictest::slurp;
using nlohmann::json;

namespace {

struct Result { int status; std::string out, err; };

std::string quoted(std::string const& s)
{
    std::string out = "'";
    for (char c : s)
        out += c == '\'' ? std::string("'\\''") : std::string(1, c);
    return out + "'";
}

// Standard output of a run that must succeed.
std::string out(Result const& r)
{
    EXPECT_EQ(r.status, 0) << r.err;
    return r.out;
}

// Each line of a JSON-lines output, without its time stamp.
std::vector<json> jsonLines(std::string const& text)
{
    std::vector<json> out;
    for (std::string const& line : lines(text))
        out.emplace_back(json::parse(line)).erase("time");
    return out;
}

// fakehw's nodes, as the library codes their paths.
std::string const kRoot = "1f5c";
std::string const kChassis = "1f201f5c";
std::string const kCpu = "1f501f201f5c";
std::string const kTemp = "1f2b01f501f201f5c0";
std::string const kFan = "2f2901f201f5c0";
std::string const kHierarchy = "ROOT:00000000->Chassis:00000000->CPU:00000000->Temperature Sensor:00000000";
json const kTempNode = {
    {"type", 22}, {"typeName", "Temperature Sensor"}, {"instance", 0}, {"description", "CPU temperature"}};

class Icctl : public ::testing::Test {
protected:
    void SetUp() override
    {
        fs::create_directories(mi_ = dir_ / "mi");
        fs::create_directories(fp_ = dir_ / "fp");
        fs::create_symlink(HEALTH_PLUGIN, fp_ / "health.so");
        // Nothing in our environment may steer icctl or the plug-ins.
        for (char const* v : {"IC_MI_DIR", "IC_FP_DIR", "IC_SYSFS_ROOT", "HGLOG_CONFIG", "FAKEHW_PULSE_MS",
                              "FAKEHW_PULSE_HOLD"})
            unsetenv(v);
    }
    void useFakeHw() { fs::create_symlink(FAKEHW_PLUGIN, mi_ / "fakehw.so"); }

    // icctl without the directory options, after prefix (such as "timeout
    // -s INT 3"), with input on standard input.
    Result bare(std::vector<std::string> const& args, std::string const& input = "", std::string const& prefix = "")
    {
        std::ofstream(dir_ / "in", std::ios::binary) << input;
        std::string cmd = "cd " + quoted(dir_) + " || exit 99; " + prefix + " " + quoted(ICCTL_BINARY);
        for (std::string const& a : args)
            cmd += " " + quoted(a);
        int const status = std::system((cmd + " <in >out 2>err").c_str());
        return Result{WIFEXITED(status) ? WEXITSTATUS(status) : -1, slurp(dir_ / "out"), slurp(dir_ / "err")};
    }
    Result icctl(std::vector<std::string> args, std::string const& prefix = "")
    {
        args.insert(args.begin(), {"--mi-dir", mi_.string(), "--fp-dir", fp_.string()});
        return bare(args, "", prefix);
    }

    ictest::TempDir tmp_{"ic-icctl"};
    fs::path dir_ = tmp_.root(), mi_, fp_;
};

TEST_F(Icctl, EmptyResultsSensorsAndTheVerboseLog)
{
    EXPECT_EQ(out(icctl({"tree"})), "No nodes: no management interface reported any hardware.\n");
    EXPECT_EQ(out(icctl({"alerts"})), "No asserted alerts.\n");
    useFakeHw();
    EXPECT_EQ(out(icctl({"nodes", "--sensor", "DIMM"})), "No nodes of type DIMM.\n");
    json const sensors = json::parse(out(bare({"sensors", "--json"}))).at("sensors");
    ASSERT_EQ(sensors.size(), 74u);
    EXPECT_EQ(sensors[73], json({{"type", 73}, {"name", "LAN End Point"}}));
    EXPECT_EQ(icctl({"nodes"}).err, "");
    Result const loud = icctl({"-v", "nodes", "--json"});
    EXPECT_NE(loud.err.find("Helmgard.IC.Health"), std::string::npos) << loud.err;
    // Standard output stays one clean document.
    EXPECT_EQ(json::parse(loud.out).at("count"), 6);
}

TEST_F(Icctl, TreeNodesAndShowDescribeEveryNode)
{
    useFakeHw();
    // Siblings by sensor type: CPU (4), Network Port (12), Fan (20).
    EXPECT_EQ(out(icctl({"tree"})), "ROOT 0: Fake server  [" + kRoot + "]\n"
                                   "  Chassis 0: Fake chassis  [" + kChassis + "]\n"
                                   "    CPU 0: Fake CPU 0  [" + kCpu + "]\n"
                                   "      Temperature Sensor 0: CPU temperature = 45 C (ok)  [" + kTemp + "]\n"
                                   "    Network Port 0: eth0 (up)  [1f2101f201f5c0]\n"
                                   "    Fan 1: System fan 1 = 1200 RPM (ok)  [" + kFan + "]\n");
    json const doc = json::parse(out(icctl({"tree", "--json"})));
    EXPECT_EQ(doc.at("count"), 6);
    EXPECT_TRUE(doc.at("nodes").at(0).at("parent").is_null());
    json const& chassis = doc.at("nodes")[0].at("children").at(0);
    ASSERT_EQ(chassis.at("children").size(), 3u);
    json const& temp = chassis.at("children")[0].at("children").at(0);
    EXPECT_TRUE(temp.at("path") == kTemp && temp.at("children") == json::array()) << temp;

    // nodes: every node, or one sensor type.
    std::vector<std::string> const l = lines(out(icctl({"nodes"})));
    ASSERT_EQ(l.size(), 7u);
    EXPECT_EQ(l[0], "PATH                TYPE                INSTANCE  DESCRIPTION      READING   STATE");
    EXPECT_EQ(l[4], kTemp + "  Temperature Sensor  0         CPU temperature  45 C      ok");
    // Names in any spelling, or the number.
    for (char const* spelling : {"Temperature Sensor", "temperature-sensor", "TEMPERATURE_SENSOR", "22"}) {
        json const doc = json::parse(out(icctl({"nodes", "--sensor", spelling, "--json"})));
        ASSERT_EQ(doc.at("count"), 1) << spelling;
        EXPECT_EQ(doc.at("nodes")[0].at("path"), kTemp);
    }
    // show: properties, hierarchy, children and alerts.
    json shown = json::parse(out(icctl({"show", "1F2B01F501F201F5C0", "--json"})));
    EXPECT_EQ(shown.at("properties")[1], json({{"name", "upper_critical"}, {"value", "95"}, {"unit", "C"}}));
    for (char const* key : {"nodeId", "nodeNumber", "properties"})
        shown.erase(key);
    json expected = kTempNode;
    expected.update({{"path", kTemp}, {"parent", kCpu}, {"reading", {{"value", "45"}, {"unit", "C"}}}, {"state", "ok"},
                     {"hierarchy", kHierarchy}, {"children", json::array()}, {"alerts", json::array()}});
    EXPECT_EQ(shown, expected);
    EXPECT_EQ(out(icctl({"show", kChassis})),
              "path         " + kChassis + "\ntype         Chassis (1)\ninstance     0\n"
              "description  Fake chassis\nnode id      0x00010002\nnode number  65538\n"
              "parent       " + kRoot + "\nhierarchy    ROOT:00000000->Chassis:00000000\n"
              "children     " + kCpu + " CPU 0\n             1f2101f201f5c0 Network Port 0\n"
              "             " + kFan + " Fan 1\nalert        -\nproperties\n  vendor = Acme\n");
}

TEST_F(Icctl, AlertsListsWhatIsAsserted)
{
    useFakeHw();
    setenv("FAKEHW_PULSE_MS", "100", 1);
    setenv("FAKEHW_PULSE_HOLD", "1", 1);
    json const doc = json::parse(out(icctl({"alerts", "--wait", "1.5", "--json"})));
    ASSERT_EQ(doc.at("count"), 2) << doc.dump(2);
    std::map<std::string, json> byPath;
    for (json const& a : doc.at("alerts"))
        byPath[a.at("paths").at(0)] = a;
    byPath[kTemp].erase("time");
    EXPECT_EQ(byPath[kTemp], json({{"severity", 2}, {"severityName", "critical"}, {"class", 5},
                                   {"className", "threshold"}, {"status", 3}, {"statusName", "critical"},
                                   {"paths", {kTemp}}, {"message", "CPU temperature 97 C above 95 C"},
                                   {"nodes", {kTempNode}}}));
    std::vector<std::string> const l = lines(out(icctl({"alerts", "--wait", "1.5"})));
    ASSERT_EQ(l.size(), 3u);
    EXPECT_EQ(l[2].rfind(kTemp + "  Temperature Sensor 0  critical  threshold      critical  ", 0), 0u) << l[2];
}

// ------------------------------------------------------------------ watch

TEST_F(Icctl, WatchStreamsTheSelectedAlertsUntilASignal)
{
    // An interface that comes while watching is loaded, and its alerts shown.
    setenv("FAKEHW_PULSE_MS", "150", 1);
    Result const r = icctl({"watch", "--json", "--class", "threshold", "--reload-interval", "1"},
                           "(sleep 1; ln -s " + quoted(FAKEHW_PLUGIN) + " " + quoted(mi_ / "fakehw.so") +
                               ") & timeout --preserve-status -s INT 4");
    EXPECT_EQ(r.status, 0) << r.err;
    std::vector<json> const got = jsonLines(r.out);
    ASSERT_GE(got.size(), 2u) << r.out;
    unsigned int const first = got[0].at("status");
    EXPECT_TRUE(first == 1 || first == 3) << first;
    for (std::size_t i = 0; i < got.size(); ++i) // back and forth
        EXPECT_EQ(json({got[i].at("class"), got[i].at("paths"), got[i].at("status")}),
                  json({5, json::array({kTemp}), i % 2 ? 4 - first : first}));

    // The fans raise nothing; the chassis carries the roll-up.
    std::vector<json> const rollups =
        jsonLines(out(icctl({"watch", "--json", "--sensor", "Fan", "--path", kChassis, "--for", "1"})));
    ASSERT_FALSE(rollups.empty());
    for (json const& a : rollups)
        EXPECT_EQ(a.at("className").get<std::string>() + " " + a.at("paths")[0].get<std::string>(),
                  "health-rollup " + kChassis);

    Result const text = icctl({"watch"}, "timeout --preserve-status -s TERM 2");
    EXPECT_EQ(text.status, 0) << text.err;
    EXPECT_NE(text.out.find(" critical threshold critical [" + kTemp +
                            " Temperature Sensor 0: CPU temperature] CPU temperature 97 C above 95 C\n"),
              std::string::npos) << text.out;
    std::vector<json> const simple = jsonLines(out(icctl({"watch", "--simple", "--sensor", "22", "--json", "--for", "1"})));
    ASSERT_FALSE(simple.empty());
    for (json const& a : simple)
        EXPECT_EQ(a, json({{"simple", true}, {"event", 1}, {"eventName", "threshold"}, {"path", kTemp},
                           {"node", kTempNode}}));
}

// ------------------------------------------------------------------- path

TEST_F(Icctl, PathConvertsBetweenItsForms)
{
    json const doc = json::parse(out(bare({"path", "--json", kTemp})));
    EXPECT_EQ(doc.at("printable"), kTemp);
    EXPECT_EQ(doc.at("length"), 9);
    EXPECT_EQ(doc.at("binary"), "\\x1f\\x2b\\x01\\xf5\\x01\\xf2\\x01\\xf5\\xc0");
    EXPECT_EQ(doc.at("chain").at(0), json({{"type", 59}, {"typeName", "ROOT"}, {"instance", 0}}));
    EXPECT_EQ(doc.at("hierarchy"), kHierarchy);
    EXPECT_EQ(lines(out(bare({"path", kFan}))).at(3), "chain        ROOT 0 -> Chassis 0 -> Fan 1");
    // Chains are written root first, also as the library's hierarchy text.
    auto printable = [this](std::vector<std::string> const& args, std::string const& input = "") {
        return json::parse(out(bare(args, input))).at("printable");
    };
    EXPECT_EQ(printable({"path", "--json", "--encode", "ROOT:0 -> Chassis:0 -> fan:1"}), kFan);
    EXPECT_EQ(printable({"path", "--json", "--encode", kHierarchy}), kTemp);
    EXPECT_EQ(printable({"path", "--json", "--from-binary"}, "\x1f\x20\x1f\x5c"), kChassis);
    EXPECT_EQ(out(bare({"path", "--binary", kRoot})), std::string("\x1f\x5c"));
}

// ------------------------------------------------------ bad input, opening

TEST_F(Icctl, BadInputAndAFailedOpenAreRefusedWithAMessage)
{
    useFakeHw();
    std::string const nope = (dir_ / "nope").string();
    std::string const file = (mi_ / "fakehw.so").string();
    // dirs: with --mi-dir and --fp-dir
    struct Case { bool dirs; std::vector<std::string> args; int status; std::string err; } const cases[] = {
        {true, {"nodes", "--sensor", "Warp Core"}, 2, "icctl: unknown sensor type 'Warp Core' (give a "
         "name such as \"Temperature Sensor\" or a number; 'icctl sensors' lists them)\n"},
        {true, {"nodes", "--sensor", "74"}, 2, "icctl: sensor type 74 is out of range (0..73)\n"},
        {true, {"show", "zz"}, 2, "(give the hexadecimal form that 'icctl nodes' shows)\n"},
        {true, {"show", "2f5c"}, 1, "icctl: no node at path 2f5c\n"},
        {true, {"watch", "--class", "bogus"}, 2, "icctl: unknown alert class 'bogus' ("},
        {true, {"watch", "--simple", "--class", "5"}, 2, "icctl: --simple selects by --sensor only\n"},
        {true, {"watch", "--for", "0"}, 2, "'0' is not a positive number of seconds"},
        {true, {"--sysfs-root", nope, "tree"}, 2,
         "icctl: sysfs root '" + nope + "' is not a directory (from --sysfs-root)\n"},
        {false, {"path", "zz"}, 2, "icctl: invalid node path 'zz': "},
        {false, {"path", "ff"}, 2, "icctl: 'ff' is not a node path\n"},
        {false, {"path"}, 2, "icctl: give one of: a printable path, --encode CHAIN, --from-binary\n"},
        {false, {"path", "--encode", "ROOT:x"}, 2, "icctl: bad instance 'x' in 'ROOT:x'\n"},
        {false, {}, 2, "subcommand is required"},
        {false, {"frobnicate"}, 2,
         "icctl: unknown command 'frobnicate' (tree, nodes, show, alerts, watch, path, sensors)\n"},
        {false, {"--mi-dir", nope, "--fp-dir", fp_.string(), "tree"}, 2,
         "icctl: management-interface directory '" + nope + "' does not exist (from --mi-dir)\n"},
        {false, {"--mi-dir", mi_.string(), "--fp-dir", file, "nodes"}, 2,
         "icctl: functional plug-in directory '" + file + "' is not a directory (from --fp-dir)\n"},
    };
    for (Case const& c : cases) {
        Result const r = c.dirs ? icctl(c.args) : bare(c.args);
        EXPECT_EQ(r.status, c.status) << c.err;
        EXPECT_NE(r.err.find(c.err), std::string::npos) << r.err;
        EXPECT_EQ(r.out, "") << c.err;
    }
    // The environment is checked as well.
    setenv("IC_MI_DIR", nope.c_str(), 1);
    setenv("IC_FP_DIR", fp_.c_str(), 1);
    EXPECT_EQ(bare({"tree"}).err,
              "icctl: management-interface directory '" + nope + "' does not exist (from IC_MI_DIR)\n");

    // A library that cannot open gives its load code.
    fs::remove(mi_ / "fakehw.so");
    fs::create_symlink(FAKEHW_BROKEN_PLUGIN, mi_ / "broken.so");
    Result const broken = icctl({"tree"});
    EXPECT_EQ(broken.status, 3);
    EXPECT_NE(broken.err.find("\nicctl: cannot open the library: load code 15 (management interfaces failed to "
                              "load); -v shows the loader's log\n"), std::string::npos) << broken.err;
    // With an interface where a functional plug-in belongs, none loads.
    fs::rename(mi_ / "broken.so", fp_ / "health.so");
    Result const noFp = icctl({"alerts"});
    EXPECT_EQ(noFp.status, 3);
    EXPECT_NE(noFp.err.find("load code 31 (functional plug-ins failed to load)"), std::string::npos) << noFp.err;
}

} // namespace

#ifdef LINUXHW_PLUGIN
// Names written by firmware, drivers and whoever renames an interface reach
// every output escaped: one node stays one line, the terminal is never
// driven, and JSON gives the original text back.
TEST_F(Icctl, HostileNamesAreEscapedInEveryOutput)
{
    fs::copy(IC_SOURCE_DIR "/examples/sysfs/large", dir_ / "root",
             fs::copy_options::recursive | fs::copy_options::copy_symlinks);
    fs::create_symlink(LINUXHW_PLUGIN, mi_ / "linuxhw.so");
    fs::path const cls = dir_ / "root/sys/class";
    // file is written with the hostile name raw, or renamed to it when rename; a line of the tree starts
    // with line and holds shown; json is the description JSON gives back ("" when not UTF-8).
    struct Case { fs::path file; std::string raw; bool rename; std::string line, shown, json; } const cases[] = {
        {dir_ / "root/proc/sys/kernel/hostname", "rack\x1b[2Jforged", false, "ROOT 0: ",
         "Linux host rack\\x1b[2Jforged  [1f5c]", "Linux host rack\x1b[2Jforged"},
        {cls / "dmi/id/product_name", "R720\x1b]0;title\x07", false, "  Chassis 0: ",
         "System Acme Computers R720\\x1b]0;title\\x07  [1f201f5c]", "System Acme Computers R720\x1b]0;title\x07"},
        {cls / "hwmon/hwmon0/temp1_label", "Package\x7fid\xc2\x9b" "0", false, "      Temperature Sensor 1: ",
         "CPU 0 Package\\x7fid\\u009b0 temperature = 52.0 C (ok)", "CPU 0 Package\x7fid\xc2\x9b" "0 temperature"},
        {cls / "hwmon/hwmon2/name", "nct\xff\xfe" "6779", false, "    Fan ", ": nct\\xff\\xfe6779 fan1 speed = 5400 RPM",
         ""},
        {cls / "power_supply/PSU1", "PSU1\nROOT 0: forged line", true, "    Power Supply ",
         ": Power supply PSU1\\x0aROOT 0: forged line (Mains) = 184.0 W (ok)",
         "Power supply PSU1\nROOT 0: forged line (Mains)"},
        {cls / "net/eno1", "eno\x1b[31m1", true, "    Network Port ", ": Network port eno\\x1b[31m1 (b4:96",
         "Network port eno\x1b[31m1 (b4:96:91:4a:10:01)"},
    };
    for (Case const& c : cases) {
        if (c.rename)
            fs::rename(c.file, c.file.parent_path() / c.raw);
        else
            std::ofstream(c.file, std::ios::binary) << c.raw << "\n";
    }
    std::string const root = (dir_ / "root").string();
    std::string const tree = out(icctl({"--sysfs-root", root, "tree"}));
    std::string const nodes = out(icctl({"--sysfs-root", root, "nodes"}));
    std::string const show = out(icctl({"--sysfs-root", root, "show", "2f2b01f501f201f5c0"}));
    std::string const text = out(icctl({"--sysfs-root", root, "--json", "nodes"}));
    for (std::string const* output : {&tree, &nodes, &show, &text})
        for (std::size_t i = 0; i < output->size(); ++i) {
            auto const b = static_cast<unsigned char>((*output)[i]);
            ASSERT_TRUE((b >= 0x20 && b != 0x7f) || b == '\n') << "raw control at " << i << ": " << *output;
            ASSERT_FALSE(b == 0xc2 && static_cast<unsigned char>((*output)[i + 1]) < 0xa0) << *output;
        }
    EXPECT_EQ(lines(tree).size(), 76u) << tree; // as many lines as nodes: none forged
    // What is wrong at the start is listed at once, without waiting.
    json const alerts = json::parse(out(icctl({"--sysfs-root", root, "--json", "alerts"}))).at("alerts");
    ASSERT_EQ(alerts.size(), 2u) << alerts.dump(2);
    for (std::size_t i = 0; i < 2; ++i)
        EXPECT_EQ(alerts[i].at("className").get<std::string>() + "/" + alerts[i].at("statusName").get<std::string>(),
                  i == 0 ? "health-rollup/warning" : "memory-errors/warning");
    EXPECT_EQ(lines(nodes).size(), 77u);
    EXPECT_NE(show.find("\ndescription  CPU 0 Package\\x7fid\\u009b0 temperature\n"), std::string::npos) << show;
    json const doc = json::parse(text);
    for (Case const& c : cases) {
        SCOPED_TRACE(c.shown);
        auto const all = lines(tree);
        EXPECT_TRUE(std::any_of(all.begin(), all.end(), [&](std::string const& l) {
            return l.rfind(c.line, 0) == 0 && l.find(c.shown) != std::string::npos;
        })) << tree;
        std::string const wanted = c.json.empty() ? "nct\xef\xbf\xbd\xef\xbf\xbd" "6779 fan1 speed" : c.json;
        EXPECT_TRUE(std::any_of(doc.at("nodes").begin(), doc.at("nodes").end(),
                                [&](json const& n) { return n.at("description") == wanted; }));
    }
}
#endif
