// Alert fan-out: 1,000 registrations by node path over 1,000 nodes, made
// through a functional plug-in's services, and a management interface
// raising batches of 100 alerts that each name one node.
#include <IC/InstCtrl.h>

#include <HGLog/HGLogger.h>

#include <benchmark/benchmark.h>

#include <atomic>
#include <memory>
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

void runBatches(benchmark::State& state)
{
    Fixture& f = fixture();
    delivered = 0;
    std::size_t b = 0;
    for (auto _ : state)
        IC::InstCtrl::AlertCallBackMI(f.batches[b++ % f.batches.size()], nullptr);
    state.SetItemsProcessed(delivered.load());
    state.counters["deliveries_per_batch"] =
        static_cast<double>(delivered.load()) / static_cast<double>(state.iterations());
}

void BM_DispatchLoggingOff(benchmark::State& state)
{
    HGLog::HGLogger::configureDefault();
    runBatches(state);
}
BENCHMARK(BM_DispatchLoggingOff)->Unit(benchmark::kMicrosecond);

void BM_DispatchWithListener(benchmark::State& state)
{
    std::atomic<long> records{0};
    HGLog::HGLogger::setListener([&records](HGLog::Record const&) { ++records; });
    runBatches(state);
    HGLog::HGLogger::setListener(HGLog::Listener());
    state.counters["log_records_per_batch"] =
        static_cast<double>(records.load()) / static_cast<double>(state.iterations());
}
BENCHMARK(BM_DispatchWithListener)->Unit(benchmark::kMicrosecond);

} // namespace

BENCHMARK_MAIN();
