// The node store with a million nodes: adds, look-ups by path and by id,
// and the memory its four indexes take per node.
#include <IC/NodeStore.h>

#include <benchmark/benchmark.h>

#include <malloc.h>

#include <chrono>
#include <memory>
#include <random>
#include <vector>

namespace {

constexpr std::size_t kNodes = 1000000;
constexpr unsigned int kFanOut = 16;

// A tree of depth 6 (root and five levels below it), breadth first, so that
// every parent comes before its children.
std::vector<std::unique_ptr<IC::Node>> const& tree()
{
    static std::vector<std::unique_ptr<IC::Node>> nodes = [] {
        static IC::Node::SensorType const types[] = {IC::Node::ROOT, IC::Node::Chassis,
                                                     IC::Node::CPU,  IC::Node::CPUCore,
                                                     IC::Node::Cache, IC::Node::PFASensor};
        std::vector<std::unique_ptr<IC::Node>> v;
        v.reserve(kNodes);
        std::vector<unsigned int> depth;
        depth.reserve(kNodes);
        v.push_back(std::make_unique<IC::Node>(IC::Node::ROOT, 0, 1, 0, "root"));
        depth.push_back(0);
        for (std::size_t parent = 0; v.size() < kNodes; ++parent) {
            for (unsigned int i = 0; i < kFanOut && v.size() < kNodes; ++i) {
                unsigned int const d = depth[parent] + 1;
                auto const id = static_cast<unsigned int>(v.size() + 1);
                v.push_back(std::make_unique<IC::Node>(types[d], i, id, v[parent]->getNodeId(), ""));
                depth.push_back(d);
            }
        }
        return v;
    }();
    return nodes;
}

std::size_t heapInUse()
{
    struct mallinfo2 const m = mallinfo2();
    return m.uordblks + m.hblkhd;
}

// One store filled once, shared by the look-up benchmarks.
IC::NodeStore& filledStore()
{
    static IC::NodeStore* store = [] {
        auto* s = new IC::NodeStore;
        bool isNew = false;
        for (auto const& n : tree()) {
            IC::Node* const node = n.get();
            s->addNodeIfNew(node, isNew);
        }
        return s;
    }();
    return *store;
}

void BM_AddMillionNodes(benchmark::State& state)
{
    auto const& nodes = tree();
    for (auto _ : state) {
        IC::NodeStore store;
        std::size_t const before = heapInUse();
        auto const start = std::chrono::steady_clock::now();
        bool isNew = false;
        for (auto const& n : nodes) {
            IC::Node* const node = n.get();
            store.addNodeIfNew(node, isNew);
        }
        auto const seconds =
            std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
        state.SetIterationTime(seconds);
        state.counters["bytes_per_node"] =
            static_cast<double>(heapInUse() - before) / static_cast<double>(nodes.size());
        state.counters["seconds_for_adds"] = seconds;
    }
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * nodes.size()));
}
BENCHMARK(BM_AddMillionNodes)->Iterations(1)->UseManualTime()->Unit(benchmark::kMillisecond);

void BM_GetNodeByPath(benchmark::State& state)
{
    IC::NodeStore& store = filledStore();
    auto const& nodes = tree();
    std::vector<std::string> paths;
    std::mt19937 rng(7);
    for (int i = 0; i < 4096; ++i)
        paths.push_back(nodes[rng() % nodes.size()]->getPath());
    std::size_t i = 0;
    IC::Node* found = nullptr;
    for (auto _ : state) {
        benchmark::DoNotOptimize(store.getNode(paths[i++ & 4095], &found));
        benchmark::DoNotOptimize(found);
    }
}
BENCHMARK(BM_GetNodeByPath);

void BM_GetNodeById(benchmark::State& state)
{
    IC::NodeStore& store = filledStore();
    std::vector<unsigned int> ids;
    std::mt19937 rng(11);
    for (int i = 0; i < 4096; ++i)
        ids.push_back(static_cast<unsigned int>(rng() % kNodes) + 1);
    std::size_t i = 0;
    IC::Node* found = nullptr;
    for (auto _ : state) {
        benchmark::DoNotOptimize(store.getNode(ids[i++ & 4095], &found));
        benchmark::DoNotOptimize(found);
    }
}
BENCHMARK(BM_GetNodeById);

} // namespace

BENCHMARK_MAIN();
