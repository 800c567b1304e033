// A management-interface plug-in for the loader tests, built once per
// behaviour: IC_TEST_NAME names it, IC_TEST_INSTANCE sets the instance of its
// ROOT node (so that several of them own distinct paths) and IC_TEST_MODE
// picks what it does.
#include "Probe.h"

#include <IC/Error.h>
#include <IC/ManagementInterface.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#define MODE_GOOD 0
#define MODE_THREAD 1
#define MODE_SLOW 2
#define MODE_NO_ENTRY 3
#define MODE_CODE 4
#define MODE_NULL_ERROR 5
#define MODE_ERROR_STATUS 6
#define MODE_NULL_OBJECT 7
#define MODE_INIT_FAILS 8
#define MODE_REG_FAILS 9
#define MODE_GETMAP_FAILS 10
#define MODE_GETMAP_THROWS 11
#define MODE_THROW_OPEN 12
#define MODE_THROW_INIT 13
#define MODE_THROW_INT 14

#ifndef IC_TEST_MODE
#error "IC_TEST_MODE must be set"
#endif

namespace {

std::string const kName = IC_TEST_NAME;
constexpr unsigned int kInstance = IC_TEST_INSTANCE;

using IC::Error;
using IC::Node;
using IC::Number;

Error ok()
{
    return Error(0, Number(Number::Generic), "");
}

class TestMI;

// Objects the loader abandoned (it does not release an interface that failed
// half-way) are freed when the image goes; the marker reports the image.
struct Image {
    Image() { ictestprobe::imageLoaded(kName); }
    ~Image();
    std::mutex m;
    std::set<TestMI*> live;
} image;

class TestMI : public IC::ManagementInterface {
public:
    TestMI()
    {
        ictestprobe::miCreated(kName, this);
        std::lock_guard<std::mutex> g(image.m);
        image.live.insert(this);
    }
    ~TestMI() override { stopThread(); }

    Error getMap(std::vector<Node*>& nodes) override
    {
        ictestprobe::record(kName + ":getMap");
#if IC_TEST_MODE == MODE_GETMAP_FAILS
        return Error(1, Number(9u), "mi map refused");
#elif IC_TEST_MODE == MODE_GETMAP_THROWS
        throw std::runtime_error("map exploded");
#endif
        nodes.insert(nodes.end(), nodes_.begin(), nodes_.end());
        return ok();
    }

    Error Initialize(unsigned int base, Number interfaceVersion, Number moduleVersion) override
    {
        ictestprobe::record(kName + ":Initialize base=" + std::to_string(base) +
                            " iv=" + interfaceVersion.toString() +
                            " mv=" + moduleVersion.toString());
#if IC_TEST_MODE == MODE_SLOW
        // Long enough for a test to act while the load is under way.
        std::this_thread::sleep_for(std::chrono::milliseconds(1500));
        ictestprobe::record(kName + ":Initialize slept");
#elif IC_TEST_MODE == MODE_INIT_FAILS
        return Error(1, Number(3u), "mi init refused");
#elif IC_TEST_MODE == MODE_THROW_INIT
        throw std::runtime_error("init exploded");
#elif IC_TEST_MODE == MODE_THROW_INT
        throw 42;
#endif
        base_ = base;
        Node* root = ictestprobe::makeNode(Node::ROOT, kInstance, base | 1, 0, kName + " root",
                                           base | 1);
        Node* chassis = ictestprobe::makeNode(Node::Chassis, 0, base | 2, base | 1,
                                              kName + " chassis", base | 2);
        Node* cpu = ictestprobe::makeNode(Node::CPU, 1, base | 3, base | 2, kName + " cpu",
                                          base | 3);
        Node* temp = ictestprobe::makeNode(Node::TemperatureSensor, 13, base | 4, base | 3,
                                           kName + " temperature", base | 4);
        nodes_ = {root, chassis, cpu, temp};
        ictestprobe::miInitialized(this, base, nodes_);
        return ok();
    }

    Error registerForAlerts(IC::AlertCallBack callback, void const* context) override
    {
        ictestprobe::record(kName + ":registerForAlerts");
#if IC_TEST_MODE == MODE_REG_FAILS
        return Error(1, Number(4u), "mi alerts refused");
#endif
        alert_ = callback;
        alertContext_ = context;
        ictestprobe::miAlerts(this, callback, context);
#if IC_TEST_MODE == MODE_THREAD
        if (!thread_.joinable())
            thread_ = std::thread([this] { loop(); });
#endif
        return ok();
    }

    void registerNodeCallBacks(IC::NodeArrivalCallBack arrival, void const* context,
                               IC::NodeLookupCallBack lookup) override
    {
        ictestprobe::record(kName + ":registerNodeCallBacks");
        arrival_ = arrival;
        arrivalContext_ = context;
        ictestprobe::miNodeCallBacks(this, arrival, context, lookup);
    }

    Error shutdown() override
    {
        ictestprobe::record(kName + ":shutdown");
        ictestprobe::miShutdown(this);
        stopThread();
        return ok();
    }

    void release() override
    {
        ictestprobe::record(kName + ":release");
        // A reload releases without shutdown(): the thread must end here too,
        // before the library is closed under it.
        stopThread();
        ictestprobe::miReleased(this);
        {
            std::lock_guard<std::mutex> g(image.m);
            image.live.erase(this);
        }
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

    // The interface's own thread: reports further nodes and raises alerts on
    // them, as the probe's plan says, until shutdown() or release().
    void loop()
    {
        ictestprobe::miThread(this, true);
        std::vector<Node*> mine; // reported and accepted, so their paths are set
        unsigned int turn = 0;
        for (;;) {
            ictestprobe::ThreadPlan const plan = ictestprobe::threadPlan();
            {
                std::unique_lock<std::mutex> g(m_);
                wake_.wait_for(g, std::chrono::milliseconds(plan.periodMs), [this] { return stop_; });
                if (stop_)
                    break;
            }
            ++turn;
            if (plan.nodes && arrival_ != nullptr && mine.size() < 12) {
                unsigned int const n = static_cast<unsigned int>(mine.size());
                Node* fan = ictestprobe::makeNode(Node::Fan, n, base_ | (0x100 + n), base_ | 2,
                                                  kName + " fan", base_ | (0x100 + n));
                if (arrival_(fan, arrivalContext_).getStatus() == 0)
                    mine.push_back(fan);
            }
            if (plan.alerts && alert_ != nullptr && !mine.empty()) {
                Node* target = mine[turn % mine.size()];
                std::vector<IC::Alert> batch;
                batch.emplace_back(2, static_cast<IC::Alert::ClassType>(2),
                                   std::vector<std::string>{target->getPath()},
                                   (turn % 2 == 0) ? 1u : 2u, kName + " thread alert");
                alert_(batch, alertContext_);
            }
            if (plan.removals && alert_ != nullptr && mine.size() > 4 && turn % 7 == 0) {
                std::vector<IC::Alert> batch;
                batch.emplace_back(1, IC::Alert::NodeRemoval,
                                   std::vector<std::string>{mine.back()->getPath()}, 2u,
                                   kName + " fan gone");
                mine.pop_back();
                alert_(batch, alertContext_);
            }
        }
        ictestprobe::miThread(this, false);
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

Image::~Image()
{
    for (TestMI* mi : live)
        delete mi;
    live.clear();
    ictestprobe::imageUnloaded(kName);
}

Error goodError(0, Number(Number::Generic), "");
Error badError(1, Number(7u), "mi refused");

} // namespace

#if IC_TEST_MODE != MODE_NO_ENTRY
extern "C" __attribute__((visibility("default"))) unsigned char OpenMI(IC::ManagementInterface** mi,
                                                                        IC::Error** err)
{
    ictestprobe::record(kName + ":OpenMI");
#if IC_TEST_MODE == MODE_CODE
    (void)mi;
    (void)err;
    return 'X';
#elif IC_TEST_MODE == MODE_NULL_ERROR
    *mi = new TestMI;
    (void)err;
    return 0;
#elif IC_TEST_MODE == MODE_ERROR_STATUS
    *mi = new TestMI;
    *err = &badError;
    return 0;
#elif IC_TEST_MODE == MODE_NULL_OBJECT
    *err = &goodError;
    (void)mi;
    return 0;
#elif IC_TEST_MODE == MODE_THROW_OPEN
    (void)mi;
    (void)err;
    throw std::runtime_error("open exploded");
#else
    *mi = new TestMI;
    *err = &goodError;
    return 0;
#endif
}
#else
// Exports something, just not the entry symbol.
extern "C" __attribute__((visibility("default"))) unsigned char OpenSomethingElse()
{
    return 0;
}
#endif
