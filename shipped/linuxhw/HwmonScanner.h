// HwmonScanner: every temperature, fan and voltage input of the hwmon class
// as a sensor, and the thermal zones when no hwmon chip exists (most
// kernels show each thermal zone as an hwmon chip too, so both would report
// the same sensor twice).
//
// A chip is known by its name and the name of its device ("coretemp" on
// "coretemp.0"), not by its hwmonN number, which follows driver load order.
// Sensors of a coretemp chip sit below their CPU package with the input's
// index as instance; the others sit below the chassis with the instance
// (digest of the chip << 8) | index, so that the last two hexadecimal digits
// are the input's index.
#pragma once

#include "Device.h"
#include "SysfsReader.h"

#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

namespace linuxhw {

// One value with its limits, in the file's own unit (millidegrees,
// millivolts, RPM), and the alarm files that are set.
struct Reading {
    std::optional<long long> value;
    std::optional<long long> lowerCritical;
    std::optional<long long> lowerWarning;
    std::optional<long long> upperWarning;
    std::optional<long long> upperCritical;
    // Name of the alarm file that is set, and whether it is a critical one.
    std::vector<std::pair<std::string, bool>> alarms;
};

// How a reading is shown: milli-units divided by 1000 with some decimals,
// or the plain number.
struct Unit {
    char const* name;
    bool milli;
    int decimals;
    bool canBeNegative; // temperatures and voltages; a negative fan speed is garbage
};

// Sets the reading, thresholds and state of d and its status and message.
void evaluate(Device& d, Reading const& r, Unit const& unit);

class HwmonScanner {
public:
    HwmonScanner(SysfsReader& reader, std::set<unsigned int> packages)
        : reader_(reader), packages_(std::move(packages))
    {
    }

    // Appends one device per input; returns the number of chips found.
    std::size_t scanHwmon(DeviceList& out);
    void scanThermalZones(DeviceList& out);

private:
    SysfsReader& reader_;
    std::set<unsigned int> const packages_;
};

} // namespace linuxhw
