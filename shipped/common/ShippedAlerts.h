// Alert classes, severities and statuses raised by the shipped plug-ins
// (the Linux hardware management interface and the health functional
// plug-in), and read by icctl.
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
//
// Severities: 0 information, 1 warning, 2 critical, 3 fatal.
// Status: 1 normal (clears the path's asserted alert); 2 warning; 3 critical.
#pragma once

#include <IC/Alert.h>

namespace shipped {

constexpr IC::Alert::ClassType kNodeArrival = IC::Alert::NodeArrival;
constexpr IC::Alert::ClassType kNodeRemoval = IC::Alert::NodeRemoval;
constexpr IC::Alert::ClassType kThreshold = static_cast<IC::Alert::ClassType>(5);
constexpr IC::Alert::ClassType kMemoryErrors = static_cast<IC::Alert::ClassType>(6);
constexpr IC::Alert::ClassType kLink = static_cast<IC::Alert::ClassType>(7);
constexpr IC::Alert::ClassType kHealthRollup = static_cast<IC::Alert::ClassType>(8);

constexpr unsigned char kSeverityInfo = 0;
constexpr unsigned char kSeverityWarning = 1;
constexpr unsigned char kSeverityCritical = 2;
constexpr unsigned char kSeverityFatal = 3;

constexpr unsigned int kStatusNormal = 1;
constexpr unsigned int kStatusWarning = 2;
constexpr unsigned int kStatusCritical = 3;

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
    default: return nullptr;
    }
}

} // namespace shipped
