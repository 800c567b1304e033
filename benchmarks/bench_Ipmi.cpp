// One poll of the simulated BMC (examples/bmc) as the ipmi plug-in reads it
// (session set-up included, every sensor, warm SDR cache), against the floor
// (a minimal libipmimonitoring loop doing the same read) and against
// FreeIPMI's ipmi-sensors run as a process. Needs ipmi_sim (openipmi).
#include "BmcReader.h"

#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

namespace {

std::string const kState = "/tmp/ic_bench_ipmi";
constexpr unsigned int kLan = 17623; // loopback only

ipmi::BmcConfig config()
{
    ipmi::BmcConfig c;
    c.name = "bench";
    c.host = "127.0.0.1";
    c.port = kLan;
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

BENCHMARK(BM_PluginPoll)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_PluginPollWithSelCheck)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_MinimalLibipmimonitoringLoop)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_IpmiSensorsProcess)->Unit(benchmark::kMillisecond);

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
    std::filesystem::create_directories(kState + "/sim");
    std::string const sim = std::string(BMC_EXAMPLES) + "/bmcsim.sh ";
    if (std::system((sim + "start " + kState + "/sim " + std::to_string(kLan) + " " + std::to_string(kLan + 1)).c_str()) != 0)
        return 1;
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    std::system((sim + "stop " + kState + "/sim").c_str());
    return 0;
}
