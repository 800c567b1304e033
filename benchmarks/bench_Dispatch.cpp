// Alert fan-out: 1,000 registrations by node path over 1,000 nodes, made
// through a functional plug-in's services, and a management interface
// raising batches of 100 alerts that each name one node. The floor is a
// minimal dispatcher over the same indexes and batches: under one lock, for
// each alert the registers by class, by each path's sensor type and by path,
// each given a fresh copy of the alert restricted to its matched paths; then
// the store update and the calls.
#include <IC/AlertStore.h>
#include <IC/InstCtrl.h>

#include <HGLog/HGLogger.h>

#include <benchmark/benchmark.h>

#include <algorithm>
#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

namespace {

constexpr int kNodes = 1000;
constexpr int kBatch = 100;

std::atomic<long> delivered{0};

IC::Error countDeliveries(std::vector<IC::Alert> const& alerts, void const*)
{
    delivered.fetch_add(static_cast<long>(alerts.size()), std::memory_order_relaxed);
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

struct Fixture {
    std::vector<std::unique_ptr<IC::Node>> nodes;
    std::vector<std::vector<IC::Alert>> batches;
    std::vector<int> contexts = std::vector<int>(kNodes);

    Fixture()
    {
        nodes.push_back(std::make_unique<IC::Node>(IC::Node::ROOT, 0, 0x10001, 0, "root"));
        for (int i = 1; i < kNodes; ++i)
            nodes.push_back(std::make_unique<IC::Node>(IC::Node::TemperatureSensor,
                                                       static_cast<unsigned int>(i),
                                                       0x10001u + static_cast<unsigned int>(i),
                                                       0x10001, "sensor"));
        for (auto const& n : nodes)
            IC::InstCtrl::nodestore.addMINode(std::vector<IC::Node*>{n.get()});
        for (int i = 0; i < kNodes; ++i)
            IC::InstCtrl::regFPAlerts(countDeliveries, {nodes[static_cast<std::size_t>(i)]->getPath()},
                                      &contexts[static_cast<std::size_t>(i)]);
        for (int b = 0; b < kNodes / kBatch; ++b) {
            std::vector<IC::Alert> batch;
            for (int i = 0; i < kBatch; ++i)
                batch.emplace_back(1, static_cast<IC::Alert::ClassType>(5),
                                   std::vector<std::string>{
                                       nodes[static_cast<std::size_t>(b * kBatch + i)]->getPath()},
                                   2, "hot");
            batches.push_back(std::move(batch));
        }
    }
};

Fixture& fixture()
{
    static Fixture f;
    return f;
}

// One register's delivery in the floor dispatcher.
struct FloorCall {
    IC::AlertCallBack callback = nullptr;
    void const* context = nullptr;
    std::vector<IC::Alert> alerts;
};

void floorDispatch(std::vector<IC::Alert> const& alerts, unsigned int type)
{
    using namespace IC::InstCtrl;
    std::map<IC::AlertRegister*, FloorCall> calls;
    {
        std::lock_guard<SD::Mutex> guard(registerlock);
        std::vector<std::pair<IC::AlertRegister*, std::vector<std::string>>> matches;
        auto match = [&matches](IC::AlertRegister* reg) -> std::vector<std::string>& {
            for (auto& m : matches)
                if (m.first == reg)
                    return m.second;
            matches.emplace_back(reg, std::vector<std::string>());
            return matches.back().second;
        };
        for (IC::Alert const& alert : alerts) {
            matches.clear();
            auto byClass = classtypeTOalertregister.equal_range(alert.getClass());
            for (auto it = byClass.first; it != byClass.second; ++it)
                match(it->second) = alert.nodePaths();
            for (std::string const& path : alert.nodePaths()) {
                auto bySensor = sensortypeTOalertregister.equal_range(nodestore.nodePathToSensor(path));
                for (auto it = bySensor.first; it != bySensor.second; ++it)
                    match(it->second).push_back(path);
                auto byPath = nodepathTOalertregister.equal_range(path);
                for (auto it = byPath.first; it != byPath.second; ++it)
                    match(it->second).push_back(path);
            }
            for (auto& m : matches) {
                FloorCall& call = calls[m.first];
                call.callback = m.first->getCallback();
                call.context = m.first->getContext();
                call.alerts.emplace_back(alert.getSeverity(), alert.getClass(), std::move(m.second),
                                         alert.getStatus(), alert.getMessage());
            }
        }
    }
    for (auto& entry : calls) {
        alertstore.newAlerts(entry.second.alerts, type);
        entry.second.callback(entry.second.alerts, entry.second.context);
    }
}

template <class Dispatch>
void runBatches(benchmark::State& state, Dispatch dispatch)
{
    Fixture& f = fixture();
    delivered = 0;
    std::size_t b = 0;
    for (auto _ : state)
        dispatch(f.batches[b++ % f.batches.size()]);
    state.SetItemsProcessed(delivered.load());
    state.counters["deliveries_per_batch"] =
        static_cast<double>(delivered.load()) / static_cast<double>(state.iterations());
}

void library(std::vector<IC::Alert> const& batch)
{
    IC::InstCtrl::AlertCallBackMI(batch, nullptr);
}

void BM_DispatchLoggingOff(benchmark::State& state)
{
    HGLog::HGLogger::configureDefault();
    runBatches(state, library);
}
BENCHMARK(BM_DispatchLoggingOff)->Unit(benchmark::kMicrosecond);

void BM_DispatchFloor(benchmark::State& state)
{
    HGLog::HGLogger::configureDefault();
    runBatches(state, [](std::vector<IC::Alert> const& batch) { floorDispatch(batch, 1); });
}
BENCHMARK(BM_DispatchFloor)->Unit(benchmark::kMicrosecond);

void BM_DispatchWithListener(benchmark::State& state)
{
    std::atomic<long> records{0};
    HGLog::HGLogger::setListener([&records](HGLog::Record const&) { ++records; });
    runBatches(state, library);
    HGLog::HGLogger::setListener(HGLog::Listener());
    state.counters["log_records_per_batch"] =
        static_cast<double>(records.load()) / static_cast<double>(state.iterations());
}
BENCHMARK(BM_DispatchWithListener)->Unit(benchmark::kMicrosecond);

} // namespace

BENCHMARK_MAIN();
