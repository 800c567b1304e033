// A small management interface for the tests of the health plug-in and of
// icctl: a fixed server (ROOT, chassis, CPU with a temperature sensor, a fan,
// a network port) whose alerts a test raises.
//
// In-process tests find the control functions below (fakehw_*) with dlsym
// on the image the library loaded. Tests that run icctl as a process steer
// it through the environment:
//   FAKEHW_PULSE_MS=N     every N ms the CPU temperature alternates between
//                         critical (class 5, status 3) and normal (status 1),
//                         starting with critical
//   FAKEHW_PULSE_HOLD=1   raise the critical alert once and keep it
// FAKEHW_ROOT_INSTANCE (compile time) keeps two builds' paths apart;
// FAKEHW_BROKEN makes OpenMI fail.
#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/ManagementInterface.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#ifndef FAKEHW_ROOT_INSTANCE
#define FAKEHW_ROOT_INSTANCE 0
#endif

#define FAKEHW_API extern "C" __attribute__((visibility("default")))

namespace {

using IC::Alert;
using IC::Error;
using IC::Node;
using IC::Number;

Error ok()
{
    return Error(0, Number(Number::Generic), std::string());
}

class FakeMI;

// The interface this image made, for the control functions.
std::mutex gLock;
FakeMI* gInstance = nullptr;

class FakeMI : public IC::ManagementInterface {
public:
    Error getMap(std::vector<Node*>& nodes) override
    {
        std::lock_guard<std::mutex> g(m_);
        for (auto const& n : nodes_)
            nodes.push_back(n.get());
        return ok();
    }

    Error Initialize(unsigned int base, Number, Number) override
    {
        std::lock_guard<std::mutex> g(m_);
        base_ = base;
        Node* root = add(Node::ROOT, FAKEHW_ROOT_INSTANCE, 1, 0, "Fake server");
        Node* chassis = add(Node::Chassis, 0, 2, 1, "Fake chassis");
        chassis->setProperty("vendor", "Acme");
        chassis->setProperty("model", "FX-1");
        Node* cpu = add(Node::CPU, 0, 3, 2, "Fake CPU 0");
        cpu->setProperty("model", "Fake 9000");
        Node* temp = add(Node::TemperatureSensor, 0, 4, 3, "CPU temperature");
        temp->setProperty("reading", "45", "C");
        temp->setProperty("upper_warning", "80", "C");
        temp->setProperty("upper_critical", "95", "C");
        temp->setProperty("state", "ok");
        Node* fan = add(Node::Fan, 1, 5, 2, "System fan 1");
        fan->setProperty("reading", "1200", "RPM");
        fan->setProperty("state", "ok");
        Node* port = add(Node::NetworkPort, 0, 6, 2, "eth0");
        port->setProperty("state", "up");
        (void)root;
        return ok();
    }

    Error registerForAlerts(IC::AlertCallBack callback, void const* context) override
    {
        {
            std::lock_guard<std::mutex> g(m_);
            alert_ = callback;
            alertContext_ = context;
        }
        char const* every = std::getenv("FAKEHW_PULSE_MS");
        char const* hold = std::getenv("FAKEHW_PULSE_HOLD");
        if (every && *every && !thread_.joinable()) {
            unsigned long const period = std::strtoul(every, nullptr, 10);
            bool const keep = hold && *hold == '1';
            thread_ = std::thread([this, period, keep] { pulse(period, keep); });
        }
        std::lock_guard<std::mutex> g(gLock);
        gInstance = this;
        return ok();
    }

    void registerNodeCallBacks(IC::NodeArrivalCallBack arrival, void const* context,
                               IC::NodeLookupCallBack) override
    {
        std::lock_guard<std::mutex> g(m_);
        arrival_ = arrival;
        arrivalContext_ = context;
    }

    Error shutdown() override
    {
        stopThread();
        return ok();
    }

    void release() override
    {
        stopThread();
        {
            std::lock_guard<std::mutex> g(gLock);
            if (gInstance == this)
                gInstance = nullptr;
        }
        // The library's node store keeps plain pointers: say that the nodes
        // are gone before they are deleted.
        std::vector<std::string> paths;
        {
            std::lock_guard<std::mutex> g(m_);
            for (auto const& n : nodes_)
                if (!n->getPath().empty())
                    paths.push_back(n->getPath());
        }
        if (!paths.empty())
            send(Alert(0, Alert::NodeRemoval, paths, 1, "fakehw: unloaded"));
        delete this;
    }

    // ---- control ----

    int raise(unsigned int type, unsigned int instance, unsigned char severity, unsigned int cls,
              unsigned int status, std::string const& message)
    {
        std::string path;
        {
            std::lock_guard<std::mutex> g(m_);
            Node* n = find(type, instance);
            if (!n)
                return 1;
            path = n->getPath();
            if (cls == 5 && type == Node::TemperatureSensor)
                n->setProperty("state", status == 1 ? "ok" : status == 2 ? "warning" : "critical");
        }
        return send(Alert(severity, static_cast<Alert::ClassType>(cls),
                          std::vector<std::string>{path}, status, message))
                   ? 0
                   : 2;
    }

    int addNode(unsigned int type, unsigned int instance, unsigned int parentType,
                unsigned int parentInstance, std::string const& description)
    {
        IC::NodeArrivalCallBack arrival = nullptr;
        void const* context = nullptr;
        Node* n = nullptr;
        {
            std::lock_guard<std::mutex> g(m_);
            Node* parent = find(parentType, parentInstance);
            if (!parent || !arrival_)
                return 1;
            n = add(static_cast<Node::SensorType>(type), instance, ++lastLocalId_,
                    parent->getNodeId() & 0xFFFFu, description);
            arrival = arrival_;
            context = arrivalContext_;
        }
        return arrival(n, context).getStatus() == 0 ? 0 : 2;
    }

    int removeNode(unsigned int type, unsigned int instance, unsigned int status)
    {
        std::unique_ptr<Node> gone;
        {
            std::lock_guard<std::mutex> g(m_);
            for (auto it = nodes_.begin(); it != nodes_.end(); ++it) {
                if ((*it)->getSensor() == type && (*it)->getInstance() == instance) {
                    gone = std::move(*it);
                    nodes_.erase(it);
                    break;
                }
            }
        }
        if (!gone)
            return 1;
        bool const sent = send(Alert(1, Alert::NodeRemoval,
                                     std::vector<std::string>{gone->getPath()}, status,
                                     gone->getDescription() + " removed"));
        return sent ? 0 : 2;
    }

    std::string pathOf(unsigned int type, unsigned int instance)
    {
        std::lock_guard<std::mutex> g(m_);
        Node* n = find(type, instance);
        return n ? n->getPath() : std::string();
    }

private:
    ~FakeMI() override = default;

    Node* add(Node::SensorType type, unsigned int instance, unsigned int localId,
              unsigned int localParent, std::string const& description)
    {
        lastLocalId_ = localId > lastLocalId_ ? localId : lastLocalId_;
        unsigned int const id = base_ | localId;
        unsigned int const parent = localParent == 0 ? 0 : (base_ | localParent);
        nodes_.push_back(std::make_unique<Node>(type, instance, id, parent, description, id));
        return nodes_.back().get();
    }

    Node* find(unsigned int type, unsigned int instance)
    {
        for (auto const& n : nodes_)
            if (n->getSensor() == type && n->getInstance() == instance)
                return n.get();
        return nullptr;
    }

    bool send(Alert const& alert)
    {
        IC::AlertCallBack callback = nullptr;
        void const* context = nullptr;
        {
            std::lock_guard<std::mutex> g(m_);
            callback = alert_;
            context = alertContext_;
        }
        if (!callback)
            return false;
        callback(std::vector<Alert>{alert}, context);
        return true;
    }

    void pulse(unsigned long periodMs, bool keep)
    {
        bool critical = false;
        for (;;) {
            {
                std::unique_lock<std::mutex> g(m_);
                if (wake_.wait_for(g, std::chrono::milliseconds(periodMs), [this] { return stop_; }))
                    return;
            }
            if (keep && critical)
                continue;
            critical = !critical;
            {
                std::lock_guard<std::mutex> g(m_);
                if (Node* t = find(Node::TemperatureSensor, 0))
                    t->setProperty("reading", critical ? "97" : "45", "C");
            }
            if (critical)
                raise(Node::TemperatureSensor, 0, 2, 5, 3, "CPU temperature 97 C above 95 C");
            else
                raise(Node::TemperatureSensor, 0, 0, 5, 1, "CPU temperature back to 45 C");
        }
    }

    void stopThread()
    {
        {
            std::lock_guard<std::mutex> g(m_);
            stop_ = true;
        }
        wake_.notify_all();
        if (thread_.joinable())
            thread_.join();
    }

    std::mutex m_;
    std::condition_variable wake_;
    bool stop_ = false;
    std::thread thread_;
    unsigned int base_ = 0;
    unsigned int lastLocalId_ = 0;
    std::vector<std::unique_ptr<Node>> nodes_;
    IC::AlertCallBack alert_ = nullptr;
    void const* alertContext_ = nullptr;
    IC::NodeArrivalCallBack arrival_ = nullptr;
    void const* arrivalContext_ = nullptr;
};

template <class F>
int withInstance(F f)
{
    // Held while the call runs, so that release() cannot end the interface
    // under it.
    std::lock_guard<std::mutex> g(gLock);
    if (!gInstance)
        return -1;
    return f(*gInstance);
}

Error goodError(0, Number(Number::Generic), std::string());
Error badError(1, Number(7u), "fakehw: refused");

} // namespace

FAKEHW_API unsigned char OpenMI(IC::ManagementInterface** mi, IC::Error** err)
{
#ifdef FAKEHW_BROKEN
    *mi = nullptr;
    *err = &badError;
    return 1;
#else
    *mi = new FakeMI();
    *err = &goodError;
    return 0;
#endif
}

// Raises one alert on the node (type, instance). 0 sent, 1 no such node,
// 2 no alert callback, -1 no interface.
FAKEHW_API int fakehw_raise(unsigned int type, unsigned int instance, unsigned char severity,
                            unsigned int cls, unsigned int status, char const* message)
{
    return withInstance([&](FakeMI& mi) {
        return mi.raise(type, instance, severity, cls, status, message ? message : "");
    });
}

// Reports a new node below (parentType, parentInstance) through the arrival
// callback.
FAKEHW_API int fakehw_add_node(unsigned int type, unsigned int instance, unsigned int parentType,
                               unsigned int parentInstance, char const* description)
{
    return withInstance([&](FakeMI& mi) {
        return mi.addNode(type, instance, parentType, parentInstance,
                          description ? description : "");
    });
}

// Raises the removal (class 4, with the given status) of a node and drops it.
FAKEHW_API int fakehw_remove_node(unsigned int type, unsigned int instance, unsigned int status)
{
    return withInstance([&](FakeMI& mi) { return mi.removeNode(type, instance, status); });
}

// Copies the node's binary path to out (at most size bytes); its length, or
// -1 when there is no such node.
FAKEHW_API int fakehw_path(unsigned int type, unsigned int instance, char* out, int size)
{
    return withInstance([&](FakeMI& mi) {
        std::string const p = mi.pathOf(type, instance);
        if (p.empty())
            return -1;
        int const n = static_cast<int>(p.size()) < size ? static_cast<int>(p.size()) : size;
        p.copy(out, static_cast<std::size_t>(n));
        return static_cast<int>(p.size());
    });
}
