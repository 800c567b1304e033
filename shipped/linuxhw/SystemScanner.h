// SystemScanner: the parts of the machine that do not come and go (the
// root, the system from DMI with its BIOS, the CPU packages and cores,
// system memory) and the DIMMs that EDAC reports.
#pragma once

#include "Device.h"
#include "SysfsReader.h"

#include <set>
#include <string>

namespace linuxhw {

std::string const kRootKey = "root";
std::string const kChassisKey = "chassis";
std::string const kMemoryKey = "memory";
std::string cpuKey(unsigned int package);

class SystemScanner {
public:
    explicit SystemScanner(SysfsReader& reader) : reader_(reader) {}

    // Appends the fixed devices, parents first; packages := the CPU package
    // ids found.
    void scanFixed(DeviceList& out, std::set<unsigned int>& packages);
    // Appends one DIMM per EDAC dimm (or rank) directory of a known size.
    void scanDimms(DeviceList& out);

private:
    void scanChassis(DeviceList& out);
    void scanCpus(DeviceList& out, std::set<unsigned int>& packages);
    void scanMemory(DeviceList& out);
    // A DMI string, without the placeholders firmware leaves in unset fields.
    std::string dmi(std::string const& file);

    SysfsReader& reader_;
};

} // namespace linuxhw
