// One poll of the simulated BMC (examples/bmc) as the ipmi plug-in reads it
// (session set-up included, every sensor, warm SDR cache), against the floor
// (a minimal libipmimonitoring loop doing the same read) and against
// FreeIPMI's ipmi-sensors run as a process. Then the plug-in itself, loaded
// by the library, reading 1 and 8 out-of-band BMCs (8 simulators: one
// cannot serve parallel cold SDR downloads): Open waits for every BMC's
// first poll, so its time is that of one poll of them all; a start with a
// cached SDR must download none. Needs ipmi_sim (openipmi).
#include "BmcReader.h"

#include <IC/InstrumentationControl.h>

#include <benchmark/benchmark.h>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <atomic>
#include <chrono>
#include <map>
#include <queue>
#include <memory>
#include <string>
#include <thread>
#include <vector>

namespace {

std::string const kState = "/tmp/ic_bench_ipmi";
// Loopback only; simulator k: LAN kLan + 2k, console + 1. Each run takes its
// own range: the ports of a run just ended may still be in TIME_WAIT.
unsigned int const kLan = 20000 + static_cast<unsigned int>(::getpid() % 1000) * 20;
constexpr int kSimulators = 8;

// A network between the readers and the simulators: every datagram reaches
// the other side `delay` after it was sent, as on a LAN to a real BMC whose
// firmware takes its time. On loopback a simulator answers at once, so a
// poll is all CPU and there is no waiting for threads to overlap. Simulator
// k is reached through 127.0.0.1:port(k); each client address gets its own
// socket towards the simulator, so that answers find their way back.
class DelayLine {
public:
    DelayLine(std::chrono::microseconds delay, int simulators) : delay_(delay)
    {
        for (int k = 0; k < simulators; ++k) {
            int const fd = udpSocket(0);
            sockaddr_in a{};
            socklen_t len = sizeof a;
            ::getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len);
            fronts_.push_back(Front{fd, ntohs(a.sin_port), address(kLan + 2 * static_cast<unsigned int>(k))});
        }
        thread_ = std::thread([this] { run(); });
    }
    ~DelayLine()
    {
        stop_ = true;
        thread_.join();
        for (Front const& f : fronts_)
            ::close(f.fd);
        for (auto const& [fd, back] : backs_)
            ::close(fd);
    }
    unsigned int port(int k) const { return fronts_[static_cast<std::size_t>(k)].port; }

private:
    using Clock = std::chrono::steady_clock;
    struct Front {
        int fd;
        unsigned int port;
        sockaddr_in simulator;
    };
    struct Back {
        std::size_t front;
        sockaddr_in client;
        Clock::time_point used;
    };
    struct Datagram {
        Clock::time_point due;
        int fd;
        sockaddr_in to;
        std::string bytes;
        bool operator<(Datagram const& o) const { return due > o.due; }
    };

    static sockaddr_in address(unsigned int port)
    {
        sockaddr_in a{};
        a.sin_family = AF_INET;
        a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        a.sin_port = htons(static_cast<uint16_t>(port));
        return a;
    }
    static int udpSocket(unsigned int port)
    {
        int const fd = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        sockaddr_in const a = address(port);
        ::bind(fd, reinterpret_cast<sockaddr const*>(&a), sizeof a);
        return fd;
    }

    // The socket towards front's simulator for this client, made at first use.
    int backFor(std::size_t front, sockaddr_in const& client)
    {
        for (auto& [fd, back] : backs_)
            if (back.front == front && back.client.sin_port == client.sin_port) {
                back.used = Clock::now();
                return fd;
            }
        int const fd = udpSocket(0);
        backs_[fd] = Back{front, client, Clock::now()};
        return fd;
    }

    void run()
    {
        std::priority_queue<Datagram> queue;
        char buffer[2048];
        while (!stop_) {
            Clock::time_point const now = Clock::now();
            while (!queue.empty() && queue.top().due <= now) {
                Datagram const& d = queue.top();
                ::sendto(d.fd, d.bytes.data(), d.bytes.size(), 0, reinterpret_cast<sockaddr const*>(&d.to), sizeof d.to);
                queue.pop();
            }
            // A session's client socket is gone after its poll: forget it.
            for (auto it = backs_.begin(); it != backs_.end();)
                if (now - it->second.used > std::chrono::seconds(2)) {
                    ::close(it->first);
                    it = backs_.erase(it);
                } else {
                    ++it;
                }
            std::vector<pollfd> fds;
            for (Front const& f : fronts_)
                fds.push_back(pollfd{f.fd, POLLIN, 0});
            for (auto const& [fd, back] : backs_)
                fds.push_back(pollfd{fd, POLLIN, 0});
            auto const wait = queue.empty() ? std::chrono::nanoseconds(std::chrono::milliseconds(10))
                                            : std::max(Clock::duration::zero(), queue.top().due - Clock::now());
            timespec const ts{0, static_cast<long>(std::chrono::duration_cast<std::chrono::nanoseconds>(wait).count())};
            if (::ppoll(fds.data(), fds.size(), &ts, nullptr) <= 0)
                continue;
            for (pollfd const& p : fds) {
                if (!(p.revents & POLLIN))
                    continue;
                sockaddr_in from{};
                socklen_t len = sizeof from;
                ssize_t const n = ::recvfrom(p.fd, buffer, sizeof buffer, 0, reinterpret_cast<sockaddr*>(&from), &len);
                if (n <= 0)
                    continue;
                Clock::time_point const due = Clock::now() + delay_;
                std::string bytes(buffer, static_cast<std::size_t>(n));
                auto const back = backs_.find(p.fd);
                if (back != backs_.end()) { // an answer: back to the client
                    queue.push(Datagram{due, fronts_[back->second.front].fd, back->second.client, std::move(bytes)});
                    continue;
                }
                for (std::size_t k = 0; k < fronts_.size(); ++k)
                    if (fronts_[k].fd == p.fd)
                        queue.push(Datagram{due, backFor(k, from), fronts_[k].simulator, std::move(bytes)});
            }
        }
    }

    std::chrono::microseconds const delay_;
    std::vector<Front> fronts_;
    std::map<int, Back> backs_;
    std::atomic<bool> stop_{false};
    std::thread thread_;
};

ipmi::BmcConfig config(int simulator = 0, DelayLine const* line = nullptr)
{
    ipmi::BmcConfig c;
    c.name = "bench";
    c.host = "127.0.0.1";
    c.port = line ? line->port(simulator) : kLan + 2 * simulator;
    c.user = "monitor";
    c.password = "icbmc-secret";
    c.workarounds = IPMI_MONITORING_WORKAROUND_FLAGS_PROTOCOL_VERSION_2_0_OPEN_SESSION_PRIVILEGE;
    return c;
}

void BM_PluginPoll(benchmark::State& state)
{
    ipmi::BmcReader reader(config(), kState + "/plugin");
    std::vector<ipmi::Sensor> sensors;
    std::string error;
    reader.read(sensors, error); // warms the SDR cache
    for (auto _ : state) {
        if (!reader.read(sensors, error))
            state.SkipWithError(error.c_str());
        benchmark::DoNotOptimize(sensors.data());
    }
}

void BM_PluginPollWithSelCheck(benchmark::State& state)
{
    ipmi::BmcReader reader(config(), kState + "/plugin-sel");
    std::vector<ipmi::Sensor> sensors;
    std::vector<ipmi::SelEvent> events;
    std::string error;
    reader.read(sensors, error);
    reader.newEvents(events, error);
    for (auto _ : state) {
        if (!reader.read(sensors, error) || !reader.newEvents(events, error))
            state.SkipWithError(error.c_str());
        benchmark::DoNotOptimize(sensors.data());
    }
}

void BM_MinimalLibipmimonitoringLoop(benchmark::State& state)
{
    ipmi_monitoring_ctx_t ctx = ipmi_monitoring_ctx_create();
    std::string const dir = kState + "/minimal";
    std::filesystem::create_directories(dir);
    ipmi_monitoring_ctx_sdr_cache_directory(ctx, dir.c_str());
    ipmi_monitoring_ipmi_config cfg{};
    cfg.protocol_version = IPMI_MONITORING_PROTOCOL_VERSION_2_0;
    cfg.username = const_cast<char*>("monitor");
    cfg.password = const_cast<char*>("icbmc-secret");
    cfg.privilege_level = IPMI_MONITORING_PRIVILEGE_LEVEL_OPERATOR;
    cfg.authentication_type = -1;
    cfg.cipher_suite_id = 3;
    cfg.workaround_flags = IPMI_MONITORING_WORKAROUND_FLAGS_PROTOCOL_VERSION_2_0_OPEN_SESSION_PRIVILEGE;
    std::string const host = "127.0.0.1:" + std::to_string(kLan);
    for (auto _ : state) {
        int const n = ipmi_monitoring_sensor_readings_by_record_id(ctx, host.c_str(), &cfg, 0, nullptr, 0,
                                                                   nullptr, nullptr);
        if (n < 0)
            state.SkipWithError(ipmi_monitoring_ctx_errormsg(ctx));
        for (int i = 0; i < n; ++i, ipmi_monitoring_sensor_iterator_next(ctx))
            benchmark::DoNotOptimize(ipmi_monitoring_sensor_read_sensor_reading(ctx));
    }
    ipmi_monitoring_ctx_destroy(ctx);
}

void BM_IpmiSensorsProcess(benchmark::State& state)
{
    std::string const dir = kState + "/tool";
    std::filesystem::create_directories(dir);
    std::string const cmd = "ipmi-sensors -h 127.0.0.1:" + std::to_string(kLan) +
                            " -u monitor -p icbmc-secret -W opensesspriv -l operator --quiet-cache "
                            "--sdr-cache-directory " + dir + " >/dev/null 2>&1";
    std::system(cmd.c_str()); // warms its SDR cache
    for (auto _ : state)
        if (std::system(cmd.c_str()) != 0)
            state.SkipWithError("ipmi-sensors failed");
}

// One poll (sensors and the SEL check) of N simulated BMCs as the plug-in
// makes it, steady state: a thread per BMC, each with its own reader. The
// second argument delays every datagram by that many microseconds.
void BM_PollBmcsInParallel(benchmark::State& state)
{
    int const n = static_cast<int>(state.range(0));
    std::unique_ptr<DelayLine> line;
    if (state.range(1) > 0)
        line = std::make_unique<DelayLine>(std::chrono::microseconds(state.range(1)), n);
    std::vector<std::unique_ptr<ipmi::BmcReader>> readers;
    for (int k = 0; k < n; ++k)
        readers.push_back(std::make_unique<ipmi::BmcReader>(config(k, line.get()),
                                                            kState + "/parallel" + std::to_string(k)));
    std::atomic<int> failed{0};
    auto const poll = [&](ipmi::BmcReader& r) {
        std::vector<ipmi::Sensor> sensors;
        std::vector<ipmi::SelEvent> events;
        std::string error;
        if (!r.read(sensors, error) || !r.newEvents(events, error))
            ++failed;
    };
    for (auto& r : readers)
        poll(*r); // warms the SDR caches, one BMC at a time
    for (auto _ : state) {
        std::vector<std::thread> threads;
        for (auto& r : readers)
            threads.emplace_back(poll, std::ref(*r));
        for (auto& t : threads)
            t.join();
    }
    if (failed != 0)
        state.SkipWithError("a BMC did not answer");
}

// Every SDR cache file below dir with what tells a rewritten one.
std::map<std::string, std::string> sdrCaches(std::string const& dir)
{
    std::map<std::string, std::string> out;
    for (auto const& e : std::filesystem::recursive_directory_iterator(dir)) {
        struct stat st {};
        if (e.path().filename().string().rfind("sdr-cache", 0) == 0 && ::stat(e.path().c_str(), &st) == 0)
            out[e.path()] = std::to_string(st.st_ino) + " " + std::to_string(st.st_mtim.tv_sec) + "." +
                            std::to_string(st.st_mtim.tv_nsec) + " " + std::to_string(st.st_size);
    }
    return out;
}

// Open with the plug-in reading N simulated BMCs, warm SDR caches, then
// Unloadlib.
void BM_PluginOpenWithBmcs(benchmark::State& state)
{
    int const n = static_cast<int>(state.range(0));
    std::string const dir = kState + "/open" + std::to_string(n);
    for (char const* sub : {"/mi", "/fp", "/data"})
        std::filesystem::create_directories(dir + sub);
    std::error_code exists; // from the run that sized the batch
    std::filesystem::create_symlink(IPMI_PLUGIN, dir + "/mi/ipmi.so", exists);
    std::ofstream(dir + "/pw") << "icbmc-secret\n";
    ::chmod((dir + "/pw").c_str(), 0600);
    std::ofstream conf(dir + "/ipmi.conf");
    for (int k = 0; k < n; ++k)
        conf << "[bmc sim" << k << "]\nhost = 127.0.0.1:" << kLan + 2 * k << "\nuser = monitor\npassword_file = " << dir
             << "/pw\nworkarounds = opensesspriv\n";
    conf.close();
    for (auto const& [name, value] : {std::pair{"IC_MI_DIR", "/mi"}, {"IC_FP_DIR", "/fp"}, {"IC_DATA_DIR", "/data"},
                                      {"IC_IPMI_CONFIG", "/ipmi.conf"}})
        ::setenv(name, (dir + value).c_str(), 1);
    ::setenv("IC_IPMI_POLL_MS", "3600000", 1); // one poll per Open
    IC::InstrumentationControl* ic = nullptr;
    IC::Error* err = nullptr;
    auto const cycle = [&] {
        if (Open(&ic, &err) != 0)
            state.SkipWithError("Open failed");
        Unloadlib();
    };
    cycle(); // downloads every SDR once
    auto const warm = sdrCaches(dir + "/data");
    if (warm.size() != static_cast<std::size_t>(n))
        state.SkipWithError("not every BMC's SDR was cached");
    for (auto _ : state)
        cycle();
    std::size_t downloads = 0;
    for (auto const& [file, stamp] : sdrCaches(dir + "/data"))
        downloads += warm.count(file) == 0 || warm.at(file) != stamp;
    state.counters["sdr_downloads"] = static_cast<double>(downloads);
    if (downloads != 0)
        state.SkipWithError("a start with a cached SDR downloaded it again");
}

BENCHMARK(BM_PluginPoll)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_PluginPollWithSelCheck)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_MinimalLibipmimonitoringLoop)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_IpmiSensorsProcess)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_PollBmcsInParallel)
    ->ArgsProduct({{1, kSimulators}, {0, 500}})
    ->ArgNames({"bmcs", "delay_us"})
    ->Unit(benchmark::kMillisecond)->UseRealTime();
BENCHMARK(BM_PluginOpenWithBmcs)->Arg(1)->Arg(kSimulators)->Unit(benchmark::kMillisecond)->UseRealTime();

} // namespace

int main(int argc, char** argv)
{
    if (std::system("command -v ipmi_sim >/dev/null 2>&1") != 0) {
        std::puts("bench_Ipmi: ipmi_sim is not installed (openipmi); skipped");
        return 0;
    }
    int err = 0;
    ipmi_monitoring_init(0, &err);
    std::filesystem::remove_all(kState);
    std::string const sim = std::string(BMC_EXAMPLES) + "/bmcsim.sh ";
    int started = 0;
    for (; started < kSimulators; ++started) {
        std::string const state = kState + "/sim" + (started ? std::to_string(started) : "");
        std::filesystem::create_directories(state);
        unsigned int const lan = kLan + 2 * started;
        if (std::system((sim + "start " + state + " " + std::to_string(lan) + " " + std::to_string(lan + 1)).c_str()) != 0)
            break;
    }
    if (started == kSimulators) {
        benchmark::Initialize(&argc, argv);
        benchmark::RunSpecifiedBenchmarks();
        benchmark::Shutdown();
    }
    for (int k = 0; k < started; ++k)
        std::system((sim + "stop " + kState + "/sim" + (k ? std::to_string(k) : "")).c_str());
    return started == kSimulators ? 0 : 1;
}
