// IpmiMI: the management interface that reports the server's BMC over IPMI:
// the local BMC in-band through /dev/ipmi0 (FreeIPMI's OpenIPMI driver) and
// the out-of-band BMCs of IC_IPMI_CONFIG (IPMI LAN 2.0). See README.md
// beside this file for the tree, the sensor-type mapping and the alerts.
//
// Threads: one reading thread per BMC polls it every IC_IPMI_POLL_MS
// (default 10000) milliseconds, so that BMCs are read in parallel and one
// that does not answer holds up no other. They start in Initialize, which
// waits at most kOpenWaitMs for their first passes, so a BMC that does not
// answer delays Open by at most that long; what is read later arrives
// through the library's arrival callback. The plug-in's state is kept under
// a mutex that is never held while calling the library.
#pragma once

#include "BmcReader.h"
#include "KnownPathNode.h"

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/ManagementInterface.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

namespace ipmi {

class IpmiMI : public IC::ManagementInterface {
public:
    static constexpr int kOpenWaitMs = 5000;

    IpmiMI();
    ~IpmiMI() override;

    IC::Error getMap(std::vector<IC::Node*>& nodes) override;
    IC::Error Initialize(unsigned int nodeIdBase, IC::Number interfaceVersion,
                         IC::Number moduleVersion) override;
    IC::Error registerForAlerts(IC::AlertCallBack callback, void const* context) override;
    void registerNodeCallBacks(IC::NodeArrivalCallBack arrival, void const* context,
                               IC::NodeLookupCallBack lookup) override;
    IC::Error shutdown() override;
    void release() override;

private:
    using Node = shipped::KnownPathNode;

    // A node and the condition asserted on it (status 1: none).
    struct Tracked {
        Node* node = nullptr;
        unsigned int raised = 1;
        std::string message;
        std::string state;
    };

    struct Bmc {
        std::unique_ptr<BmcReader> reader;
        std::string label;         // "BMC rack12-node3 (10.1.2.3:623)" or "in-band BMC"
        Node* chassis = nullptr;   // its own chassis (out-of-band), else null
        unsigned int parentId = 0; // where its nodes hang
        Tracked bmcNode;
        std::map<std::string, Tracked> sensors; // by identity
        std::map<std::pair<unsigned int, unsigned int>, Node*> entities; // by (entity id, instance)
        std::set<std::tuple<unsigned int, unsigned int, unsigned int>> instances; // (parent, type, instance) taken
        bool inventoryShown = false;
        bool reachable = true;
        unsigned int failures = 0;
        std::chrono::steady_clock::time_point nextTry{};
        std::thread thread; // polls this BMC alone
    };

    struct Outbox {
        std::vector<IC::Alert> removals; // told first
        std::vector<Node*> arrivals;
        std::vector<IC::Alert> alerts;
    };

    void run(Bmc& b);
    void readBmc(Bmc& b, Outbox& out);
    Node* entityNode(Bmc& b, unsigned int entityId, unsigned int entityInstance, Outbox& out);
    unsigned int claimInstance(Bmc& b, unsigned int parent, IC::Node::SensorType type, unsigned int wanted);
    void judge(Tracked& t, std::string const& state, std::string const& message, Outbox& out);
    Node* newNode(IC::Node::SensorType type, unsigned int instance, unsigned int parent, std::string const& desc);
    void rehome(Outbox& out);
    void deliver(Outbox& out);
    void stop();

    std::mutex lock_; // guards everything below
    std::condition_variable wake_;
    unsigned int base_ = 0;
    unsigned int nextNumber_ = 1;
    unsigned int pollMs_ = 10000;
    bool initialized_ = false;
    bool mapped_ = false;  // getMap has handed the nodes over: later ones are arrivals
    bool stopping_ = false;
    std::size_t firstPasses_ = 0; // BMCs through their first pass
    unsigned int ownRootId_ = 0; // the shared ROOT when we report it
    // The ROOT and Chassis another plug-in reports, when adopted (0: ours).
    unsigned int adoptedRootId_ = 0;
    unsigned int adoptedChassisId_ = 0;
    unsigned int chassisId_ = 0; // Chassis 0, adopted or ours
    std::vector<Node*> order_; // nodes in the order made: parents first
    std::vector<std::unique_ptr<Node>> nodes_;
    std::vector<std::unique_ptr<Bmc>> bmcs_;
    IC::AlertCallBack alertCB_ = nullptr;
    void const* alertContext_ = nullptr;
    IC::NodeArrivalCallBack arrivalCB_ = nullptr;
    void const* arrivalContext_ = nullptr;
    IC::NodeLookupCallBack lookup_ = nullptr;
};

} // namespace ipmi
