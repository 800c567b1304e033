// Device: one piece of hardware as a scan of the tree found it, before it
// becomes a node. Scans are plain functions of the tree; LinuxHwMI compares
// one scan with the last to find arrivals, removals and changed conditions.
#pragma once

#include <IC/Node.h>

#include <string>
#include <vector>

namespace linuxhw {

// What the polling watches on a device, and so which alerts it can raise.
enum class Watch {
    None,
    Condition,    // readings against thresholds, alarms, supply state (class 5)
    Link,         // carrier of a network port (class 7)
    MemoryErrors  // EDAC error counts (class 6)
};

// Condition status when the reading could not be taken: the last one stands.
constexpr unsigned int kStatusUnknown = 0;

struct Device {
    // Identity inside the plug-in, built from stable facts of the tree
    // ("cpu:0:core:3", "net:eno1", "hwmon:coretemp@coretemp.0:temp2").
    std::string key;
    std::string parentKey; // "" for the root
    IC::Node::SensorType type = IC::Node::Unknown;
    // The instance the device asks for; a collision with another device of
    // the same type below the same parent moves it on by probeStep.
    unsigned int instance = 0;
    unsigned int probeStep = 1;
    std::string description;
    std::vector<IC::Node::Property> properties; // in display order

    Watch watch = Watch::None;
    // Watch::Condition: 1 normal, 2 warning, 3 critical, kStatusUnknown; with
    // the text of an alert that would report it.
    unsigned int status = kStatusUnknown;
    std::string message;
    // Watch::Link
    bool linkKnown = false;
    bool linkUp = false;
    // Watch::MemoryErrors; -1 when unreadable.
    long long corrected = -1;
    long long uncorrected = -1;

    void set(std::string const& name, std::string const& value, std::string const& unit = "")
    {
        for (IC::Node::Property& p : properties)
            if (p.name == name) {
                p.value = value;
                p.unit = unit;
                return;
            }
        // A device holds a handful: no room to spare, as a very large
        // machine has a hundred thousand of them.
        if (properties.size() == properties.capacity())
            properties.reserve(properties.size() + 1);
        properties.push_back(IC::Node::Property{name, value, unit});
    }
};

using DeviceList = std::vector<Device>;

} // namespace linuxhw
