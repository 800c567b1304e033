// Alert registrations: IC::AlertRegister gathers every filter (alert
// classes, sensor types, node paths) registered for one (callback, context)
// pair; IC::AlertCall is one pending delivery; IC::SimpleAlertRegister is one
// slot of the simple-alert subscriptions.
//
// Registers are owned by the library and touched only under
// IC::InstCtrl::registerlock.
#pragma once

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/Export.h>
#include <IC/Node.h>
#include <SD/DateTime.h>

#include <cstddef>
#include <cstdint>
#include <set>
#include <string>
#include <vector>

namespace IC {

class AlertStore;
class NodeStore;

// Where a batch of alerts comes from. Client registers never receive
// management-interface batches, and only functional plug-in batches update
// the alert store.
enum MyAlertType : std::uint32_t { FP_ALERT = 0, MI_ALERT = 1 };

// Who registered.
enum MyRegType : std::uint32_t { FP_REGISTRATION = 0, CLIENT_REGISTRATION = 1 };

// The simple-alert callback: event code (0 other, 1 class 5, 2 node arrival),
// the alert's time stamp, one of its node paths, and the client's context.
using SimpleAlertCallBack = void (*)(unsigned int code, SD::DateTime time, std::string path,
                                     void const* context);

// What a dispatch works out once per batch and every register reuses: the
// sensor type of each node path (74 when no node has it).
class IC_API AlertBatch {
public:
    AlertBatch(NodeStore& store, std::vector<Alert> const& alerts);

    // Sensor type of path number p of alert number a.
    Node::SensorType sensorOf(std::size_t a, std::size_t p) const { return sensors[a][p]; }

private:
    std::vector<std::vector<Node::SensorType> > sensors;
};

// One pending delivery: the alerts one register takes from a batch.
class IC_API AlertCall {
public:
    AlertCall(AlertCallBack callback, void const* context);

    // Appends a copy of alert carrying only the given paths (and a new time
    // stamp).
    void add(Alert alert, std::vector<std::string>& paths);
    // The same without copying alert first.
    void addRestricted(Alert const& alert, std::vector<std::string> paths);
    // Records the alerts in store (for the batch type), then calls the
    // callback with them.
    void callBack(AlertStore& store, unsigned int type);

    AlertCallBack getCallback() const { return callback; }
    void const* getContext() const { return context; }
    std::vector<Alert> const& getAlerts() const { return alerts; }

private:
    AlertCallBack callback;
    void const* context;
    std::vector<Alert> alerts;
};

class IC_API AlertRegister {
public:
    AlertRegister(AlertCallBack callback, void const* context, unsigned int regType);
    ~AlertRegister();
    AlertRegister(AlertRegister const&) = delete;
    AlertRegister& operator=(AlertRegister const&) = delete;

    // Adds the filter value(s); always true. The callback is not compared.
    bool add(AlertCallBack cb, Node::SensorType sensor);
    bool add(AlertCallBack cb, Alert::ClassType cls);
    bool add(AlertCallBack cb, std::vector<std::string> const& paths);

    // Removes the filter value(s). 0: the register still holds filters;
    // 1: it is now empty (and its callback cleared); 2: cb is not this
    // register's callback, nothing removed.
    unsigned char del(AlertCallBack cb, Node::SensorType sensor);
    unsigned char del(AlertCallBack cb, Alert::ClassType cls);
    unsigned char del(AlertCallBack cb, std::vector<std::string> const& paths);

    // True (and the callback cleared) when no filter is left.
    bool testClean();

    std::string hexstring(std::string const& s) const;

    // Appends to calls one delivery holding the alerts of the batch that
    // this register asked for, each restricted to the matching paths.
    // Always false.
    bool filterAlerts(NodeStore& store, std::vector<Alert> const& alerts,
                      std::vector<AlertCall>& calls, unsigned int type);
    // The same with the batch's sensor types and path index worked out
    // beforehand; what is delivered and logged is identical.
    bool filterAlerts(AlertBatch const& batch, std::vector<Alert> const& alerts,
                      std::vector<AlertCall>& calls, unsigned int type);

    AlertCallBack getCallback() const { return callback; }
    void const* getContext() const { return context; }
    unsigned int getRegType() const { return regType; }
    std::set<Alert::ClassType> const& getClasses() const { return classes; }
    std::set<Node::SensorType> const& getSensorTypes() const { return sensorTypes; }
    std::set<std::string> const& getNodePaths() const { return nodePaths; }

private:
    AlertCallBack callback;
    std::set<Alert::ClassType> classes;
    std::set<Node::SensorType> sensorTypes;
    std::set<std::string> nodePaths;
    void const* context;
    unsigned int regType;
};

// One simple-alert subscription.
struct IC_API SimpleAlertRegister {
    SimpleAlertRegister(SimpleAlertCallBack callback, std::uint16_t sensor, void const* context,
                        unsigned int index)
        : callback(callback), sensor(sensor), context(context), index(index)
    {
    }

    SimpleAlertCallBack callback;
    std::uint16_t sensor;
    void const* context;
    // The slot number, also the context of the underlying registration.
    unsigned int index;
};

} // namespace IC
