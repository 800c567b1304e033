// A management-interface plug-in for the loader tests, built once per
// behaviour (see TestPlugin.h). IC_TEST_INSTANCE is also the instance of its
// ROOT node, so that several of them own distinct paths.
#include "TestPlugin.h"

#include <IC/ManagementInterface.h>
#include <IC/Node.h>

#include <chrono>
#include <condition_variable>
#include <thread>
#include <vector>

namespace {

using IC::Error;
using IC::Node;
using IC::Number;
using ictestprobe::MIRecord;

class TestMI;
Image<TestMI> image;

class TestMI : public IC::ManagementInterface {
public:
    TestMI()
    {
        ictestprobe::created(true, kName, this);
        image.add(this);
    }
    ~TestMI() override { stopThread(); }

    Error getMap(std::vector<Node*>& nodes) override
    {
        ictestprobe::record(kName + ":getMap");
        if (kMode == MODE_GETMAP_FAILS)
            return Error(1, Number(9u), "mi map refused");
        if (kMode == MODE_GETMAP_THROWS)
            throw std::runtime_error("map exploded");
        nodes.insert(nodes.end(), nodes_.begin(), nodes_.end());
        return ok();
    }

    Error Initialize(unsigned int base, Number interfaceVersion, Number moduleVersion) override
    {
        ictestprobe::record(kName + ":Initialize base=" + std::to_string(base) +
                            " iv=" + interfaceVersion.toString() + " mv=" + moduleVersion.toString());
        if (kMode == MODE_SLOW) {
            // Long enough for a test to act while the load is under way.
            std::this_thread::sleep_for(std::chrono::milliseconds(1500));
            ictestprobe::record(kName + ":Initialize slept");
        }
        if (kMode == MODE_INIT_FAILS)
            return Error(1, Number(3u), "mi init refused");
        if (kMode == MODE_THROW_INIT)
            throw std::runtime_error("init exploded");
        if (kMode == MODE_THROW_INT)
            throw 42;
        base_ = base;
        // ROOT <- Chassis <- CPU 1 <- Temperature Sensor 13, ids 1 to 4.
        Node::SensorType const types[] = {Node::ROOT, Node::Chassis, Node::CPU, Node::TemperatureSensor};
        char const* const names[] = {" root", " chassis", " cpu", " temperature"};
        unsigned int const instances[] = {kInstance, 0, 1, 13};
        for (unsigned int i = 0; i < 4; ++i)
            nodes_.push_back(ictestprobe::makeNode(types[i], instances[i], base | (i + 1), i == 0 ? 0 : base | i,
                                                   kName + names[i], base | (i + 1)));
        ictestprobe::updateMI(this, [&](MIRecord& r) {
            r.base = base;
            r.nodes = nodes_;
        });
        return ok();
    }

    Error registerForAlerts(IC::AlertCallBack callback, void const* context) override
    {
        ictestprobe::record(kName + ":registerForAlerts");
        if (kMode == MODE_REG_FAILS)
            return Error(1, Number(4u), "mi alerts refused");
        alert_ = callback;
        alertContext_ = context;
        ictestprobe::updateMI(this, [&](MIRecord& r) {
            r.alert = callback;
            r.alertContext = context;
        });
        if (kMode == MODE_THREAD && !thread_.joinable())
            thread_ = std::thread([this] { loop(); });
        return ok();
    }

    void registerNodeCallBacks(IC::NodeArrivalCallBack arrival, void const* context,
                               IC::NodeLookupCallBack lookup) override
    {
        ictestprobe::record(kName + ":registerNodeCallBacks");
        arrival_ = arrival;
        arrivalContext_ = context;
        ictestprobe::updateMI(this, [&](MIRecord& r) {
            r.arrival = arrival;
            r.arrivalContext = context;
            r.lookup = lookup;
        });
    }

    Error shutdown() override
    {
        ictestprobe::record(kName + ":shutdown");
        ictestprobe::updateMI(this, [](MIRecord& r) { r.shutdown = true; });
        stopThread();
        return ok();
    }

    void release() override
    {
        ictestprobe::record(kName + ":release");
        // A reload releases without shutdown(): the thread must end here too,
        // before the library is closed under it.
        stopThread();
        ictestprobe::updateMI(this, [](MIRecord& r) { r.released = true; });
        image.remove(this);
        delete this;
    }

private:
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

    void raise(IC::Alert::ClassType cls, std::string const& path, unsigned int status, std::string const& message)
    {
        unsigned char const severity = cls == IC::Alert::NodeRemoval ? 1 : 2;
        alert_({IC::Alert(severity, cls, {path}, status, kName + message)}, alertContext_);
    }

    // The interface's own thread: reports further nodes and raises alerts on
    // them, as the probe's plan says, until shutdown() or release().
    void loop()
    {
        ictestprobe::updateMI(this, [](MIRecord& r) { r.threadRunning = true; });
        std::vector<Node*> mine; // reported and accepted, so their paths are set
        for (unsigned int turn = 1;; ++turn) {
            ictestprobe::ThreadPlan const plan = ictestprobe::threadPlan();
            {
                std::unique_lock<std::mutex> g(m_);
                if (wake_.wait_for(g, std::chrono::milliseconds(plan.periodMs), [this] { return stop_; }))
                    break;
            }
            if (plan.nodes && arrival_ != nullptr && mine.size() < 12) {
                unsigned int const id = base_ | (0x100 + static_cast<unsigned int>(mine.size()));
                Node* fan = ictestprobe::makeNode(Node::Fan, id & 0xFF, id, base_ | 2, kName + " fan", id);
                if (arrival_(fan, arrivalContext_).getStatus() == 0)
                    mine.push_back(fan);
            }
            if (plan.alerts && alert_ != nullptr && !mine.empty())
                raise(static_cast<IC::Alert::ClassType>(2), mine[turn % mine.size()]->getPath(),
                      turn % 2 == 0 ? 1u : 2u, " thread alert");
            if (plan.removals && alert_ != nullptr && mine.size() > 4 && turn % 7 == 0) {
                std::string const gone = mine.back()->getPath();
                mine.pop_back();
                raise(IC::Alert::NodeRemoval, gone, 2u, " fan gone");
            }
        }
        ictestprobe::updateMI(this, [](MIRecord& r) { r.threadRunning = false; });
        ictestprobe::record(kName + ":thread ended");
    }

    unsigned int base_ = 0;
    std::vector<Node*> nodes_;
    IC::AlertCallBack alert_ = nullptr;
    void const* alertContext_ = nullptr;
    IC::NodeArrivalCallBack arrival_ = nullptr;
    void const* arrivalContext_ = nullptr;
    std::mutex m_;
    std::condition_variable wake_;
    bool stop_ = false;
    std::thread thread_;
};

} // namespace

#ifndef IC_TEST_NO_ENTRY
extern "C" __attribute__((visibility("default"))) unsigned char OpenMI(IC::ManagementInterface** mi,
                                                                        IC::Error** err)
{
    return open<TestMI>("OpenMI", mi, err, 7);
}
#else
// Exports something, just not the entry symbol.
extern "C" __attribute__((visibility("default"))) unsigned char OpenSomethingElse()
{
    return 0;
}
#endif
