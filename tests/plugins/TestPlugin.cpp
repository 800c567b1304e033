// The one test plug-in, built many times with different definitions
// (TestPlugin.cmake):
//   TP_FP        a functional plug-in; otherwise a management interface
//   TP_NAME      its name in its records and log lines
//   TP_INSTANCE  instance of its top nodes, which keeps the builds' paths apart
//   TP_MODE      what it does (ictest::Mode); TP_NO_ENTRY: no entry symbol
//   TP_THREADED  raises alerts (an interface also reports fans) from a thread
// An interface describes a small server: ROOT, a chassis with CPU 0 and its
// temperature sensor, network port eth0 and fan 1 (ids base|1 to base|6).
// fakehw_raise raises an alert on one of its nodes; FAKEHW_PULSE_MS=N turns
// the temperature critical and back every N ms, FAKEHW_PULSE_HOLD=1 keeps it
// critical (raised again every N ms).
#include "PluginHarness.h"

#include <HGLog/HGLogger.h>
#include <IC/FunctionalPlugIn.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <set>
#include <stdexcept>
#include <thread>

#include <dlfcn.h>

namespace {

using IC::Alert;
using IC::Error;
using IC::Node;
using IC::Number;
using namespace ictest;

#ifdef TP_FP
using Base = IC::FunctionalPlugIn;
std::string const kKind = "fp";
#else
using Base = IC::ManagementInterface;
std::string const kKind = "mi";
#endif
#ifdef TP_THREADED
constexpr bool kThreaded = true;
#else
constexpr bool kThreaded = false;
#endif
std::string const kName = TP_NAME;
constexpr Mode kMode = TP_MODE;
Alert::ClassType const kPlain = static_cast<Alert::ClassType>(2);

template <class F>
F hook(char const* name)
{
    return reinterpret_cast<F>(dlsym(RTLD_DEFAULT, name));
}
auto const harnessSeen = hook<Seen* (*)(char const*, void*)>("ictest_seen");
auto const harnessKeep = hook<void (*)(Node*)>("ictest_keep");
auto const harnessRelay = hook<IC::AlertCallBack>("ictest_relay");

void say(std::string const& what)
{
    if (harnessSeen)
        HGLOG_EVENT("TestPlugin", "ictest.plugin", 2000, kName, ":", what);
}
Error ok() { return Error(0, Number(Number::Generic), ""); }
Error refused(std::string const& what) { return Error(1, Number(7u), kKind + " " + what + " refused"); }

class Plugin;
// Objects the loader abandoned (it does not release a plug-in that failed
// half-way) go with the image.
struct Image {
    ~Image();
    std::mutex m;
    std::set<Plugin*> live;
    Plugin* raiser = nullptr; // for fakehw_raise
} image;

class Plugin final : public Base {
public:
    Plugin() : seen_(harnessSeen ? harnessSeen(TP_NAME, this) : &own_)
    {
        std::lock_guard<std::mutex> g(image.m);
        image.live.insert(this);
    }
    ~Plugin() override
    {
        stop();
        if (harnessKeep)
            for (auto& n : owned_)
                harnessKeep(n.release());
    }

    Error getMap(std::vector<Node*>& nodes) override
    {
        say("getMap");
        if (kMode == MODE_GETMAP_FAILS)
            return refused("map");
        if (kMode == MODE_GETMAP_THROWS)
            throw std::runtime_error("map exploded");
        std::lock_guard<std::mutex> g(m_);
        nodes.insert(nodes.end(), live_.begin(), live_.end());
        return ok();
    }

#ifdef TP_FP
    Error Initialize(unsigned int base, IC::ICforFP const& services) override
    {
        say("Initialize base=" + std::to_string(base));
        if (Error const e = initFails(); e.getStatus() != 0)
            return e;
        seen_->base = base_ = base;
        seen_->services.emplace(services);
        add(Node::Fan, 50 + TP_INSTANCE, 0, kName + " fan");
        add(Node::PowerSupply, 50 + TP_INSTANCE, 0, kName + " psu");
        seen_->nodes = live_;
        if (kMode == MODE_ANNOUNCE || kMode == MODE_ACTIVE)
            for (Node* n : live_)
                say("announced status=" + std::to_string(services.getMapNewFPNode()(n).getStatus()));
        for (Node::SensorType s : {Node::CPU, Node::Fan})
            if (kMode == MODE_RELAY && harnessRelay)
                say("registered status=" + std::to_string(services.getRegFPsensorAlerts()(harnessRelay, s, seen_).getStatus()));
        if (kMode == MODE_ACTIVE) {
            supply_ = live_[1]->getPath();
            services.getRegFPAlerts()(&Plugin::received, {supply_}, this);
            services.getAssertCallBackFP()({Alert(3, kPlain, {supply_}, 2, "supply degraded")});
            if (kThreaded)
                thread_ = std::thread([this] { loop(); });
        }
        return ok();
    }

    Error updatedMis(std::vector<IC::ManagementInterface*> const& added,
                     std::vector<IC::ManagementInterface*> const& removed) override
    {
        say("updatedMis added=" + std::to_string(added.size()) + " removed=" + std::to_string(removed.size()));
        seen_->added = added;
        seen_->removed = removed;
        return kMode == MODE_UPDATE_FAILS ? refused("update") : ok();
    }

    void release() override
    {
        say("release");
        stop();
        IC::ICforFP const* s = seen_->services ? &*seen_->services : nullptr;
        for (Node::SensorType t : {Node::CPU, Node::Fan})
            if (kMode == MODE_RELAY && harnessRelay)
                s->getDeRegFPsensorAlerts()(harnessRelay, t, seen_);
        if (kMode == MODE_ACTIVE)
            s->getDeRegFPAlerts()(&Plugin::received, {supply_}, this);
        finish();
    }
#else
    Error Initialize(unsigned int base, Number iv, Number mv) override
    {
        say("Initialize base=" + std::to_string(base) + " iv=" + iv.toString() + " mv=" + mv.toString());
        if (kMode == MODE_SLOW) { // long enough for a test to act while the load is under way
            std::this_thread::sleep_for(std::chrono::milliseconds(1500));
            say("Initialize slept");
        }
        if (Error const e = initFails(); e.getStatus() != 0)
            return e;
        std::lock_guard<std::mutex> g(m_);
        seen_->base = base_ = base;
        add(Node::ROOT, TP_INSTANCE, 0, "Fake server");
        add(Node::Chassis, 0, 1, "Fake chassis")->setProperty("vendor", "Acme");
        add(Node::CPU, 0, 2, "Fake CPU 0");
        Node* temp = add(Node::TemperatureSensor, 0, 3, "CPU temperature");
        temp->setProperty("reading", "45", "C");
        temp->setProperty("upper_critical", "95", "C");
        temp->setProperty("state", "ok");
        Node* fan = add(Node::Fan, 1, 2, "System fan 1");
        fan->setProperty("reading", "1200", "RPM");
        fan->setProperty("state", "ok");
        add(Node::NetworkPort, 0, 2, "eth0")->setProperty("state", "up");
        seen_->nodes = live_;
        return ok();
    }

    Error registerForAlerts(IC::AlertCallBack callback, void const* context) override
    {
        say("registerForAlerts");
        if (kMode == MODE_REG_FAILS)
            return refused("alerts");
        seen_->alert = callback;
        seen_->alertContext = context;
        char const* every = std::getenv("FAKEHW_PULSE_MS");
        char const* hold = std::getenv("FAKEHW_PULSE_HOLD");
        if (every && *every && !thread_.joinable())
            thread_ = std::thread(&Plugin::pulse, this, std::strtoul(every, nullptr, 10), hold && *hold == '1');
        else if (kThreaded && !thread_.joinable())
            thread_ = std::thread([this] { loop(); });
        std::lock_guard<std::mutex> g(image.m);
        image.raiser = this;
        return ok();
    }

    void registerNodeCallBacks(IC::NodeArrivalCallBack arrival, void const* context,
                               IC::NodeLookupCallBack lookup) override
    {
        say("registerNodeCallBacks");
        seen_->arrival = arrival;
        seen_->arrivalContext = context;
        seen_->lookup = lookup;
    }

    Error shutdown() override
    {
        say("shutdown");
        stop();
        return ok();
    }

    void release() override
    {
        say("release");
        stop(); // a reload releases without shutdown()
        {
            std::lock_guard<std::mutex> g(image.m);
            if (image.raiser == this)
                image.raiser = nullptr;
        }
        // Alone, it says that its nodes are gone before they are deleted.
        std::vector<std::string> paths;
        for (Node* n : live_)
            if (!harnessKeep && !n->getPath().empty())
                paths.push_back(n->getPath());
        if (!paths.empty())
            seen_->alert({Alert(0, Alert::NodeRemoval, paths, 1, "fakehw: unloaded")}, seen_->alertContext);
        finish();
    }

    // 0 sent, 1 no such node; a removal also drops the node.
    int raise(unsigned int type, unsigned int instance, unsigned char severity, unsigned int cls,
              unsigned int status, std::string const& message)
    {
        std::string path;
        {
            std::lock_guard<std::mutex> g(m_);
            auto const it = std::find_if(live_.begin(), live_.end(), [&](Node* n) {
                return n->getSensor() == type && n->getInstance() == instance;
            });
            if (it == live_.end())
                return 1;
            path = (*it)->getPath();
            if (cls == Alert::NodeRemoval)
                live_.erase(it); // still owned: the library may hold it
        }
        seen_->alert({Alert(severity, static_cast<Alert::ClassType>(cls), {path}, status, message)},
                     seen_->alertContext);
        return 0;
    }
#endif

private:
    Error initFails()
    {
        if (kMode == MODE_INIT_FAILS)
            return refused("init");
        if (kMode == MODE_THROW_INIT)
            throw std::runtime_error("init exploded");
        return ok();
    }
    void finish()
    {
        seen_->released = true;
        {
            std::lock_guard<std::mutex> g(image.m);
            image.live.erase(this);
        }
        delete this;
    }
    // Local ids count up from 1 in the order of creation. Nodes reported
    // through the arrival callback are not in the map as well.
    Node* add(Node::SensorType type, unsigned int instance, unsigned int localParent, std::string const& description,
              bool mapped = true)
    {
        unsigned int const id = base_ | ++lastLocalId_, parent = localParent == 0 ? 0 : (base_ | localParent);
        owned_.push_back(std::make_unique<Node>(type, instance, id, parent, description, id));
        if (mapped)
            live_.push_back(owned_.back().get());
        return owned_.back().get();
    }
    bool waitStop(long ms)
    {
        std::unique_lock<std::mutex> g(m_);
        return wake_.wait_for(g, std::chrono::milliseconds(ms), [this] { return stop_; });
    }
    void stop()
    {
        {
            std::lock_guard<std::mutex> g(m_);
            stop_ = true;
        }
        wake_.notify_all();
        if (thread_.joinable())
            thread_.join();
    }
    // Alerts, asserted and cleared in turn; an interface first reports fans
    // (12 at most), raises on them, now and then removes one and looks its
    // nodes up.
    void loop()
    {
        std::vector<std::string> fans;
        for (unsigned int turn = 1; !waitStop(2); ++turn) {
            unsigned int const status = turn % 2 ? 1u : 2u;
#ifdef TP_FP
            seen_->services->getAlertCallBackFP()({Alert(3, kPlain, {supply_}, status, "supply")});
#else
            if (turn <= 12) {
                Node* fan;
                {
                    std::lock_guard<std::mutex> g(m_);
                    fan = add(Node::Fan, 0x10 + turn, 2, kName + " fan", false);
                }
                if (seen_->arrival(fan, seen_->arrivalContext).getStatus() == 0)
                    fans.push_back(fan->getPath());
            }
            if (fans.empty())
                continue;
            seen_->alert({Alert(2, kPlain, {fans[turn % fans.size()]}, status, kName + " thread alert")},
                         seen_->alertContext);
            if (fans.size() > 4 && turn % 7 == 0) {
                seen_->alert({Alert(1, Alert::NodeRemoval, {fans.back()}, 2, kName + " fan gone")}, seen_->alertContext);
                fans.pop_back();
            }
            Node* found = nullptr;
            seen_->lookup(fans.front(), &found);
#endif
        }
    }
#ifndef TP_FP
    // The temperature turns critical or back to normal, or stays critical
    // when held.
    void pulse(unsigned long periodMs, bool hold)
    {
        for (bool critical = false; !waitStop(static_cast<long>(periodMs));) {
            critical = !critical || hold;
            {
                std::lock_guard<std::mutex> g(m_);
                owned_[3]->setProperty("reading", critical ? "97" : "45", "C");
            }
            raise(Node::TemperatureSensor, 0, critical ? 2 : 0, 5, critical ? 3 : 1,
                  critical ? "CPU temperature 97 C above 95 C" : "CPU temperature back to 45 C");
        }
    }
#endif
    static Error received(std::vector<Alert> const& alerts, void const* context)
    {
        static_cast<Plugin const*>(context)->seen_->received += alerts.size();
        return ok();
    }

    Seen own_;
    Seen* seen_;
    unsigned int base_ = 0, lastLocalId_ = 0;
    std::vector<std::unique_ptr<Node>> owned_;
    std::vector<Node*> live_; // what getMap reports
    std::string supply_;
    std::mutex m_;
    std::condition_variable wake_;
    bool stop_ = false;
    std::thread thread_;
};

Image::~Image()
{
    for (Plugin* p : live)
        delete p;
    say("image unloaded");
}

template <class Object>
unsigned char open(char const* entry, Object** object, Error** err)
{
    static Error good = ok(), bad(1, Number(7u), kKind + " refused");
    say(entry);
    if (kMode == MODE_CODE)
        return 'X';
    if (kMode == MODE_THROW_INT)
        throw 42;
    if (kMode != MODE_NULL_OBJECT)
        *object = new Plugin;
    if (kMode != MODE_NULL_ERROR)
        *err = kMode == MODE_ERROR_STATUS ? &bad : &good;
    return 0;
}

} // namespace

#define TP_API extern "C" __attribute__((visibility("default")))
#if defined(TP_NO_ENTRY)
TP_API unsigned char OpenSomethingElse() { return 0; }
#elif defined(TP_FP)
TP_API unsigned char OpenFP(IC::FunctionalPlugIn** fp, IC::Error** err) { return open("OpenFP", fp, err); }
#else
TP_API unsigned char OpenMI(IC::ManagementInterface** mi, IC::Error** err) { return open("OpenMI", mi, err); }

// Raises one alert on the node (type, instance): 0 sent, 1 no such node, -1
// no interface.
TP_API int fakehw_raise(unsigned int type, unsigned int instance, unsigned char severity, unsigned int cls,
                        unsigned int status, char const* message)
{
    std::lock_guard<std::mutex> g(image.m); // release() cannot end the interface under it
    return image.raiser ? image.raiser->raise(type, instance, severity, cls, status, message) : -1;
}
#endif
