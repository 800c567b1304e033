// LinuxHwMI: the management interface that reports this machine's hardware
// from sysfs and procfs, read below the directory named by IC_SYSFS_ROOT
// (default "/"), so that tests and demos can point it at an imitation tree.
//
// Tree (instances in brackets; see README.md beside this file):
//   ROOT [0]
//   └ Chassis [0]                      DMI system: vendor, model, serial
//     ├ BIOS [0]
//     ├ CPU [package id]               └ CPU Core [core id]
//     │                                └ Temperature Sensor [input index] (coretemp)
//     ├ RAM [0]                        └ DIMM [mc << 8 | dimm]            (EDAC)
//     ├ Network Port, Hard Drive, Power Supply [16-bit digest of a name]
//     └ Temperature Sensor, Fan, Voltage Sensor [chip digest << 8 | index] (hwmon)
//       or Temperature Sensor [zone number] (thermal zones, when no hwmon)
//
// Alerts (classes of shipped/common/ShippedAlerts.h), raised by a polling
// thread every IC_LINUXHW_POLL_MS milliseconds (default 5000):
//   5 threshold      a reading beyond a limit, an hwmon alarm or fault file
//                    set, a supply without input power or reporting bad health:
//                    status 2 (severity warning) or 3 (critical); status 1
//                    (information) when it is back to normal.
//   6 memory-errors  a DIMM's EDAC counts grew: status 2 (warning) for
//                    corrected errors, 3 (critical) for uncorrected ones;
//                    status 1 when the counters were reset to zero.
//   7 link           a network port lost its carrier: status 2 (warning);
//                    status 1 (information) when it is back. Ports without
//                    link at start raise nothing.
//   4 node-removal   a device disappeared: one alert (severity warning,
//                    status 1) per removed device carrying its path and the
//                    paths of its removed children.
//   A condition present at start raises nothing: no functional plug-in is
//   loaded yet to hear it. It is on the node instead (state, condition,
//   condition_class; see shipped/common/ShippedAlerts.h), where the health
//   plug-in finds and asserts it when it starts.
//   A device that appears is handed to the library's arrival callback, which
//   raises the class-3 alert itself. When the interface is released, one
//   removal (severity information, status 1) names every node it reported,
//   so that the library drops its pointers before this library's code goes.
#pragma once

#include "Device.h"
#include "HwNode.h"
#include "SysfsReader.h"

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/ManagementInterface.h>
#include <IC/Node.h>
#include <IC/Number.h>
#include <SD/Mutex.h>

#include <map>
#include <memory>
#include <set>
#include <string>
#include <tuple>
#include <vector>

namespace linuxhw {

class LinuxHwMI : public IC::ManagementInterface {
public:
    LinuxHwMI();
    ~LinuxHwMI() override;

    IC::Error getMap(std::vector<IC::Node*>& nodes) override;
    IC::Error Initialize(unsigned int nodeIdBase, IC::Number interfaceVersion,
                         IC::Number moduleVersion) override;
    IC::Error registerForAlerts(IC::AlertCallBack callback, void const* context) override;
    void registerNodeCallBacks(IC::NodeArrivalCallBack arrival, void const* context,
                               IC::NodeLookupCallBack lookup) override;
    IC::Error shutdown() override;
    void release() override;

    // One pass of the polling thread: reads the tree again and reports what
    // changed.
    void poll();

private:
    class PollThread;

    // One device across polls, by its key.
    struct Tracked {
        Device device;          // as last seen
        HwNode* node = nullptr; // its current node; owned by nodes_
        unsigned int number = 0;
        unsigned int instance = 0;
        bool hasInstance = false;
        std::string claimParent;
        bool present = false;
        bool changing = false;  // read again by every poll, so it may go away
        // The condition asserted on the node (status 1: none), as its alert
        // said it; the node shows it in its state and condition properties.
        unsigned int raised = 1;
        IC::Alert::ClassType raisedClass = IC::Alert::NodeArrival;
        std::string raisedMessage;
    };

    // What a pass has to tell the library, sent after the lock is released.
    struct Outbox {
        std::vector<IC::Alert> removals;
        std::vector<HwNode*> arrivals;
        std::vector<IC::Alert> alerts;
        std::vector<HwNode*> troubled; // arrivals with a condition, raised once they have paths
    };

    DeviceList scanChanging();
    // Moves the devices it takes on out of found and empties those it
    // leaves out.
    void reconcile(DeviceList& found, bool changing, bool announce, Outbox& out);
    void update(Tracked& t, Device const& d, Outbox& out);
    // The condition a device has when it is first seen: what is wrong then
    // is asserted from the start, without an alert of its own.
    static void judgeAtStart(Tracked& t, Device const& d);
    // Sets t's condition and queues the alert that reports the change.
    static void raiseCondition(Tracked& t, IC::Alert::ClassType cls, unsigned int status,
                               std::string const& path, std::string const& message, Outbox& out);
    // The node's state, condition and condition_class from t.
    static void show(Tracked const& t);
    void removeMissing(std::set<std::string> const& seen, Outbox& out);
    // The adopted ROOT/Chassis went away (its plug-in was unloaded).
    void rehome(DeviceList& fixed, Outbox& out);
    // Records the ROOT and Chassis we report for the plug-ins loaded later.
    void announceOwnTop();
    unsigned int claimInstance(Tracked& t, Device const& d);
    void deliver(Outbox& out);
    void stopPolling();

    SD::Mutex lock_; // guards everything below but the callbacks and the reader
    std::unique_ptr<SysfsReader> reader_; // set in Initialize(), fixed afterwards
    std::set<unsigned int> packages_;     // the same
    unsigned int base_ = 0;
    unsigned int pollMs_ = 5000;
    bool initialized_ = false;
    unsigned int nextNumber_ = 1;
    std::map<std::string, Tracked> tracked_;
    std::vector<std::string> order_; // keys by first sight: parents before children
    // (parent key, type, instance) -> key of the device holding it
    std::map<std::tuple<std::string, unsigned int, unsigned int>, std::string> claims_;
    // Every node ever handed out: the library may hold them until release().
    std::vector<std::unique_ptr<HwNode>> nodes_;
    // Keys of ROOT and Chassis when another plug-in reports them: the id of
    // its node, set in Initialize (see shipped/common/SharedTree.h).
    std::map<std::string, unsigned int> adopted_;
    IC::NodeLookupCallBack lookup_ = nullptr;
    unsigned int ownRootId_ = 0; // the shared ROOT when we report it

    // Set before the polling thread starts, fixed afterwards.
    IC::AlertCallBack alertCB_ = nullptr;
    void const* alertContext_ = nullptr;
    IC::NodeArrivalCallBack arrivalCB_ = nullptr;
    void const* arrivalContext_ = nullptr;
    std::unique_ptr<PollThread> thread_;
};

} // namespace linuxhw
