// Alert classes, severities and statuses raised by the shipped plug-ins
// (the Linux hardware and IPMI management interfaces and the health
// functional plug-in), and read by icctl. ipmi raises classes 3, 4 and 5
// as linuxhw does, for the BMC's sensors and for the BMC itself (status 3
// while it does not answer).
//
// Classes 3 and 4 have the meaning the library gives them (node arrival,
// node removal); class 5 is what simple-alert subscribers see as event 1.
//
//   class  name             raised by  meaning
//   3      node-arrival     linuxhw    a device appeared (status 1)
//   4      node-removal     linuxhw    a device disappeared; the library drops its node
//   5      threshold        linuxhw    a reading crossed a threshold or a hwmon alarm
//                                      fired (status 2 warning, 3 critical); status 1
//                                      when it is back in range
//   6      memory-errors    linuxhw    EDAC error counts of a DIMM or memory controller
//                                      grew (status 2 corrected, 3 uncorrected)
//   7      link             linuxhw    a network port lost its link (status 2); status 1
//                                      when the link is back
//   8      health-rollup    health     the worst asserted severity below the chassis, on
//                                      the chassis node (status 1 when all is well)
//   9      event-log        ipmi       a new record of a BMC's event log (SEL), on the
//                                      BMC's node, severity from FreeIPMI's reading of
//                                      the event; status 1: a record is history, it
//                                      asserts nothing
//
// Severities: 0 information, 1 warning, 2 critical, 3 fatal.
// Status: 1 normal (clears the path's asserted alert); 2 warning; 3 critical.
//
// A node also says what is wrong with it, so that a functional plug-in loaded
// after its interface can assert what was already wrong before anything could
// be registered to hear of it: while the interface has a condition asserted on
// the node, the node's `condition` property holds that alert's message and
// `condition_class` its class, and `state` is "warning" (status 2) or
// "critical" (status 3), or "unknown" while the reading cannot be taken.
#pragma once

#include <IC/Alert.h>
#include <IC/Node.h>

#include <algorithm>
#include <string>
#include <vector>

namespace shipped {

constexpr IC::Alert::ClassType kNodeArrival = IC::Alert::NodeArrival;
constexpr IC::Alert::ClassType kNodeRemoval = IC::Alert::NodeRemoval;
constexpr IC::Alert::ClassType kThreshold = static_cast<IC::Alert::ClassType>(5);
constexpr IC::Alert::ClassType kMemoryErrors = static_cast<IC::Alert::ClassType>(6);
constexpr IC::Alert::ClassType kLink = static_cast<IC::Alert::ClassType>(7);
constexpr IC::Alert::ClassType kHealthRollup = static_cast<IC::Alert::ClassType>(8);
constexpr IC::Alert::ClassType kEventLog = static_cast<IC::Alert::ClassType>(9);

constexpr unsigned char kSeverityInfo = 0;
constexpr unsigned char kSeverityWarning = 1;
constexpr unsigned char kSeverityCritical = 2;
constexpr unsigned char kSeverityFatal = 3;

constexpr unsigned int kStatusNormal = 1;
constexpr unsigned int kStatusWarning = 2;
constexpr unsigned int kStatusCritical = 3;

constexpr char const* kConditionProperty = "condition";
constexpr char const* kConditionClassProperty = "condition_class";

// The severity that goes with a status.
inline unsigned char severityOf(unsigned int status)
{
    return status == kStatusCritical  ? kSeverityCritical
           : status == kStatusWarning ? kSeverityWarning
                                      : kSeverityInfo;
}

// The alert a node's properties say its interface has asserted on it, in the
// shape the interface raised it, appended to out; false when they say
// nothing is (or the node has no path yet).
inline bool conditionOf(IC::Node const& node, std::vector<IC::Alert>& out)
{
    IC::Node::Property state, message, cls;
    if (!node.getProperty("state", &state) || !node.getProperty(kConditionProperty, &message))
        return false;
    unsigned int const status = state.value == "critical" ? kStatusCritical
                                : state.value == "warning" ? kStatusWarning
                                                           : kStatusNormal;
    std::string const path = node.getPath();
    if (status == kStatusNormal || path.empty())
        return false;
    unsigned long number = kThreshold;
    if (node.getProperty(kConditionClassProperty, &cls) && !cls.value.empty() && cls.value.size() < 4 &&
        cls.value.find_first_not_of("0123456789") == std::string::npos)
        number = std::min(std::stoul(cls.value), 255ul);
    out.emplace_back(severityOf(status), static_cast<IC::Alert::ClassType>(number), std::vector<std::string>{path},
                     status, message.value);
    return true;
}

// Shows on node the state and the condition its interface has asserted
// (status raised, class cls, message; status 1: none), changing only what
// differs.
inline void showCondition(IC::Node& node, std::string const& state, unsigned int raised,
                          IC::Alert::ClassType cls, std::string const& message)
{
    IC::Node::Property p;
    if (!node.getProperty("state", &p) || p.value != state)
        node.setProperty("state", state);
    if (raised == kStatusNormal) {
        node.removeProperty(kConditionProperty);
        node.removeProperty(kConditionClassProperty);
    } else if (!node.getProperty(kConditionProperty, &p) || p.value != message) {
        node.setProperty(kConditionProperty, message);
        node.setProperty(kConditionClassProperty, std::to_string(cls));
    }
}

// A short name of a class for people ("threshold"); "class N" for others.
inline char const* className(unsigned int cls)
{
    switch (cls) {
    case 3: return "node-arrival";
    case 4: return "node-removal";
    case 5: return "threshold";
    case 6: return "memory-errors";
    case 7: return "link";
    case 8: return "health-rollup";
    case 9: return "event-log";
    default: return nullptr;
    }
}

} // namespace shipped
