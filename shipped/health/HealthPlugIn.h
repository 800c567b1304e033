// The "health" functional plug-in: it carries the alerts of the management
// interfaces on to clients (the library delivers management-interface alerts
// to functional plug-ins only) and keeps a roll-up of the worst asserted
// condition on the chassis node. See README.md beside this file for what it
// raises.
#pragma once

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/FunctionalPlugIn.h>
#include <IC/ICforFP.h>
#include <IC/ManagementInterface.h>
#include <IC/Node.h>

#include <map>
#include <mutex>
#include <set>
#include <string>
#include <vector>

namespace IC {
class InstrumentationControl;
}

namespace health {

class HealthPlugIn : public IC::FunctionalPlugIn {
public:
    HealthPlugIn();
    ~HealthPlugIn() override;

    IC::Error getMap(std::vector<IC::Node*>& nodes) override;
    IC::Error Initialize(unsigned int nodeIdBase, IC::ICforFP const& services) override;
    IC::Error updatedMis(std::vector<IC::ManagementInterface*> const& added,
                         std::vector<IC::ManagementInterface*> const& removed) override;
    void release() override;

    // The callback registered with the library; context is the plug-in.
    static IC::Error onAlerts(std::vector<IC::Alert> const& alerts, void const* context);

private:
    // Load number of the management interface that reported a node: the upper
    // 16 bits of its node id. kNoOwner when the node is not known.
    static constexpr unsigned int kNoOwner = 0xFFFFFFFFu;

    // One asserted condition, per node path.
    struct Entry {
        IC::Alert::ClassType cls;
        unsigned char severity;
        unsigned int status;
        unsigned int owner;
        std::string message;
    };

    // What the roll-up says.
    struct Level {
        unsigned int status;
        unsigned char severity;
        bool operator==(Level const& o) const { return status == o.status && severity == o.severity; }
        bool operator!=(Level const& o) const { return !(*this == o); }
    };

    void handle(std::vector<IC::Alert> const& alerts);
    // Asserts what the nodes' own state says is wrong and nobody asserted
    // yet (conditions present before this plug-in could hear of them),
    // after taking over the asserted store when fromStore. The caller has
    // counted the look in looking_ before anything could be delivered.
    void lookAtNodes(bool fromStore);
    void publishRollup(bool force);
    Level worstLocked(std::string* worstPath, std::string* worstMessage) const;
    // The chassis node nearest the root, or else the ROOT node; "" if neither.
    void findRollupTarget(std::string* path, unsigned int* owner, bool* chassis) const;
    unsigned int ownerOf(std::string const& path) const;
    void learnOwners(IC::ManagementInterface* mi);
    IC::Error raise(std::vector<IC::Alert> const& alerts) const;
    void withdraw(std::vector<std::string> const& paths) const;
    void deregisterAll();

    // Copied from the services in Initialize(); fixed afterwards.
    IC::AlertSink raise_ = nullptr;
    IC::AlertSink assert_ = nullptr;
    IC::SensorAlertRegistration deRegister_ = nullptr;
    IC::InstrumentationControl* ic_ = nullptr;
    std::vector<IC::Node::SensorType> registered_;

    // Guards everything below. Never held while calling the library.
    mutable std::mutex lock_;
    std::map<std::string, Entry> asserted_;
    // While a look at the nodes is under way, the paths that alerts changed:
    // what they say is newer than what the look saw.
    int looking_ = 0;
    std::set<std::string> touched_;
    std::map<IC::ManagementInterface*, std::set<unsigned int>> owners_;
    // The roll-up last raised, and where.
    Level raised_{1, 0};
    std::string raisedPath_;
    // Where the next roll-up goes ("" until found), and who reported it.
    std::string rollupPath_;
    unsigned int rollupOwner_ = kNoOwner;
    bool rollupIsChassis_ = false;
    // One thread at a time raises roll-ups, so that they arrive in order.
    bool publishing_ = false;
    bool dirty_ = false;
    bool force_ = false;
};

} // namespace health
