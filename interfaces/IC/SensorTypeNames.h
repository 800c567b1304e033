// The display name of every sensor type, indexed by its value: the names the
// node store writes into hierarchy texts, offered once so that tools and
// plug-ins show the same ones.
#pragma once

#include <IC/Node.h>

// The list itself, for tables that must be spelled out in place.
#define IC_SENSOR_TYPE_NAMES                                                                       \
    "Unknown", "Chassis", "BIOS", "Firmware", "CPU", "USB Controller", "USB Port",                 \
        "Serial Port", "Parallel Port", "Video", "Floppy Drive", "Hard Drive", "Network Port",     \
        "BMC", "KVR", "SMBIOS", "VPD", "OS", "RAM", "DIMM", "Fan", "Voltage Sensor",               \
        "Temperature Sensor", "Intrusion", "PFA", "Power Supply", "Blue Light", "Front Panel",     \
        "Back Panel", "Network IP Configuration", "System", "Cache", "Memory Array",               \
        "Memory Device", "IPMI", "Log", "Tallowmere", "Service Processor", "OsHw", "OsSw",         \
        "Computer", "Planar", "CPU Core", "Application", "Driver", "Partition", "User",            \
        "LogEntry", "PFASensor", "Network Controller", "Disk Controller", "Group",                 \
        "Kelmar Alert Config", "Diagnostics", "SMBIOS Data", "SMBIOS Table", "Network Teaming",    \
        "ScalablePartition", "ScalableSystem", "ROOT", "ModularChassis", "SlotGroup", "Slot",      \
        "CMM", "IO Module", "CoolingDomain", "PowerDomain", "Chassis MidPlane Card",               \
        "ModularGroup", "AlertIndication", "Connector", "BMCUser", "Drive Slot Sensor",            \
        "LAN End Point", "invalid"

namespace IC {

inline constexpr char const* const sensorTypeNames[] = {IC_SENSOR_TYPE_NAMES};

inline constexpr unsigned int sensorTypeCount = sizeof sensorTypeNames / sizeof sensorTypeNames[0];
static_assert(sensorTypeCount == Node::invalid + 1u, "one name per sensor type, \"invalid\" last");

// The name of a sensor type; "invalid" for a value beyond the last.
constexpr char const* sensorTypeName(unsigned int type)
{
    return sensorTypeNames[type < sensorTypeCount ? type : Node::invalid];
}

} // namespace IC
