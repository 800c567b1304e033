#include "DeviceScanner.h"

#include "ShippedAlerts.h"
#include "SystemScanner.h"

namespace linuxhw {

namespace {

std::string const kNetDir = "sys/class/net";
std::string const kBlockDir = "sys/block";
std::string const kSupplyDir = "sys/class/power_supply";

bool startsWith(std::string const& s, char const* prefix)
{
    return s.rfind(prefix, 0) == 0;
}

} // namespace

void DeviceScanner::scanNetwork(DeviceList& out)
{
    for (std::string const& name : reader_.list(kNetDir)) {
        std::string const dir = kNetDir + "/" + name + "/";
        if (name == "lo" || !reader_.exists(dir + "device"))
            continue;
        Device d;
        d.key = "net:" + name;
        d.parentKey = kChassisKey;
        d.type = IC::Node::NetworkPort;
        d.instance = stableHash16(name);
        d.watch = Watch::Link;
        std::optional<std::string> const address = reader_.text(dir + "address");
        d.description = "Network port " + name;
        if (address && !address->empty())
            d.description += " (" + *address + ")";
        d.set("label", name);
        if (address)
            d.set("address", *address);
        // The kernel refuses carrier and speed (EINVAL) on a port that is
        // down; that is a state, not a fault.
        std::optional<long long> const carrier = reader_.quietInteger(dir + "carrier");
        std::optional<std::string> const oper = reader_.quietText(dir + "operstate");
        d.linkKnown = carrier.has_value() || oper.has_value();
        d.linkUp = carrier ? *carrier == 1 : oper && *oper == "up";
        std::optional<long long> const speed = reader_.quietInteger(dir + "speed");
        if (d.linkUp && speed && *speed > 0)
            d.set("speed", std::to_string(*speed), "Mb/s");
        else
            d.set("speed", "unknown");
        d.set("link", d.linkKnown ? (d.linkUp ? "up" : "down") : "unknown");
        out.push_back(d);
    }
}

void DeviceScanner::scanDisks(DeviceList& out)
{
    for (std::string const& name : reader_.list(kBlockDir)) {
        if (startsWith(name, "loop") || startsWith(name, "ram") || startsWith(name, "zram"))
            continue;
        std::string const dir = kBlockDir + "/" + name + "/";
        // Device mapper and md volumes have no device entry.
        if (!reader_.exists(dir + "device"))
            continue;
        std::optional<std::string> wwid = reader_.quietText(dir + "wwid");
        if (!wwid || wwid->empty())
            wwid = reader_.quietText(dir + "device/wwid");
        std::string const identity = wwid && !wwid->empty() ? *wwid : name;
        Device d;
        d.key = "disk:" + identity;
        d.parentKey = kChassisKey;
        d.type = IC::Node::HardDrive;
        d.instance = stableHash16(identity);
        std::optional<std::string> const vendor = reader_.text(dir + "device/vendor");
        std::optional<std::string> const model = reader_.text(dir + "device/model");
        std::optional<std::string> serial = reader_.text(dir + "device/serial");
        std::optional<std::string> version = reader_.text(dir + "device/firmware_rev");
        if (!version)
            version = reader_.text(dir + "device/rev");
        std::optional<long long> const sectors = reader_.count(dir + "size");
        d.description = "Disk " + name;
        if (model && !model->empty())
            d.description += ": " + *model;
        d.set("label", name);
        // "ATA" is what libata puts there for every SATA disk; virtio puts a
        // PCI vendor number.
        if (vendor && !vendor->empty() && *vendor != "ATA" && vendor->rfind("0x", 0) != 0)
            d.set("vendor", *vendor);
        if (model && !model->empty())
            d.set("model", *model);
        if (serial && !serial->empty())
            d.set("serial", *serial);
        if (version && !version->empty())
            d.set("version", *version);
        if (wwid && !wwid->empty())
            d.set("wwid", *wwid);
        // sysfs counts 512-byte sectors whatever the disk's block size; a
        // count whose bytes do not fit is no size.
        long long bytes = 0;
        if (sectors && !__builtin_mul_overflow(*sectors, 512, &bytes)) {
            d.set("size", std::to_string(bytes), "bytes");
            d.description += " (" + std::to_string(bytes / 1000000000 + (bytes % 1000000000 >= 500000000)) + " GB)";
        } else {
            d.set("size", "unknown");
        }
        if (std::optional<long long> const rot = reader_.quietInteger(dir + "queue/rotational"))
            d.set("media", *rot ? "hdd" : "ssd");
        if (std::optional<std::string> const state = reader_.text(dir + "device/state")) {
            // SCSI says running, NVMe live; offline and dead disks are lost,
            // the other states (blocked, resetting...) pass.
            d.watch = Watch::Condition;
            d.set("device_state", *state);
            if (*state == "running" || *state == "live") {
                d.status = shipped::kStatusNormal;
                d.message = d.description + " is back in service";
            } else {
                bool const lost = *state == "offline" || *state == "transport-offline" || *state == "dead";
                d.status = lost ? shipped::kStatusCritical : shipped::kStatusWarning;
                d.message = d.description + " is " + *state;
            }
        }
        out.push_back(d);
    }
}

void DeviceScanner::scanPowerSupplies(DeviceList& out)
{
    for (std::string const& name : reader_.list(kSupplyDir)) {
        std::string const dir = kSupplyDir + "/" + name + "/";
        if (!reader_.isDirectory(dir))
            continue;
        Device d;
        d.key = "psu:" + name;
        d.parentKey = kChassisKey;
        d.type = IC::Node::PowerSupply;
        d.instance = stableHash16(name);
        d.watch = Watch::Condition;
        std::string const type = reader_.text(dir + "type").value_or("");
        d.description = "Power supply " + name;
        if (!type.empty())
            d.description += " (" + type + ")";
        d.set("label", name);
        if (!type.empty())
            d.set("type", type);
        std::pair<char const*, char const*> const fields[] = {
            {"vendor", "manufacturer"}, {"model", "model_name"}, {"serial", "serial_number"}};
        for (auto const& f : fields)
            if (std::optional<std::string> const v = reader_.text(dir + f.second); v && !v->empty())
                d.set(f.first, *v);
        if (std::optional<long long> const uw = reader_.integer(dir + "power_now"))
            d.set("reading", milliToText(*uw / 1000, 1), "W");
        if (std::optional<long long> const uv = reader_.integer(dir + "voltage_now"))
            d.set("voltage", milliToText(*uv / 1000, 3), "V");
        std::optional<long long> const pct = reader_.count(dir + "capacity");
        if (pct && *pct <= 100)
            d.set("capacity", std::to_string(*pct), "%");
        else if (reader_.exists(dir + "capacity"))
            d.set("capacity", "unknown");

        std::optional<long long> const present = reader_.integer(dir + "present");
        std::optional<long long> const online = reader_.integer(dir + "online");
        std::optional<std::string> const health = reader_.text(dir + "health");
        d.status = shipped::kStatusCritical;
        if (present && *present == 0) {
            d.message = d.description + " is not present";
        } else if (online && *online == 0 && type == "Mains") {
            d.message = d.description + " has no input power";
        } else if (health && !health->empty() && *health != "Good" && *health != "Unknown") {
            d.message = d.description + " reports health '" + *health + "'";
        } else {
            d.status = shipped::kStatusNormal;
            d.message = d.description + " is back to normal";
        }
        if (present)
            d.set("present", *present == 0 ? "no" : "yes");
        if (online)
            d.set("online", *online == 0 ? "no" : "yes");
        if (health && !health->empty())
            d.set("health", *health);
        out.push_back(d);
    }
}

} // namespace linuxhw
