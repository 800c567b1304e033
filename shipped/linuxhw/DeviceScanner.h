// DeviceScanner: network ports, disks and power supplies, the devices that
// may come and go while the plug-in runs.
//
// Their instances are digests of a name that does not depend on the rest of
// the machine (the interface name, the disk's WWID or else its name, the
// supply's name): a port keeps its path when another card is added, which an
// index in a sorted list would not give.
#pragma once

#include "Device.h"
#include "SysfsReader.h"

namespace linuxhw {

class DeviceScanner {
public:
    explicit DeviceScanner(SysfsReader& reader) : reader_(reader) {}

    // Physical ports only: "lo" and ports without a device entry (bridges,
    // tunnels, veths, bonds) are left out.
    void scanNetwork(DeviceList& out);
    // Block devices with a device entry; loop, ram and zram never.
    void scanDisks(DeviceList& out);
    // Everything under the power_supply class.
    void scanPowerSupplies(DeviceList& out);

private:
    SysfsReader& reader_;
};

} // namespace linuxhw
