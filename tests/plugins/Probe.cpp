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

std::string const kLogger = "ictest.probe";

MIRecord* miOf(State& s, void const* object)
{
    for (auto it = s.mis.rbegin(); it != s.mis.rend(); ++it)
        if (it->object == object && !it->released)
            return &*it;
    return nullptr;
}

FPRecord* fpOf(State& s, void const* object)
{
    for (auto it = s.fps.rbegin(); it != s.fps.rend(); ++it)
        if (it->object == object && !it->released)
            return &*it;
    return nullptr;
}

bool startsWith(std::string const& s, std::string const& prefix)
{
    return s.compare(0, prefix.size(), prefix) == 0;
}

std::string const kRelayed = "relayed ";

} // namespace

void record(std::string const& event)
{
    State& s = state();
    {
        std::lock_guard<std::mutex> g(s.m);
        s.events.push_back(event);
    }
    s.changed.notify_all();
    HGLOG_EVENT("Probe", kLogger, 2000, event);
}

std::vector<std::string> events()
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    return s.events;
}

std::size_t count(std::string const& event)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    return static_cast<std::size_t>(std::count(s.events.begin(), s.events.end(), event));
}

std::vector<std::string> eventsWithPrefix(std::string const& prefix)
{
    std::vector<std::string> out;
    for (auto const& e : events())
        if (startsWith(e, prefix))
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
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    s.events.clear();
    s.mis.clear();
    s.fps.clear();
    s.received.clear();
    s.plan = ThreadPlan();
    for (auto& r : s.relays)
        r.active = false;
}

void imageLoaded(std::string const& name)
{
    {
        State& s = state();
        std::lock_guard<std::mutex> g(s.m);
        ++s.liveImages;
    }
    record(name + ":image loaded");
}

void imageUnloaded(std::string const& name)
{
    {
        State& s = state();
        std::lock_guard<std::mutex> g(s.m);
        --s.liveImages;
    }
    record(name + ":image unloaded");
}

int liveImages()
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    return s.liveImages;
}

IC::Node* makeNode(IC::Node::SensorType type, unsigned int instance, unsigned int nodeId,
                   unsigned int linkedId, std::string const& description, unsigned int nodeNumber)
{
    auto node = std::make_unique<IC::Node>(type, instance, nodeId, linkedId, description, nodeNumber);
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    s.nodes.push_back(std::move(node));
    return s.nodes.back().get();
}

// ---- management interfaces ----

void miCreated(std::string const& name, void const* object)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    MIRecord r;
    r.name = name;
    r.object = object;
    s.mis.push_back(r);
}

void miNodeCallBacks(void const* object, IC::NodeArrivalCallBack arrival, void const* context,
                     IC::NodeLookupCallBack lookup)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    if (MIRecord* r = miOf(s, object)) {
        r->arrival = arrival;
        r->arrivalContext = context;
        r->lookup = lookup;
    }
}

void miInitialized(void const* object, unsigned int base, std::vector<IC::Node*> const& nodes)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    if (MIRecord* r = miOf(s, object)) {
        r->base = base;
        r->nodes = nodes;
    }
}

void miAlerts(void const* object, IC::AlertCallBack callback, void const* context)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    if (MIRecord* r = miOf(s, object)) {
        r->alert = callback;
        r->alertContext = context;
    }
}

void miShutdown(void const* object)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    if (MIRecord* r = miOf(s, object))
        r->shutdown = true;
}

void miReleased(void const* object)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    if (MIRecord* r = miOf(s, object))
        r->released = true;
}

void miThread(void const* object, bool running)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    if (MIRecord* r = miOf(s, object))
        r->threadRunning = running;
}

bool findMI(std::string const& name, MIRecord* out)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    for (auto it = s.mis.rbegin(); it != s.mis.rend(); ++it)
        if (it->name == name && !it->released) {
            if (out)
                *out = *it;
            return true;
        }
    return false;
}

std::vector<MIRecord> mis()
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    return s.mis;
}

void setThreadPlan(ThreadPlan const& plan)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    s.plan = plan;
}

ThreadPlan threadPlan()
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    return s.plan;
}

// ---- functional plug-ins ----

void fpCreated(std::string const& name, void const* object)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    FPRecord r;
    r.name = name;
    r.object = object;
    s.fps.push_back(r);
}

void fpInitialized(void const* object, unsigned int base, IC::ICforFP const& services,
                   std::vector<IC::Node*> const& nodes)
{
    auto copy = std::make_shared<IC::ICforFP const>(services);
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    if (FPRecord* r = fpOf(s, object)) {
        r->base = base;
        r->services = copy;
        r->nodes = nodes;
    }
}

void fpUpdated(void const* object, std::vector<IC::ManagementInterface*> const& added,
               std::vector<IC::ManagementInterface*> const& removed)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    if (FPRecord* r = fpOf(s, object)) {
        r->lastAdded = added;
        r->lastRemoved = removed;
        ++r->updates;
    }
}

void fpReleased(void const* object)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    if (FPRecord* r = fpOf(s, object))
        r->released = true;
}

bool findFP(std::string const& name, FPRecord* out)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    for (auto it = s.fps.rbegin(); it != s.fps.rend(); ++it)
        if (it->name == name && !it->released) {
            if (out)
                *out = *it;
            return true;
        }
    return false;
}

std::vector<FPRecord> fps()
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    return s.fps;
}

// ---- relay ----

void const* relayOpen(std::string const& name, IC::AlertSink sink)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    s.relays.push_back(RelaySlot{name, sink, true});
    return &s.relays.back();
}

void relayClose(void const* context)
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    for (auto& r : s.relays)
        if (&r == context)
            r.active = false;
}

IC::Error relayAlerts(std::vector<IC::Alert> const& alerts, void const* context)
{
    State& s = state();
    std::string name;
    IC::AlertSink sink = nullptr;
    std::vector<IC::Alert> out;
    {
        std::lock_guard<std::mutex> g(s.m);
        for (auto& r : s.relays)
            if (&r == context) {
                name = r.name;
                if (r.active)
                    sink = r.sink;
            }
        for (auto const& a : alerts) {
            if (startsWith(a.getMessage(), kRelayed))
                continue;
            s.received.push_back(a);
            out.emplace_back(a.getSeverity(), a.getClass(), a.getNodePaths(), a.getStatus(),
                             kRelayed + a.getMessage());
        }
    }
    if (out.empty())
        return IC::Error(0, IC::Number(IC::Number::Generic), "");
    record(name + ":relayed n=" + std::to_string(out.size()));
    // The sink runs without the probe's lock: it reaches client callbacks,
    // which read the probe too.
    if (sink != nullptr)
        return sink(out);
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

std::vector<IC::Alert> relayReceived()
{
    State& s = state();
    std::lock_guard<std::mutex> g(s.m);
    return s.received;
}

} // namespace ictestprobe
