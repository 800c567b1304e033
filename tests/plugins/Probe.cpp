#include "Probe.h"

#include <HGLog/HGLogger.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <mutex>

namespace ictestprobe {

namespace {

struct RelaySlot {
    std::string name;
    IC::AlertSink sink = nullptr;
    bool active = false;
};

struct State {
    std::mutex m;
    std::condition_variable changed;
    std::vector<std::string> events;
    std::vector<MIRecord> mis;
    std::vector<FPRecord> fps;
    ThreadPlan plan;
    std::deque<std::unique_ptr<IC::Node>> nodes;
    std::deque<RelaySlot> relays; // never shrinks: registrations point into it
    std::vector<IC::Alert> received;
    int liveImages = 0;
};

// Never destroyed: plug-in images may report from their static destructors
// after this library's own statics would be gone.
State& state()
{
    static State* s = new State;
    return *s;
}

// f(state) under the probe's lock.
template <class F>
auto locked(F f)
{
    std::lock_guard<std::mutex> g(state().m);
    return f(state());
}

// The newest unreleased record for which match holds; null if none.
template <class Record, class Match>
Record* newest(std::vector<Record>& records, Match match)
{
    for (auto it = records.rbegin(); it != records.rend(); ++it)
        if (!it->released && match(*it))
            return &*it;
    return nullptr;
}

std::string const kRelayed = "relayed ";

} // namespace

void record(std::string const& event)
{
    locked([&](State& s) {
        s.events.push_back(event);
        s.changed.notify_all();
    });
    HGLOG_EVENT("Probe", "ictest.probe", 2000, event);
}

std::vector<std::string> events() { return locked([](State& s) { return s.events; }); }

std::size_t count(std::string const& event)
{
    auto const all = events();
    return static_cast<std::size_t>(std::count(all.begin(), all.end(), event));
}

std::vector<std::string> eventsWithPrefix(std::string const& prefix)
{
    std::vector<std::string> out;
    for (auto const& e : events())
        if (e.compare(0, prefix.size(), prefix) == 0)
            out.push_back(e);
    return out;
}

bool waitFor(std::string const& event, int timeoutMs, std::size_t n)
{
    State& s = state();
    std::unique_lock<std::mutex> g(s.m);
    return s.changed.wait_for(g, std::chrono::milliseconds(timeoutMs), [&] {
        return static_cast<std::size_t>(std::count(s.events.begin(), s.events.end(), event)) >= n;
    });
}

void reset()
{
    locked([](State& s) {
        s.events.clear();
        s.mis.clear();
        s.fps.clear();
        s.received.clear();
        s.plan = ThreadPlan();
        for (auto& r : s.relays)
            r.active = false;
    });
}

void imageLoaded(std::string const& name)
{
    locked([](State& s) { ++s.liveImages; });
    record(name + ":image loaded");
}

void imageUnloaded(std::string const& name)
{
    locked([](State& s) { --s.liveImages; });
    record(name + ":image unloaded");
}

int liveImages() { return locked([](State& s) { return s.liveImages; }); }

IC::Node* makeNode(IC::Node::SensorType type, unsigned int instance, unsigned int nodeId,
                   unsigned int linkedId, std::string const& description, unsigned int nodeNumber)
{
    auto node = std::make_unique<IC::Node>(type, instance, nodeId, linkedId, description, nodeNumber);
    return locked([&](State& s) {
        s.nodes.push_back(std::move(node));
        return s.nodes.back().get();
    });
}

// ---- plug-in records ----

void created(bool mi, std::string const& name, void const* object)
{
    auto add = [&](auto& records) {
        records.emplace_back();
        records.back().name = name;
        records.back().object = object;
    };
    locked([&](State& s) { mi ? add(s.mis) : add(s.fps); });
}

void updateMI(void const* object, std::function<void(MIRecord&)> const& change)
{
    locked([&](State& s) {
        if (MIRecord* r = newest(s.mis, [object](MIRecord const& m) { return m.object == object; }))
            change(*r);
    });
}

void updateFP(void const* object, std::function<void(FPRecord&)> const& change)
{
    locked([&](State& s) {
        if (FPRecord* r = newest(s.fps, [object](FPRecord const& f) { return f.object == object; }))
            change(*r);
    });
}

std::shared_ptr<IC::ICforFP const> copyServices(IC::ICforFP const& services)
{
    return std::make_shared<IC::ICforFP const>(services);
}

bool findMI(std::string const& name, MIRecord* out)
{
    return locked([&](State& s) {
        MIRecord* r = newest(s.mis, [&name](MIRecord const& m) { return m.name == name; });
        if (r && out)
            *out = *r;
        return r != nullptr;
    });
}

bool findFP(std::string const& name, FPRecord* out)
{
    return locked([&](State& s) {
        FPRecord* r = newest(s.fps, [&name](FPRecord const& f) { return f.name == name; });
        if (r && out)
            *out = *r;
        return r != nullptr;
    });
}

std::vector<MIRecord> mis() { return locked([](State& s) { return s.mis; }); }
std::vector<FPRecord> fps() { return locked([](State& s) { return s.fps; }); }
void setThreadPlan(ThreadPlan const& plan) { locked([&](State& s) { s.plan = plan; }); }
ThreadPlan threadPlan() { return locked([](State& s) { return s.plan; }); }

// ---- relay ----

void const* relayOpen(std::string const& name, IC::AlertSink sink)
{
    return locked([&](State& s) {
        s.relays.push_back(RelaySlot{name, sink, true});
        return static_cast<void const*>(&s.relays.back());
    });
}

void relayClose(void const* context)
{
    locked([&](State& s) {
        for (auto& r : s.relays)
            r.active = r.active && &r != context;
    });
}

IC::Error relayAlerts(std::vector<IC::Alert> const& alerts, void const* context)
{
    std::string name;
    IC::AlertSink sink = nullptr;
    std::vector<IC::Alert> out;
    locked([&](State& s) {
        for (auto& r : s.relays)
            if (&r == context) {
                name = r.name;
                sink = r.active ? r.sink : nullptr;
            }
        for (auto const& a : alerts)
            if (a.getMessage().compare(0, kRelayed.size(), kRelayed) != 0) {
                s.received.push_back(a);
                out.emplace_back(a.getSeverity(), a.getClass(), a.getNodePaths(), a.getStatus(),
                                 kRelayed + a.getMessage());
            }
    });
    IC::Error const done(0, IC::Number(IC::Number::Generic), "");
    if (out.empty())
        return done;
    record(name + ":relayed n=" + std::to_string(out.size()));
    // The sink runs without the probe's lock: it reaches client callbacks,
    // which read the probe too.
    return sink != nullptr ? sink(out) : done;
}

std::vector<IC::Alert> relayReceived() { return locked([](State& s) { return s.received; }); }

} // namespace ictestprobe
