// A small management interface for the tests of the health plug-in and of
// icctl: a fixed server (ROOT, chassis, CPU with a temperature sensor, a fan,
// a network port) whose alerts a test raises.
//
// In-process tests find fakehw_raise below with dlsym on the image the
// library loaded. Tests that run icctl as a process steer it through the
// environment:
//   FAKEHW_PULSE_MS=N     every N ms the CPU temperature alternates between
//                         critical (class 5, status 3) and normal (status 1),
//                         starting with critical
//   FAKEHW_PULSE_HOLD=1   it stays critical (raised again every N ms, so
//                         that a functional plug-in loaded late sees it)
// FAKEHW_ROOT_INSTANCE (compile time) keeps two builds' paths apart;
// FAKEHW_BROKEN makes OpenMI fail.
#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/ManagementInterface.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <algorithm>
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
using IC::Node;

IC::Error ok() { return IC::Error(0, IC::Number(IC::Number::Generic), std::string()); }

class FakeMI;
// The interface this image made, for fakehw_raise.
std::mutex gLock;
FakeMI* gInstance = nullptr;

class FakeMI : public IC::ManagementInterface {
public:
    IC::Error getMap(std::vector<Node*>& nodes) override
    {
        std::lock_guard<std::mutex> g(m_);
        nodes.insert(nodes.end(), live_.begin(), live_.end());
        return ok();
    }

    IC::Error Initialize(unsigned int base, IC::Number, IC::Number) override
    {
        std::lock_guard<std::mutex> g(m_);
        base_ = base;
        add(Node::ROOT, FAKEHW_ROOT_INSTANCE, 0, "Fake server");
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
        return ok();
    }

    IC::Error registerForAlerts(IC::AlertCallBack callback, void const* context) override
    {
        alert_ = callback;
        alertContext_ = context;
        char const* every = std::getenv("FAKEHW_PULSE_MS");
        char const* hold = std::getenv("FAKEHW_PULSE_HOLD");
        if (every && *every && !thread_.joinable())
            thread_ = std::thread(&FakeMI::pulse, this, std::strtoul(every, nullptr, 10),
                                  hold && *hold == '1');
        std::lock_guard<std::mutex> g(gLock);
        gInstance = this;
        return ok();
    }

    void registerNodeCallBacks(IC::NodeArrivalCallBack, void const*, IC::NodeLookupCallBack) override {}

    IC::Error shutdown() override { return stopThread(); }

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
        for (Node* n : live_)
            if (!n->getPath().empty())
                paths.push_back(n->getPath());
        if (!paths.empty())
            alert_({Alert(0, Alert::NodeRemoval, paths, 1, "fakehw: unloaded")}, alertContext_);
        delete this;
    }

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
                live_.erase(it); // kept in owned_: the library may still hold it
        }
        alert_({Alert(severity, static_cast<Alert::ClassType>(cls), {path}, status, message)}, alertContext_);
        return 0;
    }

private:
    ~FakeMI() override = default;

    // Local ids count up from 1 in the order of creation.
    Node* add(Node::SensorType type, unsigned int instance, unsigned int localParent,
              std::string const& description)
    {
        unsigned int const id = base_ | ++lastLocalId_;
        unsigned int const parent = localParent == 0 ? 0 : (base_ | localParent);
        owned_.push_back(std::make_unique<Node>(type, instance, id, parent, description, id));
        live_.push_back(owned_.back().get());
        return live_.back();
    }

    // Every periodMs, the CPU temperature turns critical or back to normal,
    // or stays critical when kept.
    void pulse(unsigned long periodMs, bool keep)
    {
        for (bool critical = false;;) {
            {
                std::unique_lock<std::mutex> g(m_);
                if (wake_.wait_for(g, std::chrono::milliseconds(periodMs), [this] { return stop_; }))
                    return;
                critical = !critical || keep;
                owned_[3]->setProperty("reading", critical ? "97" : "45", "C"); // the sensor
            }
            raise(Node::TemperatureSensor, 0, critical ? 2 : 0, 5, critical ? 3 : 1,
                  critical ? "CPU temperature 97 C above 95 C" : "CPU temperature back to 45 C");
        }
    }

    IC::Error stopThread()
    {
        {
            std::lock_guard<std::mutex> g(m_);
            stop_ = true;
        }
        wake_.notify_all();
        if (thread_.joinable())
            thread_.join();
        return ok();
    }

    std::mutex m_;
    std::condition_variable wake_;
    bool stop_ = false;
    std::thread thread_;
    unsigned int base_ = 0;
    unsigned int lastLocalId_ = 0;
    std::vector<std::unique_ptr<Node>> owned_;
    std::vector<Node*> live_; // what getMap reports
    // Set before anything can raise alerts, fixed afterwards.
    IC::AlertCallBack alert_ = nullptr;
    void const* alertContext_ = nullptr;
};

} // namespace

FAKEHW_API unsigned char OpenMI(IC::ManagementInterface** mi, IC::Error** err)
{
    static IC::Error good(0, IC::Number(IC::Number::Generic), std::string());
    static IC::Error bad(1, IC::Number(7u), "fakehw: refused");
#ifdef FAKEHW_BROKEN
    *mi = nullptr;
    *err = &bad;
    return 1;
#else
    *mi = new FakeMI();
    *err = &good;
    return 0;
#endif
}

// Raises one alert on the node (type, instance): 0 sent, 1 no such node, -1
// no interface. A removal (class 4) also drops the node.
FAKEHW_API int fakehw_raise(unsigned int type, unsigned int instance, unsigned char severity,
                            unsigned int cls, unsigned int status, char const* message)
{
    // Held while the call runs, so that release() cannot end the interface
    // under it.
    std::lock_guard<std::mutex> g(gLock);
    return gInstance ? gInstance->raise(type, instance, severity, cls, status, message) : -1;
}
