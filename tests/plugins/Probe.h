// The probe: a shared library that the test plug-ins and the test programs
// both link to, so that they see one instance of it. Plug-ins report here what
// the loader did to them, in order; tests read that record, fetch the
// callbacks and services a plug-in received, and steer the threaded
// management interface.
#pragma once

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/ICforFP.h>
#include <IC/ManagementInterface.h>
#include <IC/Node.h>

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace ictestprobe {

// ---- the event record ----
// Appends "<event>" and, when a log listener is set, logs it (logger
// "ictest.probe", level 2000) so that it lines up with the library's lines.
void record(std::string const& event);
std::vector<std::string> events();
std::size_t count(std::string const& event);
// Events that start with prefix, in order.
std::vector<std::string> eventsWithPrefix(std::string const& prefix);
// Waits (at most timeoutMs) until event has been recorded at least n times.
bool waitFor(std::string const& event, int timeoutMs, std::size_t n = 1);
// Forgets events, plug-in records, relayed alerts and the thread plan. Nodes
// stay alive: the library's node store may still point at them.
void reset();

// ---- plug-in images ----
// Called from a static object of every plug-in library: counts the images
// that are mapped now and records "<name>:image loaded" / "...unloaded".
void imageLoaded(std::string const& name);
void imageUnloaded(std::string const& name);
int liveImages();

// ---- nodes ----
// Nodes are kept here until the process ends, because the node store keeps
// plain pointers that outlive the plug-in which reported them.
IC::Node* makeNode(IC::Node::SensorType type, unsigned int instance, unsigned int nodeId,
                   unsigned int linkedId, std::string const& description,
                   unsigned int nodeNumber = 0);

// ---- what the plug-ins were given ----
struct MIRecord {
    std::string name;
    void const* object = nullptr;
    unsigned int base = 0;
    IC::NodeArrivalCallBack arrival = nullptr;
    void const* arrivalContext = nullptr;
    IC::NodeLookupCallBack lookup = nullptr;
    IC::AlertCallBack alert = nullptr;
    void const* alertContext = nullptr;
    // ROOT, Chassis, CPU, Temperature Sensor, as getMap reports them.
    std::vector<IC::Node*> nodes;
    bool shutdown = false;
    bool released = false;
    bool threadRunning = false;
};
struct FPRecord {
    std::string name;
    void const* object = nullptr;
    unsigned int base = 0;
    std::shared_ptr<IC::ICforFP const> services;
    std::vector<IC::Node*> nodes;
    std::vector<IC::ManagementInterface*> lastAdded;
    std::vector<IC::ManagementInterface*> lastRemoved;
    int updates = 0;
    bool released = false;
};
// A new record for the object; then changes to the newest unreleased record
// of the object, made under the probe's lock.
void created(bool mi, std::string const& name, void const* object);
void updateMI(void const* object, std::function<void(MIRecord&)> const& change);
void updateFP(void const* object, std::function<void(FPRecord&)> const& change);
// A copy made here, so that a record outlives the image of its plug-in.
std::shared_ptr<IC::ICforFP const> copyServices(IC::ICforFP const& services);
// The newest record of that name not yet released.
bool findMI(std::string const& name, MIRecord* out);
bool findFP(std::string const& name, FPRecord* out);
std::vector<MIRecord> mis();
std::vector<FPRecord> fps();

// What the threaded management interface does on each turn of its thread.
struct ThreadPlan {
    bool alerts = false;   // raise an alert on its CPU node
    bool nodes = false;    // report a further node through the arrival callback
    bool removals = false; // now and then a class-4 alert for a node it reported
    int periodMs = 20;
};
void setThreadPlan(ThreadPlan const& plan);
ThreadPlan threadPlan();

// ---- the relay of a functional plug-in ----
// A relaying plug-in registers relayAlerts with the context relayOpen gave
// it: the callback lives here, not in the plug-in, so that a dispatch that is
// still under way when the plug-in's library goes away does not jump into
// unmapped code. Alerts received are recorded and re-raised through sink with
// the message prefixed by "relayed "; alerts that already carry the prefix
// are the relay's own and are not raised again.
void const* relayOpen(std::string const& name, IC::AlertSink sink);
void relayClose(void const* context);
IC::Error relayAlerts(std::vector<IC::Alert> const& alerts, void const* context);
// Alerts the relays received (not their own), in order.
std::vector<IC::Alert> relayReceived();

} // namespace ictestprobe
