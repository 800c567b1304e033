// icctl run as a process, against temporary plug-in directories holding the
// fake management interface (fakehw) and the health plug-in; with the Linux
// hardware interface and the example sysfs trees when it is built. Output in
// JSON is parsed back; exit statuses are checked for every kind of bad input.
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

extern char** environ;

namespace fs = std::filesystem;
using nlohmann::json;

namespace {

using Env = std::map<std::string, std::optional<std::string>>;

struct Result {
    int status = -1; // exit status; 128 + signal when killed; -1 when it had to be killed
    std::string out;
    std::string err;
};

// One icctl process with its standard streams on pipes.
class Child {
public:
    Child(std::vector<std::string> const& args, Env const& env, std::string const& input = "")
    {
        int in[2];
        int out[2];
        int err[2];
        if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0)
            throw std::runtime_error("pipe");
        posix_spawn_file_actions_t fa;
        posix_spawn_file_actions_init(&fa);
        posix_spawn_file_actions_adddup2(&fa, in[0], 0);
        posix_spawn_file_actions_adddup2(&fa, out[1], 1);
        posix_spawn_file_actions_adddup2(&fa, err[1], 2);

        std::vector<std::string> argStrings{ICCTL_BINARY};
        argStrings.insert(argStrings.end(), args.begin(), args.end());
        std::vector<char*> argv;
        for (std::string& a : argStrings)
            argv.push_back(a.data());
        argv.push_back(nullptr);

        std::vector<std::string> envStrings;
        for (char** e = environ; *e; ++e) {
            std::string const entry = *e;
            std::string const name = entry.substr(0, entry.find('='));
            if (env.count(name) == 0)
                envStrings.push_back(entry);
        }
        for (auto const& kv : env)
            if (kv.second)
                envStrings.push_back(kv.first + "=" + *kv.second);
        std::vector<char*> envp;
        for (std::string& e : envStrings)
            envp.push_back(e.data());
        envp.push_back(nullptr);

        int const rc = posix_spawn(&pid_, ICCTL_BINARY, &fa, nullptr, argv.data(), envp.data());
        posix_spawn_file_actions_destroy(&fa);
        close(in[0]);
        close(out[1]);
        close(err[1]);
        if (rc != 0) {
            close(in[1]);
            close(out[0]);
            close(err[0]);
            throw std::runtime_error("posix_spawn: " + std::string(std::strerror(rc)));
        }
        if (!input.empty())
            (void)!write(in[1], input.data(), input.size());
        close(in[1]);
        outFd_ = out[0];
        errFd_ = err[0];
    }

    ~Child()
    {
        if (pid_ > 0 && !reaped_) {
            kill(pid_, SIGKILL);
            waitpid(pid_, nullptr, 0);
        }
        if (outFd_ >= 0)
            close(outFd_);
        if (errFd_ >= 0)
            close(errFd_);
    }

    // Reads until standard output holds needle; false after seconds.
    bool waitFor(std::string const& needle, double seconds)
    {
        auto const end = deadline(seconds);
        while (result_.out.find(needle) == std::string::npos) {
            if (!pump(end))
                return result_.out.find(needle) != std::string::npos;
        }
        return true;
    }

    // Reads for the given time.
    void drain(double seconds)
    {
        auto const end = deadline(seconds);
        while (pump(end)) {
        }
    }

    void signal(int sig) { kill(pid_, sig); }

    // Reads to the end of both streams and reaps the process; kills it when
    // it has not ended within seconds.
    Result finish(double seconds)
    {
        auto const end = deadline(seconds);
        while (outFd_ >= 0 || errFd_ >= 0) {
            if (!pump(end))
                break;
        }
        int status = 0;
        if (outFd_ >= 0 || errFd_ >= 0) {
            kill(pid_, SIGKILL);
            waitpid(pid_, &status, 0);
            reaped_ = true;
            result_.status = -1;
            return result_;
        }
        waitpid(pid_, &status, 0);
        reaped_ = true;
        result_.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
        return result_;
    }

    std::string const& out() const { return result_.out; }

private:
    using Clock = std::chrono::steady_clock;

    static Clock::time_point deadline(double seconds)
    {
        return Clock::now() + std::chrono::milliseconds(static_cast<long>(seconds * 1000));
    }

    // One poll and read; false at the deadline or when both streams ended.
    bool pump(Clock::time_point end)
    {
        if (outFd_ < 0 && errFd_ < 0)
            return false;
        auto const left =
            std::chrono::duration_cast<std::chrono::milliseconds>(end - Clock::now()).count();
        if (left <= 0)
            return false;
        pollfd fds[2];
        nfds_t n = 0;
        if (outFd_ >= 0)
            fds[n++] = pollfd{outFd_, POLLIN, 0};
        if (errFd_ >= 0)
            fds[n++] = pollfd{errFd_, POLLIN, 0};
        if (poll(fds, n, static_cast<int>(left)) <= 0)
            return true;
        for (nfds_t i = 0; i < n; ++i) {
            if (!(fds[i].revents & (POLLIN | POLLHUP | POLLERR)))
                continue;
            char buf[4096];
            ssize_t const got = read(fds[i].fd, buf, sizeof buf);
            bool const isOut = fds[i].fd == outFd_;
            if (got > 0) {
                (isOut ? result_.out : result_.err).append(buf, static_cast<std::size_t>(got));
            } else {
                close(fds[i].fd);
                (isOut ? outFd_ : errFd_) = -1;
            }
        }
        return true;
    }

    pid_t pid_ = -1;
    bool reaped_ = false;
    int outFd_ = -1;
    int errFd_ = -1;
    Result result_;
};

std::vector<std::string> lines(std::string const& text)
{
    std::vector<std::string> out;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);)
        if (!line.empty())
            out.push_back(line);
    return out;
}

// Every line of a JSON-lines output, parsed.
std::vector<json> jsonLines(std::string const& text)
{
    std::vector<json> out;
    for (std::string const& line : lines(text))
        out.push_back(json::parse(line));
    return out;
}

// The node of a tree document at printable path, depth first.
json const* findIn(json const& nodes, std::string const& path)
{
    for (json const& n : nodes) {
        if (n.at("path") == path)
            return &n;
        if (json const* hit = findIn(n.at("children"), path))
            return hit;
    }
    return nullptr;
}

// fakehw's nodes, as the library codes their paths.
std::string const kRoot = "1f5c";
std::string const kChassis = "1f201f5c";
std::string const kCpu = "1f501f201f5c";
std::string const kTemp = "1f2b01f501f201f5c0";
std::string const kFan = "2f2901f201f5c0";

class Icctl : public ::testing::Test {
protected:
    void SetUp() override
    {
        char templ[] = "/tmp/ic-icctl-XXXXXX";
        ASSERT_NE(mkdtemp(templ), nullptr);
        dir_ = templ;
        mi_ = dir_ / "mi";
        fp_ = dir_ / "fp";
        fs::create_directories(mi_);
        fs::create_directories(fp_);
        fs::create_symlink(HEALTH_PLUGIN, fp_ / "health.so");
    }

    void TearDown() override
    {
        std::error_code ec;
        fs::remove_all(dir_, ec);
    }

    void useFakeHw() { fs::create_symlink(FAKEHW_PLUGIN, mi_ / "fakehw.so"); }

    // The environment icctl sees: nothing from ours that would steer it.
    Env env(Env extra = {}) const
    {
        Env e{{"IC_MI_DIR", std::nullopt},       {"IC_FP_DIR", std::nullopt},
              {"IC_SYSFS_ROOT", std::nullopt},   {"HGLOG_CONFIG", std::nullopt},
              {"FAKEHW_PULSE_MS", std::nullopt}, {"FAKEHW_PULSE_HOLD", std::nullopt}};
        for (auto const& kv : extra)
            e[kv.first] = kv.second;
        return e;
    }

    std::vector<std::string> withDirs(std::vector<std::string> args) const
    {
        std::vector<std::string> all{"--mi-dir", mi_.string(), "--fp-dir", fp_.string()};
        all.insert(all.end(), args.begin(), args.end());
        return all;
    }

    Result icctl(std::vector<std::string> const& args, Env const& extra = {},
                 std::string const& input = "")
    {
        Child c(withDirs(args), env(extra), input);
        return c.finish(120);
    }

    // Without the directory options.
    Result bare(std::vector<std::string> const& args, Env const& extra = {},
                std::string const& input = "")
    {
        Child c(args, env(extra), input);
        return c.finish(120);
    }

    fs::path dir_;
    fs::path mi_;
    fs::path fp_;
};

// Clear message, the expected status, nothing on standard output.
#define EXPECT_REFUSED(run, code, text)                                    \
    do {                                                                   \
        Result const refused_ = (run);                                     \
        EXPECT_EQ(refused_.status, (code)) << refused_.err;                \
        EXPECT_NE(refused_.err.find(text), std::string::npos) << refused_.err; \
        EXPECT_EQ(refused_.err.find("terminate"), std::string::npos) << refused_.err; \
        EXPECT_TRUE(refused_.out.empty()) << refused_.out;                 \
    } while (0)

// ------------------------------------------------------------------- tree

TEST_F(Icctl, TreeJsonNestsEveryNodeUnderItsParent)
{
    useFakeHw();
    Result const r = icctl({"tree", "--json"});
    ASSERT_EQ(r.status, 0) << r.err;
    json const doc = json::parse(r.out);
    EXPECT_EQ(doc.at("count"), 6);
    ASSERT_EQ(doc.at("nodes").size(), 1u);
    json const& root = doc.at("nodes")[0];
    EXPECT_EQ(root.at("path"), kRoot);
    EXPECT_EQ(root.at("typeName"), "ROOT");
    EXPECT_TRUE(root.at("parent").is_null());
    ASSERT_EQ(root.at("children").size(), 1u);
    json const& chassis = root.at("children")[0];
    EXPECT_EQ(chassis.at("path"), kChassis);
    EXPECT_EQ(chassis.at("parent"), kRoot);
    EXPECT_EQ(chassis.at("children").size(), 3u);

    json const* temp = findIn(doc.at("nodes"), kTemp);
    ASSERT_NE(temp, nullptr);
    EXPECT_EQ(temp->at("type"), 22);
    EXPECT_EQ(temp->at("typeName"), "Temperature Sensor");
    EXPECT_EQ(temp->at("description"), "CPU temperature");
    EXPECT_EQ(temp->at("parent"), kCpu);
    EXPECT_EQ(temp->at("reading").at("value"), "45");
    EXPECT_EQ(temp->at("reading").at("unit"), "C");
    EXPECT_EQ(temp->at("state"), "ok");
    json const* cpu = findIn(doc.at("nodes"), kCpu);
    ASSERT_NE(cpu, nullptr);
    ASSERT_EQ(cpu->at("children").size(), 1u);
    EXPECT_EQ(cpu->at("children")[0].at("path"), kTemp);
}

TEST_F(Icctl, TreeTextIndentsByDepthWithReadingsAndPaths)
{
    useFakeHw();
    Result const r = icctl({"tree"});
    ASSERT_EQ(r.status, 0) << r.err;
    std::vector<std::string> const l = lines(r.out);
    ASSERT_EQ(l.size(), 6u) << r.out;
    EXPECT_EQ(l[0], "ROOT 0: Fake server  [" + kRoot + "]");
    EXPECT_EQ(l[1], "  Chassis 0: Fake chassis  [" + kChassis + "]");
    EXPECT_EQ(l[2], "    CPU 0: Fake CPU 0  [" + kCpu + "]");
    EXPECT_EQ(l[3], "      Temperature Sensor 0: CPU temperature = 45 C (ok)  [" + kTemp + "]");
    // Siblings by sensor type: CPU (4), Network Port (12), Fan (20).
    EXPECT_EQ(l[4], "    Network Port 0: eth0 (up)  [1f2101f201f5c0]");
    EXPECT_EQ(l[5], "    Fan 1: System fan 1 = 1200 RPM (ok)  [" + kFan + "]");
}

TEST_F(Icctl, TreeWithoutInterfacesSaysSo)
{
    Result const r = icctl({"tree"});
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_NE(r.out.find("No nodes"), std::string::npos);
    Result const j = icctl({"--json", "tree"});
    ASSERT_EQ(j.status, 0) << j.err;
    EXPECT_EQ(json::parse(j.out).at("count"), 0);
}

// ------------------------------------------------------------------ nodes

TEST_F(Icctl, NodesTableListsEveryNode)
{
    useFakeHw();
    Result const r = icctl({"nodes"});
    ASSERT_EQ(r.status, 0) << r.err;
    std::vector<std::string> const l = lines(r.out);
    ASSERT_EQ(l.size(), 7u) << r.out;
    EXPECT_EQ(l[0].rfind("PATH", 0), 0u);
    EXPECT_NE(l[0].find("DESCRIPTION"), std::string::npos);
    EXPECT_NE(r.out.find(kTemp + "  Temperature Sensor  0"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("1200 RPM"), std::string::npos);
}

TEST_F(Icctl, NodesBySensorAcceptsNamesInAnySpellingAndNumbers)
{
    useFakeHw();
    for (char const* spelling :
         {"Temperature Sensor", "temperature-sensor", "TEMPERATURE_SENSOR", "22"}) {
        Result const r = icctl({"nodes", "--sensor", spelling, "--json"});
        ASSERT_EQ(r.status, 0) << spelling << ": " << r.err;
        json const doc = json::parse(r.out);
        ASSERT_EQ(doc.at("count"), 1) << spelling;
        EXPECT_EQ(doc.at("nodes")[0].at("path"), kTemp);
    }
    Result const fan = icctl({"nodes", "--sensor", "fan"});
    ASSERT_EQ(fan.status, 0) << fan.err;
    EXPECT_EQ(lines(fan.out).size(), 2u) << fan.out;
    EXPECT_NE(fan.out.find(kFan), std::string::npos);
    Result const none = icctl({"nodes", "--sensor", "DIMM", "--json"});
    ASSERT_EQ(none.status, 0) << none.err;
    EXPECT_EQ(json::parse(none.out).at("count"), 0);
}

TEST_F(Icctl, UnknownSensorTypeIsRefused)
{
    useFakeHw();
    EXPECT_REFUSED(icctl({"nodes", "--sensor", "Warp Core"}), 2, "unknown sensor type 'Warp Core'");
    EXPECT_REFUSED(icctl({"nodes", "--sensor", "74"}), 2, "out of range");
    EXPECT_REFUSED(icctl({"watch", "--sensor", "bogus", "--for", "1"}), 2,
                   "unknown sensor type 'bogus'");
}

// ------------------------------------------------------------------- show

TEST_F(Icctl, ShowGivesPropertiesHierarchyAndChildren)
{
    useFakeHw();
    Result const r = icctl({"show", "1F2B01F501F201F5C0", "--json"});
    ASSERT_EQ(r.status, 0) << r.err;
    json const doc = json::parse(r.out);
    EXPECT_EQ(doc.at("path"), kTemp);
    EXPECT_EQ(doc.at("parent"), kCpu);
    EXPECT_EQ(doc.at("hierarchy"),
              "ROOT:00000000->Chassis:00000000->CPU:00000000->Temperature Sensor:00000000");
    bool critical = false;
    for (json const& p : doc.at("properties"))
        critical = critical || (p.at("name") == "upper_critical" && p.at("value") == "95" &&
                                p.at("unit") == "C");
    EXPECT_TRUE(critical) << doc.dump();
    EXPECT_TRUE(doc.at("alerts").empty());

    Result const text = icctl({"show", kChassis});
    ASSERT_EQ(text.status, 0) << text.err;
    EXPECT_NE(text.out.find("hierarchy    ROOT:00000000->Chassis:00000000"), std::string::npos)
        << text.out;
    EXPECT_NE(text.out.find(kCpu + " CPU 0"), std::string::npos);
    EXPECT_NE(text.out.find("vendor = Acme"), std::string::npos);
}

TEST_F(Icctl, ShowRefusesBadPathsAndReportsMissingNodes)
{
    useFakeHw();
    EXPECT_REFUSED(icctl({"show", "zz"}), 2, "invalid node path 'zz'");
    EXPECT_REFUSED(icctl({"show", "1f00"}), 2, "invalid node path");
    EXPECT_REFUSED(icctl({"show", "2f5c"}), 1, "no node at path 2f5c");
    EXPECT_REFUSED(icctl({"show"}), 2, "path is required");
}

// ----------------------------------------------------------------- alerts

TEST_F(Icctl, AlertsListsWhatIsAsserted)
{
    useFakeHw();
    Result const none = icctl({"alerts", "--json"});
    ASSERT_EQ(none.status, 0) << none.err;
    EXPECT_EQ(json::parse(none.out).at("count"), 0);

    Env const hot{{"FAKEHW_PULSE_MS", "100"}, {"FAKEHW_PULSE_HOLD", "1"}};
    Result const r = icctl({"alerts", "--wait", "1.5", "--json"}, hot);
    ASSERT_EQ(r.status, 0) << r.err;
    json const doc = json::parse(r.out);
    ASSERT_EQ(doc.at("count"), 2) << doc.dump(2);
    std::map<std::string, json> byPath;
    for (json const& a : doc.at("alerts"))
        byPath[a.at("paths")[0]] = a;
    ASSERT_EQ(byPath.count(kTemp), 1u);
    EXPECT_EQ(byPath[kTemp].at("class"), 5);
    EXPECT_EQ(byPath[kTemp].at("className"), "threshold");
    EXPECT_EQ(byPath[kTemp].at("status"), 3);
    EXPECT_EQ(byPath[kTemp].at("severityName"), "critical");
    EXPECT_EQ(byPath[kTemp].at("nodes")[0].at("typeName"), "Temperature Sensor");
    ASSERT_EQ(byPath.count(kChassis), 1u);
    EXPECT_EQ(byPath[kChassis].at("className"), "health-rollup");
    EXPECT_EQ(byPath[kChassis].at("status"), 3);

    Result const text = icctl({"alerts", "--wait", "1.5"}, hot);
    ASSERT_EQ(text.status, 0) << text.err;
    std::vector<std::string> const l = lines(text.out);
    ASSERT_EQ(l.size(), 3u) << text.out;
    EXPECT_NE(l[0].find("SEVERITY"), std::string::npos);
    EXPECT_NE(text.out.find("CPU temperature 97 C above 95 C"), std::string::npos);
}

// ------------------------------------------------------------------ watch

TEST_F(Icctl, WatchStreamsJsonLinesOfTheSelectedClass)
{
    useFakeHw();
    Result const r = icctl({"watch", "--json", "--class", "threshold", "--for", "1.5"},
                           {{"FAKEHW_PULSE_MS", "150"}});
    ASSERT_EQ(r.status, 0) << r.err;
    std::vector<json> const got = jsonLines(r.out);
    ASSERT_GE(got.size(), 2u) << r.out;
    unsigned int expected = 3; // the pulse starts critical, then alternates
    for (json const& a : got) {
        EXPECT_EQ(a.at("class"), 5);
        EXPECT_EQ(a.at("paths"), json::array({kTemp}));
        EXPECT_EQ(a.at("status"), expected);
        expected = expected == 3 ? 1 : 3;
    }
}

TEST_F(Icctl, WatchSelectsBySensorAndByPath)
{
    useFakeHw();
    Env const pulse{{"FAKEHW_PULSE_MS", "150"}};
    Result const fan = icctl({"watch", "--json", "--sensor", "Fan", "--for", "1"}, pulse);
    ASSERT_EQ(fan.status, 0) << fan.err;
    EXPECT_TRUE(fan.out.empty()) << fan.out;

    Result const temp =
        icctl({"watch", "--json", "--sensor", "temperature sensor", "--for", "1"}, pulse);
    ASSERT_EQ(temp.status, 0) << temp.err;
    std::vector<json> const t = jsonLines(temp.out);
    ASSERT_FALSE(t.empty());
    for (json const& a : t)
        EXPECT_EQ(a.at("paths"), json::array({kTemp}));

    Result const chassis = icctl({"watch", "--json", "--path", kChassis, "--for", "1"}, pulse);
    ASSERT_EQ(chassis.status, 0) << chassis.err;
    std::vector<json> const c = jsonLines(chassis.out);
    ASSERT_FALSE(c.empty());
    for (json const& a : c) {
        EXPECT_EQ(a.at("className"), "health-rollup");
        EXPECT_EQ(a.at("paths"), json::array({kChassis}));
    }
}

TEST_F(Icctl, WatchSimpleAlertsCarryEventCodes)
{
    useFakeHw();
    Result const r = icctl({"watch", "--simple", "--sensor", "22", "--json", "--for", "1"},
                           {{"FAKEHW_PULSE_MS", "150"}});
    ASSERT_EQ(r.status, 0) << r.err;
    std::vector<json> const got = jsonLines(r.out);
    ASSERT_FALSE(got.empty());
    for (json const& a : got) {
        EXPECT_EQ(a.at("simple"), true);
        EXPECT_EQ(a.at("event"), 1);
        EXPECT_EQ(a.at("eventName"), "threshold");
        EXPECT_EQ(a.at("path"), kTemp);
    }
}

TEST_F(Icctl, WatchTextLinesNameTheNode)
{
    useFakeHw();
    Result const r = icctl({"watch", "--for", "1"}, {{"FAKEHW_PULSE_MS", "150"}});
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_NE(r.out.find("critical threshold critical [" + kTemp +
                         " Temperature Sensor 0: CPU temperature] CPU temperature 97 C above 95 C"),
              std::string::npos)
        << r.out;
    EXPECT_NE(r.out.find("health-rollup"), std::string::npos);
}

TEST_F(Icctl, WatchEndsOnSigintAndSigterm)
{
    useFakeHw();
    for (int sig : {SIGINT, SIGTERM}) {
        Child c(withDirs({"watch", "--json"}), env({{"FAKEHW_PULSE_MS", "100"}}));
        ASSERT_TRUE(c.waitFor("\n", 60)) << "no alert arrived";
        c.signal(sig);
        Result const r = c.finish(30);
        EXPECT_EQ(r.status, 0) << "signal " << sig << ": " << r.err;
        for (json const& a : jsonLines(r.out))
            EXPECT_TRUE(a.contains("class"));
    }
}

TEST_F(Icctl, WatchLoadsAnInterfaceAddedWhileRunning)
{
    Child c(withDirs({"watch", "--json", "--class", "threshold", "--reload-interval", "1"}),
            env({{"FAKEHW_PULSE_MS", "100"}}));
    c.drain(1.0);
    EXPECT_TRUE(c.out().empty()) << "no interface is loaded yet";
    fs::create_symlink(FAKEHW_PLUGIN, mi_ / "fakehw.so");
    EXPECT_TRUE(c.waitFor("\n", 30)) << "the reload did not bring the interface's alerts";
    c.signal(SIGINT);
    Result const r = c.finish(30);
    EXPECT_EQ(r.status, 0) << r.err;
    std::vector<json> const got = jsonLines(r.out);
    ASSERT_FALSE(got.empty());
    EXPECT_EQ(got[0].at("paths"), json::array({kTemp}));
}

TEST_F(Icctl, WatchRefusesBadSelections)
{
    useFakeHw();
    EXPECT_REFUSED(icctl({"watch", "--class", "bogus", "--for", "1"}), 2,
                   "unknown alert class 'bogus'");
    EXPECT_REFUSED(icctl({"watch", "--path", "zz", "--for", "1"}), 2, "invalid node path 'zz'");
    EXPECT_REFUSED(icctl({"watch", "--simple", "--class", "5", "--for", "1"}), 2,
                   "--simple selects by --sensor only");
    EXPECT_REFUSED(icctl({"watch", "--for", "0"}), 2, "not a positive number of seconds");
}

// ------------------------------------------------------------------- path

TEST_F(Icctl, PathDecodesTheChain)
{
    Result const r = bare({"path", "--json", kTemp});
    ASSERT_EQ(r.status, 0) << r.err;
    json const doc = json::parse(r.out);
    EXPECT_EQ(doc.at("printable"), kTemp);
    EXPECT_EQ(doc.at("length"), 9);
    EXPECT_EQ(doc.at("bytes")[0], 0x1f);
    ASSERT_EQ(doc.at("chain").size(), 4u);
    EXPECT_EQ(doc.at("chain")[0].at("type"), 59);
    EXPECT_EQ(doc.at("chain")[1].at("typeName"), "Chassis");
    EXPECT_EQ(doc.at("chain")[3].at("typeName"), "Temperature Sensor");
    EXPECT_EQ(doc.at("chain")[3].at("instance"), 0);
    EXPECT_EQ(doc.at("hierarchy"),
              "ROOT:00000000->Chassis:00000000->CPU:00000000->Temperature Sensor:00000000");

    Result const fan = bare({"path", kFan});
    ASSERT_EQ(fan.status, 0) << fan.err;
    EXPECT_NE(fan.out.find("chain        ROOT 0 -> Chassis 0 -> Fan 1"), std::string::npos)
        << fan.out;
}

TEST_F(Icctl, PathEncodesAChainAndConvertsBinary)
{
    Result const enc = bare({"path", "--json", "--encode", "ROOT:0 -> Chassis:0 -> fan:1"});
    ASSERT_EQ(enc.status, 0) << enc.err;
    EXPECT_EQ(json::parse(enc.out).at("printable"), kFan);
    // The library's hierarchy text is accepted as it is written.
    Result const hier = bare({"path", "--json", "--encode", "ROOT:00000000->Chassis:00000000"});
    ASSERT_EQ(hier.status, 0) << hier.err;
    EXPECT_EQ(json::parse(hier.out).at("printable"), kChassis);

    Result const bin = bare({"path", "--binary", kRoot});
    ASSERT_EQ(bin.status, 0) << bin.err;
    EXPECT_EQ(bin.out, std::string("\x1f\x5c"));
    Result const back = bare({"path", "--json", "--from-binary"}, {}, "\x1f\x20\x1f\x5c");
    ASSERT_EQ(back.status, 0) << back.err;
    EXPECT_EQ(json::parse(back.out).at("printable"), kChassis);
}

TEST_F(Icctl, PathRefusesWhatIsNotAPath)
{
    EXPECT_REFUSED(bare({"path", "zz"}), 2, "invalid node path 'zz'");
    EXPECT_REFUSED(bare({"path", "ff"}), 2, "is not a node path");
    EXPECT_REFUSED(bare({"path"}), 2, "give one of");
    EXPECT_REFUSED(bare({"path", "--encode", "ROOT:x"}), 2, "bad instance 'x'");
    EXPECT_REFUSED(bare({"path", "--encode", "Bogus:1"}), 2, "unknown sensor type 'Bogus'");
}

// ------------------------------------------------- directories and opening

TEST_F(Icctl, MissingDirectoriesAreRefused)
{
    useFakeHw();
    Result const mi = bare({"--mi-dir", (dir_ / "nope").string(), "--fp-dir", fp_.string(), "tree"});
    EXPECT_REFUSED(mi, 2, "management-interface directory");
    EXPECT_NE(mi.err.find("does not exist"), std::string::npos);
    Result const fp = bare({"--mi-dir", mi_.string(), "--fp-dir", (mi_ / "fakehw.so").string(),
                            "nodes"});
    EXPECT_REFUSED(fp, 2, "is not a directory");
    EXPECT_REFUSED(icctl({"--sysfs-root", (dir_ / "nope").string(), "tree"}), 2, "sysfs root");
    // The environment is checked as well.
    EXPECT_REFUSED(bare({"tree"}, {{"IC_MI_DIR", (dir_ / "nope").string()},
                                   {"IC_FP_DIR", fp_.string()}}),
                   2, "from IC_MI_DIR");
}

TEST_F(Icctl, FailedOpenGivesTheLoadCode)
{
    fs::create_symlink(FAKEHW_BROKEN_PLUGIN, mi_ / "fakehw_broken.so");
    EXPECT_REFUSED(icctl({"tree"}), 3,
                   "cannot open the library: load code 15 (management interfaces failed to load)");

    fs::remove(mi_ / "fakehw_broken.so");
    useFakeHw();
    // An interface where a functional plug-in belongs has no OpenFP; the
    // open fails when no functional plug-in loads at all.
    fs::remove(fp_ / "health.so");
    fs::create_symlink(FAKEHW_PLUGIN, fp_ / "notfp.so");
    EXPECT_REFUSED(icctl({"alerts"}), 3, "load code 31 (functional plug-ins failed to load)");
}

TEST_F(Icctl, UsageErrorsAndHelp)
{
    EXPECT_REFUSED(bare({}), 2, "subcommand is required");
    EXPECT_REFUSED(bare({"tree", "--bogus"}), 2, "--bogus");
    EXPECT_REFUSED(bare({"frobnicate"}), 2, "unknown command 'frobnicate'");
    Result const help = bare({"--help"});
    EXPECT_EQ(help.status, 0);
    EXPECT_NE(help.out.find("watch"), std::string::npos);
}

TEST_F(Icctl, VerboseShowsTheLibraryProgressOnStandardError)
{
    useFakeHw();
    Result const quiet = icctl({"nodes"});
    ASSERT_EQ(quiet.status, 0);
    EXPECT_EQ(quiet.err.find("findLibs"), std::string::npos) << quiet.err;
    Result const loud = icctl({"-v", "nodes", "--json"});
    ASSERT_EQ(loud.status, 0) << loud.err;
    EXPECT_NE(loud.err.find("findLibs"), std::string::npos) << loud.err;
    EXPECT_NE(loud.err.find("Helmgard.IC.Health"), std::string::npos) << loud.err;
    // Standard output stays one clean document.
    EXPECT_EQ(json::parse(loud.out).at("count"), 6);
}

TEST_F(Icctl, SensorsListsTheTypeNames)
{
    Result const r = bare({"sensors", "--json"});
    ASSERT_EQ(r.status, 0) << r.err;
    json const doc = json::parse(r.out);
    ASSERT_EQ(doc.at("sensors").size(), 74u);
    EXPECT_EQ(doc.at("sensors")[22].at("name"), "Temperature Sensor");
    EXPECT_EQ(doc.at("sensors")[59].at("name"), "ROOT");
    EXPECT_EQ(doc.at("sensors")[73].at("name"), "LAN End Point");
}

// ------------------------------------------- the Linux hardware interface

#ifdef LINUXHW_PLUGIN

class IcctlLinuxHw : public Icctl {
protected:
    void SetUp() override
    {
        Icctl::SetUp();
        fs::create_symlink(LINUXHW_PLUGIN, mi_ / "linuxhw.so");
    }

    std::string examples(char const* name) const
    {
        return (fs::path(IC_SOURCE_DIR) / "examples" / "sysfs" / name).string();
    }

    // A copy of an example tree that a test may change.
    fs::path copyOf(char const* name)
    {
        fs::path const root = dir_ / name;
        fs::copy(examples(name), root, fs::copy_options::recursive | fs::copy_options::copy_symlinks);
        return root;
    }

    static void write(fs::path const& file, std::string const& value)
    {
        fs::path const next = file.string() + ".new";
        std::ofstream(next) << value << '\n';
        fs::rename(next, file);
    }

    // Path of the node whose description holds text, from a tree document.
    static std::string pathWith(json const& nodes, std::string const& text)
    {
        for (json const& n : nodes) {
            if (n.at("description").get<std::string>().find(text) != std::string::npos)
                return n.at("path");
            std::string const below = pathWith(n.at("children"), text);
            if (!below.empty())
                return below;
        }
        return std::string();
    }
};

// Every child names its parent, and the count covers every node once.
std::size_t checkLinks(json const& nodes, json const& parent)
{
    std::size_t count = 0;
    for (json const& n : nodes) {
        EXPECT_EQ(n.at("parent"), parent.is_null() ? json(nullptr) : parent.at("path"));
        count += 1 + checkLinks(n.at("children"), n);
    }
    return count;
}

TEST_F(IcctlLinuxHw, ExampleTreesShowWholeAndConsistent)
{
    for (char const* name : {"small", "large"}) {
        Result const tree = icctl({"--sysfs-root", examples(name), "tree", "--json"});
        ASSERT_EQ(tree.status, 0) << name << ": " << tree.err;
        json const doc = json::parse(tree.out);
        ASSERT_EQ(doc.at("nodes").size(), 1u) << name;
        json const& root = doc.at("nodes")[0];
        EXPECT_EQ(root.at("typeName"), "ROOT");
        EXPECT_EQ(root.at("description").get<std::string>().rfind("Linux host ", 0), 0u);
        EXPECT_EQ(checkLinks(doc.at("nodes"), json(nullptr)), doc.at("count").get<std::size_t>());

        Result const temps = icctl({"--sysfs-root", examples(name), "nodes", "--json", "--sensor",
                                    "Temperature Sensor"});
        ASSERT_EQ(temps.status, 0) << temps.err;
        json const t = json::parse(temps.out);
        ASSERT_GT(t.at("count").get<int>(), 0) << name;
        for (json const& n : t.at("nodes")) {
            EXPECT_EQ(n.at("typeName"), "Temperature Sensor");
            EXPECT_EQ(n.at("reading").at("unit"), "C") << n.dump();
            EXPECT_NO_THROW((void)std::stod(n.at("reading").at("value").get<std::string>()));
        }
    }
}

TEST_F(IcctlLinuxHw, AnOverheatingSensorIsAssertedAtStart)
{
    fs::path const root = copyOf("small");
    write(root / "sys/class/hwmon/hwmon0/temp1_input", "101000");
    Result const tree = icctl({"--sysfs-root", root.string(), "tree", "--json"});
    ASSERT_EQ(tree.status, 0) << tree.err;
    std::string const sensor = pathWith(json::parse(tree.out).at("nodes"), "Package id 0");
    ASSERT_FALSE(sensor.empty());

    Result const r = icctl({"--sysfs-root", root.string(), "alerts", "--wait", "2", "--json"},
                           {{"IC_LINUXHW_POLL_MS", "100"}});
    ASSERT_EQ(r.status, 0) << r.err;
    json const doc = json::parse(r.out);
    bool threshold = false;
    bool rollup = false;
    for (json const& a : doc.at("alerts")) {
        threshold = threshold || (a.at("className") == "threshold" && a.at("status") == 3 &&
                                  a.at("paths") == json::array({sensor}));
        rollup = rollup || (a.at("className") == "health-rollup" && a.at("status") == 3);
    }
    EXPECT_TRUE(threshold) << doc.dump(2);
    EXPECT_TRUE(rollup) << doc.dump(2);
}

TEST_F(IcctlLinuxHw, WatchShowsAThresholdCrossedAndCleared)
{
    fs::path const root = copyOf("small");
    fs::path const input = root / "sys/class/hwmon/hwmon0/temp1_input";
    Child c(withDirs({"--sysfs-root", root.string(), "watch", "--json", "--class", "threshold",
                      "--reload-interval", "0"}),
            env({{"IC_LINUXHW_POLL_MS", "50"}}));
    c.drain(1.0);
    write(input, "101000");
    ASSERT_TRUE(c.waitFor("\"status\":3", 30)) << c.out();
    write(input, "45000");
    ASSERT_TRUE(c.waitFor("\"status\":1", 30)) << c.out();
    c.signal(SIGINT);
    Result const r = c.finish(30);
    EXPECT_EQ(r.status, 0) << r.err;
    std::vector<json> const got = jsonLines(r.out);
    ASSERT_EQ(got.size(), 2u) << r.out;
    EXPECT_EQ(got[0].at("status"), 3);
    EXPECT_NE(got[0].at("message").get<std::string>().find("101.0 C"), std::string::npos);
    EXPECT_EQ(got[1].at("status"), 1);
    EXPECT_EQ(got[0].at("paths"), got[1].at("paths"));
    EXPECT_EQ(got[0].at("nodes")[0].at("typeName"), "Temperature Sensor");
}

#endif // LINUXHW_PLUGIN

} // namespace
