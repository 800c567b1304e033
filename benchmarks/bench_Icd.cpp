// icd as a whole process on the large example server: /metrics per scrape
// (server time and round trip) and with 4 clients at once, against reading
// the same sysfs files; the event stream with 100 subscribers and 10,000
// alerts, with and without a subscriber that never reads; the daemon's
// memory after fast polling.
#include <benchmark/benchmark.h>

#include <httplib.h>

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

extern char** environ;
namespace fs = std::filesystem;

namespace {

// An icd process, its port read from its first line; SIGTERM at the end.
class Daemon {
public:
    Daemon(std::vector<std::string> args, std::vector<std::string> env)
    {
        args.insert(args.begin(), ICD_PATH);
        std::vector<char*> argv, envp;
        for (std::string& a : args)
            argv.push_back(a.data());
        argv.push_back(nullptr);
        for (char** e = environ; *e; ++e)
            env.emplace_back(*e);
        for (std::string& e : env)
            envp.push_back(e.data());
        envp.push_back(nullptr);
        int out[2];
        if (pipe(out) != 0)
            return;
        posix_spawn_file_actions_t fa;
        posix_spawn_file_actions_init(&fa);
        posix_spawn_file_actions_adddup2(&fa, out[1], 1);
        posix_spawn_file_actions_addopen(&fa, 2, "/dev/null", O_WRONLY, 0);
        posix_spawn(&pid_, ICD_PATH, &fa, nullptr, argv.data(), envp.data());
        posix_spawn_file_actions_destroy(&fa);
        close(out[1]);
        std::string text;
        char buf[512];
        pollfd p{out[0], POLLIN, 0};
        while (port_ == 0 && poll(&p, 1, 20000) > 0) {
            ssize_t const n = read(out[0], buf, sizeof buf);
            if (n <= 0)
                break;
            text.append(buf, static_cast<std::size_t>(n));
            auto const at = text.find("127.0.0.1:");
            if (at != std::string::npos && text.find('\n', at) != std::string::npos)
                port_ = std::atoi(text.c_str() + at + 10);
        }
        close(out[0]);
    }
    ~Daemon()
    {
        if (pid_ > 0) {
            kill(pid_, SIGTERM);
            waitpid(pid_, nullptr, 0);
        }
    }
    int port() const { return port_; }
    double rssMb() const
    {
        std::ifstream in("/proc/" + std::to_string(pid_) + "/status");
        for (std::string line; std::getline(in, line);)
            if (line.rfind("VmRSS:", 0) == 0)
                return std::atof(line.c_str() + 6) / 1024.0;
        return 0;
    }

private:
    pid_t pid_ = -1;
    int port_ = 0;
};

std::vector<std::string> largeServer(std::vector<std::string> more = {})
{
    std::vector<std::string> a{"--mi-dir", LINUXHW_DIR, "--fp-dir", HEALTH_DIR, "--sysfs-root",
                               EXAMPLES_DIR "/large", "--listen", "127.0.0.1:0"};
    a.insert(a.end(), more.begin(), more.end());
    return a;
}

// A loopback connection that has asked for the event stream; a small
// receive buffer makes a reader that never reads stall its sender sooner.
int openEventStream(int port, int receiveBuffer = 0)
{
    int const fd = socket(AF_INET, SOCK_STREAM, 0);
    if (receiveBuffer > 0)
        setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &receiveBuffer, sizeof receiveBuffer);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(static_cast<std::uint16_t>(port));
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    std::string const get = "GET /api/v1/events HTTP/1.1\r\nHost: x\r\n\r\n";
    benchmark::DoNotOptimize(write(fd, get.data(), get.size()));
    return fd;
}

double scrapeSeconds(std::string const& body)
{
    auto const at = body.find("\nic_scrape_duration_seconds ");
    return at == std::string::npos ? 0 : std::atof(body.c_str() + at + 28);
}

// One client, one scrape after another on a kept-alive connection.
void BM_MetricsScrape(benchmark::State& state)
{
    Daemon icd(largeServer(), {});
    httplib::Client client("127.0.0.1", icd.port());
    client.set_keep_alive(true);
    double server = 0;
    for (auto _ : state) {
        auto res = client.Get("/metrics");
        if (!res || res->status != 200) {
            state.SkipWithError("scrape failed");
            break;
        }
        server += scrapeSeconds(res->body);
    }
    state.counters["server_ms"] = benchmark::Counter(server * 1e3 / static_cast<double>(state.iterations()));
}
BENCHMARK(BM_MetricsScrape)->Unit(benchmark::kMicrosecond)->UseRealTime();

// Four clients at once for two seconds: scrapes per second.
void BM_MetricsFourClients(benchmark::State& state)
{
    Daemon icd(largeServer(), {});
    for (auto _ : state) {
        std::atomic<long> scrapes{0};
        auto const end = std::chrono::steady_clock::now() + std::chrono::seconds(2);
        std::vector<std::thread> clients;
        for (int c = 0; c < 4; ++c)
            clients.emplace_back([&] {
                httplib::Client client("127.0.0.1", icd.port());
                client.set_keep_alive(true);
                while (std::chrono::steady_clock::now() < end)
                    if (auto res = client.Get("/metrics"); res && res->status == 200)
                        ++scrapes;
            });
        for (auto& t : clients)
            t.join();
        state.counters["scrapes_per_s"] = static_cast<double>(scrapes) / 2.0;
    }
}
BENCHMARK(BM_MetricsFourClients)->Iterations(1)->Unit(benchmark::kMillisecond)->UseRealTime();

// The floor: open, read and close every file of the example server's tree.
void BM_SysfsFloor(benchmark::State& state)
{
    std::vector<std::string> files;
    for (auto const& e : fs::recursive_directory_iterator(EXAMPLES_DIR "/large"))
        if (e.is_regular_file())
            files.push_back(e.path().string());
    char buf[4096];
    for (auto _ : state)
        for (std::string const& f : files) {
            int const fd = open(f.c_str(), O_RDONLY);
            benchmark::DoNotOptimize(read(fd, buf, sizeof buf));
            close(fd);
        }
    state.counters["files"] = static_cast<double>(files.size());
}
BENCHMARK(BM_SysfsFloor)->Unit(benchmark::kMicrosecond);

long long monotonicNs()
{
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long long>(ts.tv_sec) * 1000000000LL + ts.tv_nsec;
}

// 100 subscribers, 10,000 alerts 100 us apart; arg 1 adds one subscriber
// that connects and never reads.
void BM_EventStream(benchmark::State& state)
{
    constexpr int kSubscribers = 100;
    constexpr long kAlerts = 10000;
    fs::path const dir = fs::temp_directory_path() / ("bench-icd-" + std::to_string(getpid()));
    fs::create_directories(dir / "mi");
    fs::create_directories(dir / "fp");
    fs::create_symlink(BENCH_ALERT_MI, dir / "mi/bench_alert_mi.so");
    fs::create_symlink(HEALTH_DIR "/health.so", dir / "fp/health.so");
    std::string const trigger = (dir / "go").string();
    for (auto _ : state) {
        Daemon icd({"--mi-dir", (dir / "mi").string(), "--fp-dir", (dir / "fp").string(), "--listen",
                    "127.0.0.1:0", "--max-connections", "128", "--max-subscribers", "128",
                    "--reload-interval", "0"},
                   {"BENCH_ALERT_TRIGGER=" + trigger});
        int stuck = -1;
        if (state.range(0) == 1) {
            stuck = openEventStream(icd.port(), 4096);
        }
        // One reader for all subscribers, so that the client side adds no
        // scheduling of its own to what is measured.
        struct Subscriber {
            int fd;
            std::string pending;
            long expected = 0;
            bool connected = false, failed = false;
            std::vector<double> latencies;
        };
        std::vector<Subscriber> subs(kSubscribers);
        int const ep = epoll_create1(0);
        for (Subscriber& sub : subs) {
            sub.fd = openEventStream(icd.port());
            epoll_event ev{};
            ev.events = EPOLLIN;
            ev.data.ptr = &sub;
            epoll_ctl(ep, EPOLL_CTL_ADD, sub.fd, &ev);
        }
        int connected = 0, open = kSubscribers;
        bool triggered = false;
        std::vector<epoll_event> ready(kSubscribers);
        char buf[65536];
        auto const limit = std::chrono::steady_clock::now() + std::chrono::seconds(60);
        while (open > 0 && std::chrono::steady_clock::now() < limit) {
            if (!triggered && connected == kSubscribers) {
                std::ofstream(trigger) << kAlerts << " 100\n";
                triggered = true;
            }
            int const n = epoll_wait(ep, ready.data(), kSubscribers, 1000);
            for (int i = 0; i < n; ++i) {
                auto& sub = *static_cast<Subscriber*>(ready[static_cast<std::size_t>(i)].data.ptr);
                ssize_t const got = read(sub.fd, buf, sizeof buf);
                if (got <= 0) {
                    sub.failed = true;
                } else {
                    long long const now = monotonicNs();
                    sub.pending.append(buf, static_cast<std::size_t>(got));
                    if (!sub.connected && sub.pending.find(": connected") != std::string::npos) {
                        sub.connected = true;
                        ++connected;
                    }
                    std::size_t begin = 0;
                    for (std::size_t end; (end = sub.pending.find("\n\n", begin)) != std::string::npos;
                         begin = end + 2) {
                        auto const at = sub.pending.find("\"message\":\"seq ", begin);
                        if (at == std::string::npos || at > end)
                            continue;
                        char* next = nullptr;
                        long const seq = std::strtol(sub.pending.c_str() + at + 15, &next, 10);
                        long long const sent = std::strtoll(next, nullptr, 10);
                        if (seq != sub.expected) {
                            sub.failed = true; // out of order or lost: not complete
                            break;
                        }
                        ++sub.expected;
                        sub.latencies.push_back(static_cast<double>(now - sent) / 1e6);
                    }
                    sub.pending.erase(0, begin);
                }
                if (sub.failed || sub.expected == kAlerts) {
                    epoll_ctl(ep, EPOLL_CTL_DEL, sub.fd, nullptr);
                    --open;
                }
            }
        }
        close(ep);
        int complete = 0;
        std::vector<std::vector<double>> latencies;
        for (Subscriber& sub : subs) {
            close(sub.fd);
            complete += sub.expected == kAlerts ? 1 : 0;
            latencies.push_back(std::move(sub.latencies));
        }
        if (stuck >= 0)
            close(stuck);
        std::vector<double> all;
        for (auto const& l : latencies)
            all.insert(all.end(), l.begin(), l.end());
        std::sort(all.begin(), all.end());
        auto pct = [&all](double p) {
            return all.empty() ? 0.0 : all[static_cast<std::size_t>(p * static_cast<double>(all.size() - 1))];
        };
        state.counters["complete_subscribers"] = complete;
        state.counters["p50_ms"] = pct(0.50);
        state.counters["p99_ms"] = pct(0.99);
        state.counters["max_ms"] = pct(1.0);
    }
    fs::remove_all(dir);
}
BENCHMARK(BM_EventStream)->Arg(0)->Arg(1)->Iterations(1)->Unit(benchmark::kMillisecond)->UseRealTime();

// Memory after an hour of polling at the default 5 s (720 polls), done at
// 10 ms, with a scrape every 100 ms.
void BM_ResidentAfterPolling(benchmark::State& state)
{
    for (auto _ : state) {
        Daemon icd(largeServer(), {"IC_LINUXHW_POLL_MS=10"});
        httplib::Client client("127.0.0.1", icd.port());
        double const start = icd.rssMb();
        for (int i = 0; i < 80; ++i) {
            client.Get("/metrics");
            std::this_thread::sleep_for(std::chrono::milliseconds(100));
        }
        state.counters["rss_start_mb"] = start;
        state.counters["rss_mb"] = icd.rssMb();
    }
}
BENCHMARK(BM_ResidentAfterPolling)->Iterations(1)->Unit(benchmark::kMillisecond)->UseRealTime();

} // namespace

BENCHMARK_MAIN();
