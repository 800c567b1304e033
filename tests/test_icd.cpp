// icd run as a process on a copy of the large example server, with the
// shipped linuxhw and health plug-ins: requests and their answers, the API
// against icctl's JSON, the event stream, and what it refuses.
#include "TestSupport.h"

#include <httplib.h>
#include <nlohmann/json.hpp>

#include <crypt.h>
#include <fcntl.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

extern char** environ;

namespace fs = std::filesystem;
using nlohmann::json;

namespace {

std::string const kTemp = "2f2b01f501f201f5c0"; // CPU 0 package temperature, hwmon0 temp1

// One icd process, its output in a file; stopped with SIGTERM when it goes.
class Icd {
public:
    Icd(std::vector<std::string> args, std::string const& log) : log_(log)
    {
        args.insert(args.begin(), ICD_BINARY);
        std::vector<char*> argv;
        for (std::string& a : args)
            argv.push_back(a.data());
        argv.push_back(nullptr);
        posix_spawn_file_actions_t fa;
        posix_spawn_file_actions_init(&fa);
        posix_spawn_file_actions_addopen(&fa, 1, log.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        posix_spawn_file_actions_adddup2(&fa, 1, 2);
        EXPECT_EQ(posix_spawn(&pid_, ICD_BINARY, &fa, nullptr, argv.data(), environ), 0);
        posix_spawn_file_actions_destroy(&fa);
        // Until the URL line, or until it ends by itself.
        ictest::eventually([this] {
            std::string const text = output();
            auto const at = text.find("listening on http://127.0.0.1:");
            if (at != std::string::npos && text.find('\n', at) != std::string::npos)
                port_ = std::atoi(text.c_str() + at + 30);
            return port_ != 0 || waitpid(pid_, &status_, WNOHANG) != 0;
        }, 20000);
    }
    ~Icd() { stop(); }

    // The exit status after SIGTERM (or of the process that already ended).
    int stop()
    {
        if (pid_ > 0 && waitpid(pid_, &status_, WNOHANG) == 0) {
            kill(pid_, SIGTERM);
            waitpid(pid_, &status_, 0);
        }
        pid_ = -1;
        return WIFEXITED(status_) ? WEXITSTATUS(status_) : 128 + WTERMSIG(status_);
    }
    int port() const { return port_; }
    void signal(int sig) const { kill(pid_, sig); }
    std::string output() const { return ictest::slurp(log_); }
    httplib::Client client() const
    {
        httplib::Client c("127.0.0.1", port_);
        c.set_read_timeout(10);
        return c;
    }

private:
    std::string log_;
    pid_t pid_ = -1;
    int port_ = 0;
    int status_ = 0;
};

// The events of an event-stream text, as (id, data).
std::vector<std::pair<std::uint64_t, json>> parseEvents(std::string const& text)
{
    std::vector<std::pair<std::uint64_t, json>> out;
    std::uint64_t id = 0;
    for (std::string const& line : ictest::lines(text)) {
        if (line.rfind("id: ", 0) == 0)
            id = std::stoull(line.substr(4));
        else if (line.rfind("data: ", 0) == 0)
            out.emplace_back(id, json::parse(line.substr(6)));
    }
    return out;
}

class IcdTest : public ::testing::Test {
protected:
    static void SetUpTestSuite()
    {
        dir_ = new ictest::TempDir("ic-icd");
        fs::create_directories(dir_->path("mi"));
        fs::create_directories(dir_->path("fp"));
        fs::create_symlink(LINUXHW_PLUGIN, dir_->path("mi/linuxhw.so"));
        fs::create_symlink(HEALTH_PLUGIN, dir_->path("fp/health.so"));
        fs::copy(IC_SOURCE_DIR "/examples/sysfs/large", dir_->path("root"),
                 fs::copy_options::recursive | fs::copy_options::copy_symlinks);
        std::ofstream(dir_->path("root/proc/sys/kernel/hostname")) << "rack\"7\x1b\n"; // hostile
        setenv("IC_LINUXHW_POLL_MS", "20", 1);
        unsetenv("HGLOG_CONFIG");
        icd_ = new Icd(args({"--listen", "127.0.0.1:0", "--keep-alive", "0.2", "--max-subscribers", "4"}),
                       dir_->path("icd.log"));
        ASSERT_NE(icd_->port(), 0) << icd_->output();
    }
    static void TearDownTestSuite()
    {
        EXPECT_EQ(icd_->stop(), 0) << icd_->output();
        delete icd_;
        delete dir_;
    }
    static std::vector<std::string> args(std::vector<std::string> more)
    {
        std::vector<std::string> a{"--mi-dir", dir_->path("mi"), "--fp-dir", dir_->path("fp"),
                                   "--sysfs-root", dir_->path("root")};
        a.insert(a.end(), more.begin(), more.end());
        return a;
    }
    static std::string icctl(std::string const& command)
    {
        return ictest::run(std::string(ICCTL_BINARY) + " --json --mi-dir " + dir_->path("mi") + " --fp-dir " +
                   dir_->path("fp") + " --sysfs-root " + dir_->path("root") + " " + command);
    }
    static void setTemperature(int milli)
    {
        std::ofstream(dir_->path("root/sys/class/hwmon/hwmon0/temp1_input")) << milli << "\n";
    }

    static ictest::TempDir* dir_;
    static Icd* icd_;
};
ictest::TempDir* IcdTest::dir_ = nullptr;
Icd* IcdTest::icd_ = nullptr;

TEST_F(IcdTest, RequestsGetTheirAnswers)
{
    httplib::Headers many;
    for (int i = 0; i < 70; ++i)
        many.emplace("X-Filler-" + std::to_string(i), "1");
    // type: a prefix of the content type; contains: texts in the body
    struct Case { std::string method, target; httplib::Headers headers; int status; std::string type;
                  std::vector<std::string> contains; } const cases[] = {
        {"GET", "/metrics", {}, 200, "text/plain; version=0.0.4",
         {"# TYPE ic_sensor_value gauge\n",
          "ic_sensor_value{path=\"" + kTemp + "\",type=\"22\",type_name=\"Temperature Sensor\",node_instance=\"1\","
          "description=\"CPU 0 Package id 0 temperature\",unit=\"celsius\"} ",
          "ic_sensor_threshold{path=\"" + kTemp + "\",", "kind=\"upper_critical\"} 100\n",
          "ic_node_state{path=\"" + kTemp + "\",", "ic_node_info{path=\"1f201f5c\",",
          "description=\"Network port eno2 (b4:96:91:4a:10:02)\"} 0\n", // no link: unused, no fault
          "ic_node_info{path=\"1f5c\",type=\"59\",type_name=\"ROOT\",node_instance=\"0\","
          "description=\"Linux host rack\\\"7\\\\x1b\",parent=\"\"} 1\n", "vendor=\"Acme Computers\"",
          "ic_plugins_loaded{kind=\"mi\"} 1\n", "ic_plugins_loaded{kind=\"fp\"} 1\n",
          "ic_plugin_load_failures_total 0\n", "ic_alerts_asserted{severity=\"critical\"} ",
          "ic_health_status ", "ic_alerts_received_total{class=\"threshold\"} ", "ic_build_info{version=\"",
          "# TYPE ic_scrape_duration_seconds gauge\n"}},
        {"HEAD", "/metrics", {}, 200, "text/plain", {}},
        {"GET", "/", {}, 200, "text/html", {"id=\"tree\"", "id=\"alerts\"", "id=\"status\"", "EventSource"}},
        {"GET", "/api/v1/nodes/1f201f5d", {}, 404, "application/json", {"\"error\":\"no node at path 1f201f5d\""}},
        {"GET", "/api/v1/nodes/zz", {}, 400, "application/json", {"malformed node path"}},
        {"GET", "/api/v1/nodes/1f2", {}, 400, "application/json", {"malformed node path"}},
        {"GET", "/api/v1/nodes/00", {}, 400, "application/json", {"malformed node path"}},
        {"GET", "/nothing/here", {}, 404, "application/json", {"\"status\":404"}},
        {"POST", "/metrics", {}, 405, "application/json", {"only GET and HEAD"}},
        {"DELETE", "/api/v1/alerts", {}, 405, "application/json", {"only GET and HEAD"}},
        {"GET", "/" + std::string(9000, 'a'), {}, 414, "application/json", {"\"error\""}},
        {"GET", "/metrics", many, 431, "application/json", {"too many request headers"}},
        {"GET", "/api/v1/events", {{"Last-Event-ID", "x1"}}, 400, "application/json", {"Last-Event-ID"}},
    };
    for (Case const& c : cases) {
        SCOPED_TRACE(c.method + " " + c.target.substr(0, 40));
        httplib::Request req;
        req.method = c.method;
        req.path = c.target;
        req.headers = c.headers;
        auto res = icd_->client().send(req);
        ASSERT_TRUE(res) << httplib::to_string(res.error());
        EXPECT_EQ(res->status, c.status) << res->body;
        EXPECT_EQ(res->get_header_value("Content-Type").rfind(c.type, 0), 0u)
            << res->get_header_value("Content-Type");
        for (std::string const& s : c.contains)
            EXPECT_NE(res->body.find(s), std::string::npos) << s << "\n" << res->body.substr(0, 2000);
        EXPECT_TRUE(c.method != "HEAD" || res->body.empty());
    }
    // The process that served all of that is still there.
    EXPECT_TRUE(icd_->client().Get("/api/v1/alerts"));
}

TEST_F(IcdTest, ApiShapesAreIcctlsShapes)
{
    std::pair<std::string, std::string> const cases[] = {{"/api/v1/nodes", "tree"},
                                                         {"/api/v1/nodes/" + kTemp, "show " + kTemp},
                                                         {"/api/v1/nodes/1F201F5C", "show 1f201f5c"},
                                                         {"/api/v1/alerts", "alerts"}};
    for (auto const& c : cases) {
        auto res = icd_->client().Get(c.first);
        ASSERT_TRUE(res && res->status == 200) << c.first;
        // An alert's time is when each process saw it asserted.
        auto untimed = [](json j) {
            if (j.contains("alerts"))
                for (json& a : j["alerts"])
                    a.erase("time");
            return j;
        };
        EXPECT_EQ(untimed(json::parse(res->body)), untimed(json::parse(icctl(c.second)))) << c.first;
    }
}

TEST_F(IcdTest, EventStreamDeliversInOrderReplaysAndSurvivesAStuckClient)
{
    // A subscriber that never reads.
    int const stuck = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(static_cast<std::uint16_t>(icd_->port()));
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(connect(stuck, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    std::string const get = "GET /api/v1/events HTTP/1.1\r\nHost: x\r\n\r\n";
    ASSERT_EQ(write(stuck, get.data(), get.size()), static_cast<ssize_t>(get.size()));

    std::string text;
    std::mutex m;
    std::atomic<std::size_t> count{0};
    std::atomic<bool> ready{false}, quit{false};
    ictest::JoinedThread reader([&] {
        icd_->client().Get("/api/v1/events", [&](char const* data, std::size_t n) {
            std::lock_guard<std::mutex> g(m);
            text.append(data, n);
            ready = true; // the first comment says the stream is open
            count = parseEvents(text).size();
            return count < 8 && !quit;
        });
    });
    ASSERT_TRUE(ictest::eventually([&] { return ready.load(); }));
    // Hot, cool, hot, cool: each a threshold alert and a roll-up, back to the
    // warning of the DIMM that has counted errors since the start.
    std::size_t want = 0;
    for (int t : {120000, 50000, 121000, 51000}) {
        setTemperature(t);
        want += 2;
        EXPECT_TRUE(ictest::eventually([&] { return count >= want; }, 10000));
    }
    quit = true;
    reader.join();
    auto const events = parseEvents(text);
    ASSERT_EQ(events.size(), 8u) << text;
    std::vector<std::string> seen;
    for (std::size_t i = 0; i < events.size(); ++i) {
        EXPECT_TRUE(i == 0 || events[i].first == events[i - 1].first + 1) << i;
        seen.push_back(events[i].second.at("className").get<std::string>() + "/" +
                       events[i].second.at("statusName").get<std::string>());
    }
    EXPECT_EQ(seen, (std::vector<std::string>{"threshold/critical", "health-rollup/critical",
                                              "threshold/normal", "health-rollup/warning",
                                              "threshold/critical", "health-rollup/critical",
                                              "threshold/normal", "health-rollup/warning"}));
    EXPECT_EQ(events[0].second.at("paths"), json::array({kTemp}));

    // Reconnecting after the third event replays the other five.
    std::string replay;
    icd_->client().Get("/api/v1/events", {{"Last-Event-ID", std::to_string(events[2].first)}},
                       [&](char const* data, std::size_t n) {
                           replay.append(data, n);
                           return parseEvents(replay).size() < 5;
                       });
    auto const again = parseEvents(replay);
    ASSERT_EQ(again.size(), 5u);
    for (std::size_t i = 0; i < again.size(); ++i)
        EXPECT_EQ(again[i], events[i + 3]);
    close(stuck);
}

TEST_F(IcdTest, RefusesUnprotectedNetworksAndChecksPasswords)
{
    auto refuses = [](std::vector<std::string> const& more, std::string const& why) {
        Icd icd(args(more), dir_->path("refused.log"));
        EXPECT_EQ(icd.stop(), 2);
        EXPECT_NE(icd.output().find(why), std::string::npos) << icd.output();
    };
    refuses({"--listen", "0.0.0.0:0"}, "refusing to listen on 0.0.0.0:0 without --web-config");
    std::string const bad = dir_->write("bad.yml", "basic_auth_users:\n  prom: plaintext\n");
    refuses({"--listen", "127.0.0.1:0", "--web-config", bad},
            "bad.yml:2: the password of 'prom' is not a bcrypt or SHA-crypt hash");

    crypt_data data{};
    std::string const hash =
        crypt_r("s3cret", crypt_gensalt_rn("$2b$", 5, nullptr, 0, data.setting, sizeof data.setting), &data);
    std::string const config = dir_->write("web.yml", "basic_auth_users:\n  prom: " + hash + "\n");

    // Also run as systemd runs a notify-type service: told where to say so.
    int const notify = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    sockaddr_un where{};
    where.sun_family = AF_UNIX;
    std::string const notifyPath = dir_->path("notify");
    notifyPath.copy(where.sun_path, sizeof where.sun_path - 1);
    ASSERT_EQ(bind(notify, reinterpret_cast<sockaddr*>(&where), sizeof where), 0);
    setenv("NOTIFY_SOCKET", notifyPath.c_str(), 1);
    Icd guarded(args({"--listen", "127.0.0.1:0", "--web-config", config, "--reload-interval", "0"}),
                dir_->path("guarded.log"));
    unsetenv("NOTIFY_SOCKET");
    ASSERT_NE(guarded.port(), 0) << guarded.output();
    struct Case { std::string user, password; int status; } const cases[] = {
        {"", "", 401}, {"prom", "wrong", 401}, {"other", "s3cret", 401}, {"prom", "s3cret", 200}};
    for (Case const& c : cases) {
        httplib::Client client = guarded.client();
        if (!c.user.empty())
            client.set_basic_auth(c.user.c_str(), c.password.c_str());
        auto res = client.Get("/api/v1/alerts");
        ASSERT_TRUE(res);
        EXPECT_EQ(res->status, c.status) << c.user << ":" << c.password;
    }
    guarded.signal(SIGHUP);
    ictest::eventually([&] { return guarded.output().find("SIGHUP") != std::string::npos; }, 10000);
    EXPECT_EQ(guarded.stop(), 0) << guarded.output();
    std::string told;
    char notice[256];
    for (ssize_t n; (n = recv(notify, notice, sizeof notice, MSG_DONTWAIT)) > 0;)
        told += std::string(notice, static_cast<std::size_t>(n)) + " ";
    close(notify);
#ifdef ICD_SYSTEMD
    EXPECT_EQ(told, "READY=1 RELOADING=1 READY=1 STOPPING=1 ");
#else
    EXPECT_EQ(told, "") << "built without libsystemd, icd tells nobody";
#endif
}

} // namespace
