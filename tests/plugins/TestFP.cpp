// A functional plug-in for the loader tests, built once per behaviour (see
// TestPlugin.h).
#include "TestPlugin.h"

#include <IC/FunctionalPlugIn.h>
#include <IC/ICforFP.h>
#include <IC/Node.h>

#include <vector>

namespace {

using IC::Error;
using IC::Node;
using IC::Number;
using ictestprobe::FPRecord;

class TestFP;
Image<TestFP> image;

class TestFP : public IC::FunctionalPlugIn {
public:
    TestFP()
    {
        ictestprobe::created(false, kName, this);
        image.add(this);
    }

    Error getMap(std::vector<Node*>& nodes) override
    {
        ictestprobe::record(kName + ":getMap");
        if (kMode == MODE_GETMAP_FAILS)
            return Error(1, Number(12u), "fp map refused");
        nodes.insert(nodes.end(), nodes_.begin(), nodes_.end());
        return ok();
    }

    Error Initialize(unsigned int base, IC::ICforFP const& services) override
    {
        ictestprobe::record(kName + ":Initialize base=" + std::to_string(base));
        if (kMode == MODE_INIT_FAILS)
            return Error(1, Number(5u), "fp init refused");
        if (kMode == MODE_THROW_INIT)
            throw std::runtime_error("fp init exploded");
        for (Node::SensorType type : {Node::Fan, Node::PowerSupply})
            nodes_.push_back(ictestprobe::makeNode(type, 50 + kInstance, base | (nodes_.size() + 1), 0,
                                                   kName + (type == Node::Fan ? " fan" : " psu"),
                                                   1000 + kInstance * 10 + nodes_.size() + 1));
        auto copy = ictestprobe::copyServices(services);
        ictestprobe::updateFP(this, [&](FPRecord& r) {
            r.base = base;
            r.services = copy;
            r.nodes = nodes_;
        });
        for (Node* n : nodes_)
            if (kMode == MODE_ANNOUNCE)
                ictestprobe::record(kName + ":announced status=" +
                                    std::to_string(services.getMapNewFPNode()(n).getStatus()));
        if (kMode == MODE_RELAY) {
            deRegister_ = services.getDeRegFPsensorAlerts();
            relay_ = ictestprobe::relayOpen(kName, services.getAlertCallBackFP());
            for (Node::SensorType s : {Node::CPU, Node::Fan}) {
                Error const e = services.getRegFPsensorAlerts()(&ictestprobe::relayAlerts, s, relay_);
                ictestprobe::record(kName + ":registered sensor=" + std::to_string(s) +
                                    " status=" + std::to_string(e.getStatus()));
            }
        }
        return ok();
    }

    Error updatedMis(std::vector<IC::ManagementInterface*> const& added,
                     std::vector<IC::ManagementInterface*> const& removed) override
    {
        ictestprobe::record(kName + ":updatedMis added=" + std::to_string(added.size()) +
                            " removed=" + std::to_string(removed.size()));
        ictestprobe::updateFP(this, [&](FPRecord& r) {
            r.lastAdded = added;
            r.lastRemoved = removed;
            ++r.updates;
        });
        return kMode == MODE_UPDATE_FAILS ? Error(1, Number(11u), "fp update refused") : ok();
    }

    void release() override
    {
        ictestprobe::record(kName + ":release");
        if (relay_ != nullptr) {
            for (Node::SensorType s : {Node::CPU, Node::Fan})
                deRegister_(&ictestprobe::relayAlerts, s, relay_);
            ictestprobe::relayClose(relay_);
        }
        ictestprobe::updateFP(this, [](FPRecord& r) { r.released = true; });
        image.remove(this);
        delete this;
    }

private:
    std::vector<Node*> nodes_;
    void const* relay_ = nullptr;
    IC::SensorAlertRegistration deRegister_ = nullptr;
};

} // namespace

#ifndef IC_TEST_NO_ENTRY
extern "C" __attribute__((visibility("default"))) unsigned char OpenFP(IC::FunctionalPlugIn** fp, IC::Error** err)
{
    return open<TestFP>("OpenFP", fp, err, 8);
}
#else
extern "C" __attribute__((visibility("default"))) unsigned char OpenSomethingElse()
{
    return 0;
}
#endif
