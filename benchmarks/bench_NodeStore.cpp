// The node store with a million nodes: adds, look-ups by path and by id,
// and the memory its indexes take per node. The look-ups are set against a
// bare hash map behind a recursive mutex taken per call, on the same keys in
// the same order; removal of many nodes from a store of 65,535 shows that
// the cost per node does not grow with the number removed.
#include <IC/NodeStore.h>

#include <benchmark/benchmark.h>

#include <malloc.h>

#include <algorithm>
#include <chrono>
#include <memory>
#include <mutex>
#include <random>
#include <string>
#include <unordered_map>
#include <vector>

namespace {

constexpr std::size_t kNodes = 1000000;

using Tree = std::vector<std::unique_ptr<IC::Node>>;

// A million nodes, breadth first, so that every parent comes before its
// children.
Tree makeTree(unsigned int fanOut)
{
    static IC::Node::SensorType const types[] = {IC::Node::ROOT,  IC::Node::Chassis,
                                                 IC::Node::CPU,   IC::Node::CPUCore,
                                                 IC::Node::Cache, IC::Node::PFASensor};
    Tree v;
    v.reserve(kNodes);
    std::vector<unsigned int> depth;
    depth.reserve(kNodes);
    v.push_back(std::make_unique<IC::Node>(IC::Node::ROOT, 0, 1, 0, "root"));
    depth.push_back(0);
    for (std::size_t parent = 0; v.size() < kNodes; ++parent) {
        for (unsigned int i = 0; i < fanOut && v.size() < kNodes; ++i) {
            unsigned int const d = depth[parent] + 1;
            auto const id = static_cast<unsigned int>(v.size() + 1);
            v.push_back(std::make_unique<IC::Node>(types[d], i, id, v[parent]->getNodeId(), ""));
            depth.push_back(d);
        }
    }
    return v;
}

// Depth 6 (fan-out 16): the adds and the memory.
Tree const& tree()
{
    static Tree const nodes = makeTree(16);
    return nodes;
}

// Depth 4 (fan-out 100), paths of 10 and 11 bytes: the look-ups.
Tree const& wideTree()
{
    static Tree const nodes = makeTree(100);
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
        for (auto const& n : wideTree()) {
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

constexpr std::size_t kProbes = 1 << 16;

std::vector<std::string> const& probePaths()
{
    static std::vector<std::string> const paths = [] {
        auto const& nodes = wideTree();
        filledStore(); // the nodes learn their paths there
        std::vector<std::string> v;
        std::mt19937 rng(7);
        for (std::size_t i = 0; i < kProbes; ++i)
            v.push_back(nodes[rng() % nodes.size()]->getPath());
        return v;
    }();
    return paths;
}

std::vector<unsigned int> const& probeIds()
{
    static std::vector<unsigned int> const ids = [] {
        std::vector<unsigned int> v;
        std::mt19937 rng(11);
        for (std::size_t i = 0; i < kProbes; ++i)
            v.push_back(static_cast<unsigned int>(rng() % kNodes) + 1);
        return v;
    }();
    return ids;
}

// The floor: a look-up in a bare hash map behind a recursive mutex taken
// per call, filled in the store's order.
template <class Key>
struct BareMap {
    std::unordered_map<Key, IC::Node*> map;
    mutable std::recursive_mutex lock;

    IC::Node* find(Key const& key) const
    {
        std::lock_guard<std::recursive_mutex> guard(lock);
        auto it = map.find(key);
        return it == map.end() ? nullptr : it->second;
    }
};

template <class Key>
void storeLookups(benchmark::State& state, std::vector<Key> const& keys)
{
    IC::NodeStore& store = filledStore();
    std::size_t i = 0;
    IC::Node* found = nullptr;
    for (auto _ : state) {
        benchmark::DoNotOptimize(store.getNode(keys[i++ & (kProbes - 1)], &found));
        benchmark::DoNotOptimize(found);
    }
}

template <class Key, class KeyOf>
void bareLookups(benchmark::State& state, std::vector<Key> const& keys, KeyOf keyOf)
{
    static BareMap<Key> const& bare = *[keyOf] {
        auto* b = new BareMap<Key>;
        for (auto const& n : wideTree())
            b->map.emplace(keyOf(*n), n.get());
        return b;
    }();
    std::size_t i = 0;
    for (auto _ : state)
        benchmark::DoNotOptimize(bare.find(keys[i++ & (kProbes - 1)]));
}

void BM_GetNodeByPath(benchmark::State& state)
{
    storeLookups(state, probePaths());
}
BENCHMARK(BM_GetNodeByPath);

void BM_GetNodeByPathBareMap(benchmark::State& state)
{
    bareLookups(state, probePaths(), [](IC::Node const& n) { return n.getPath(); });
}
BENCHMARK(BM_GetNodeByPathBareMap);

void BM_GetNodeById(benchmark::State& state)
{
    storeLookups(state, probeIds());
}
BENCHMARK(BM_GetNodeById);

void BM_GetNodeByIdBareMap(benchmark::State& state)
{
    bareLookups(state, probeIds(), [](IC::Node const& n) { return n.getNodeId(); });
}
BENCHMARK(BM_GetNodeByIdBareMap);

// Removal of N nodes, one alert's worth, from a store of 65,535 sensors
// under one parent: as the dispatch does for a removal alert, out of getMap
// first, then erased by path.
void BM_RemoveNodes(benchmark::State& state)
{
    constexpr unsigned int kStoreNodes = 65535;
    auto const removed = static_cast<std::size_t>(state.range(0));
    std::vector<std::unique_ptr<IC::Node>> nodes;
    nodes.push_back(std::make_unique<IC::Node>(IC::Node::ROOT, 0, 1, 0, "root"));
    for (unsigned int i = 1; i < kStoreNodes; ++i)
        nodes.push_back(std::make_unique<IC::Node>(IC::Node::TemperatureSensor, i, i + 1, 1, ""));
    std::vector<std::size_t> order(nodes.size());
    for (std::size_t k = 0; k < order.size(); ++k)
        order[k] = k;
    std::shuffle(order.begin(), order.end(), std::mt19937(3));
    std::vector<std::string> paths;
    for (auto _ : state) {
        state.PauseTiming();
        auto store = std::make_unique<IC::NodeStore>();
        bool isNew = false;
        for (auto const& n : nodes) {
            IC::Node* const node = n.get();
            store->addNodeIfNew(node, isNew);
        }
        // N nodes picked at random, in random order: every N meets the
        // same cold memory, as an alert from a long-running plug-in would.
        paths.clear();
        for (std::size_t k = 0; k < removed; ++k)
            paths.push_back(nodes[order[k]]->getPath());
        state.ResumeTiming();
        for (std::string const& path : paths) {
            store->delNodeFromGetMap(path);
            store->erase(path);
        }
        state.PauseTiming();
        store.reset();
        state.ResumeTiming();
    }
    state.counters["ns_per_node"] = benchmark::Counter(
        static_cast<double>(state.iterations() * removed), benchmark::Counter::kIsRate |
                                                              benchmark::Counter::kInvert);
    state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * removed));
}
BENCHMARK(BM_RemoveNodes)->Arg(1000)->Arg(10000)->Arg(65535)->Unit(benchmark::kMillisecond);

} // namespace

BENCHMARK_MAIN();
