// A functional plug-in for the loader tests, built once per behaviour:
// IC_TEST_NAME names it, IC_TEST_INSTANCE keeps its nodes' paths apart from
// the other builds' and IC_TEST_MODE picks what it does.
#include "Probe.h"

#include <IC/Error.h>
#include <IC/FunctionalPlugIn.h>
#include <IC/ICforFP.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <mutex>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#define MODE_ANNOUNCE 0 // announces its nodes through MapNewFPNode when initialised
#define MODE_GOOD 1     // hands its nodes out through getMap only
#define MODE_RELAY 2    // re-raises the alerts of management interfaces
#define MODE_UPDATE_FAILS 3
#define MODE_GETMAP_FAILS 4
#define MODE_NO_ENTRY 5
#define MODE_CODE 6
#define MODE_NULL_ERROR 7
#define MODE_ERROR_STATUS 8
#define MODE_NULL_OBJECT 9
#define MODE_INIT_FAILS 10
#define MODE_THROW_INIT 11
#define MODE_THROW_INT 12

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

class TestFP;

struct Image {
    Image() { ictestprobe::imageLoaded(kName); }
    ~Image();
    std::mutex m;
    std::set<TestFP*> live;
} image;

class TestFP : public IC::FunctionalPlugIn {
public:
    TestFP()
    {
        ictestprobe::fpCreated(kName, this);
        std::lock_guard<std::mutex> g(image.m);
        image.live.insert(this);
    }

    Error getMap(std::vector<Node*>& nodes) override
    {
        ictestprobe::record(kName + ":getMap");
#if IC_TEST_MODE == MODE_GETMAP_FAILS
        return Error(1, Number(12u), "fp map refused");
#endif
        nodes.insert(nodes.end(), nodes_.begin(), nodes_.end());
        return ok();
    }

    Error Initialize(unsigned int base, IC::ICforFP const& services) override
    {
        ictestprobe::record(kName + ":Initialize base=" + std::to_string(base));
#if IC_TEST_MODE == MODE_INIT_FAILS
        return Error(1, Number(5u), "fp init refused");
#elif IC_TEST_MODE == MODE_THROW_INIT
        throw std::runtime_error("fp init exploded");
#endif
        nodes_ = {
            ictestprobe::makeNode(Node::Fan, 50 + kInstance, base | 1, 0, kName + " fan",
                                  1000 + kInstance * 10 + 1),
            ictestprobe::makeNode(Node::PowerSupply, 50 + kInstance, base | 2, 0, kName + " psu",
                                  1000 + kInstance * 10 + 2),
        };
        ictestprobe::fpInitialized(this, base, services, nodes_);
#if IC_TEST_MODE == MODE_ANNOUNCE
        for (Node* n : nodes_) {
            Error const e = services.getMapNewFPNode()(n);
            ictestprobe::record(kName + ":announced status=" + std::to_string(e.getStatus()));
        }
#elif IC_TEST_MODE == MODE_RELAY
        deRegister_ = services.getDeRegFPsensorAlerts();
        relay_ = ictestprobe::relayOpen(kName, services.getAlertCallBackFP());
        for (Node::SensorType s : {Node::CPU, Node::Fan}) {
            Error const e = services.getRegFPsensorAlerts()(&ictestprobe::relayAlerts, s, relay_);
            ictestprobe::record(kName + ":registered sensor=" + std::to_string(s) +
                                " status=" + std::to_string(e.getStatus()));
        }
#endif
        return ok();
    }

    Error updatedMis(std::vector<IC::ManagementInterface*> const& added,
                     std::vector<IC::ManagementInterface*> const& removed) override
    {
        ictestprobe::record(kName + ":updatedMis added=" + std::to_string(added.size()) +
                            " removed=" + std::to_string(removed.size()));
        ictestprobe::fpUpdated(this, added, removed);
#if IC_TEST_MODE == MODE_UPDATE_FAILS
        return Error(1, Number(11u), "fp update refused");
#endif
        return ok();
    }

    void release() override
    {
        ictestprobe::record(kName + ":release");
        if (relay_ != nullptr) {
            for (Node::SensorType s : {Node::CPU, Node::Fan})
                deRegister_(&ictestprobe::relayAlerts, s, relay_);
            ictestprobe::relayClose(relay_);
        }
        ictestprobe::fpReleased(this);
        {
            std::lock_guard<std::mutex> g(image.m);
            image.live.erase(this);
        }
        delete this;
    }

private:
    std::vector<Node*> nodes_;
    void const* relay_ = nullptr;
    IC::SensorAlertRegistration deRegister_ = nullptr;
};

Image::~Image()
{
    for (TestFP* fp : live)
        delete fp;
    live.clear();
    ictestprobe::imageUnloaded(kName);
}

Error goodError(0, Number(Number::Generic), "");
Error badError(1, Number(8u), "fp refused");

} // namespace

#if IC_TEST_MODE != MODE_NO_ENTRY
extern "C" __attribute__((visibility("default"))) unsigned char OpenFP(IC::FunctionalPlugIn** fp,
                                                                        IC::Error** err)
{
    ictestprobe::record(kName + ":OpenFP");
#if IC_TEST_MODE == MODE_CODE
    (void)fp;
    (void)err;
    return 'X';
#elif IC_TEST_MODE == MODE_NULL_ERROR
    *fp = new TestFP;
    (void)err;
    return 0;
#elif IC_TEST_MODE == MODE_ERROR_STATUS
    *fp = new TestFP;
    *err = &badError;
    return 0;
#elif IC_TEST_MODE == MODE_NULL_OBJECT
    *err = &goodError;
    (void)fp;
    return 0;
#elif IC_TEST_MODE == MODE_THROW_INT
    (void)fp;
    (void)err;
    throw 42;
#else
    *fp = new TestFP;
    *err = &goodError;
    return 0;
#endif
}
#else
extern "C" __attribute__((visibility("default"))) unsigned char OpenSomethingElse()
{
    return 0;
}
#endif
