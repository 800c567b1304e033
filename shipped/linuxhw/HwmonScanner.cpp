#include "HwmonScanner.h"

#include "Log.h"
#include "ShippedAlerts.h"
#include "SystemScanner.h"

#include <algorithm>
#include <map>

namespace linuxhw {

namespace {

std::string const kHwmonDir = "sys/class/hwmon";
std::string const kThermalDir = "sys/class/thermal";

struct Kind {
    char const* prefix;
    IC::Node::SensorType type;
    char const* word;
    Unit unit;
};

Kind const kKinds[] = {
    {"temp", IC::Node::TemperatureSensor, "temperature", {"C", true, 1, true}},
    {"fan", IC::Node::Fan, "speed", {"RPM", false, 0, false}},
    {"in", IC::Node::VoltageSensor, "voltage", {"V", true, 3, true}},
};

// "temp3_input" -> kind temp, index 3.
bool parseInput(std::string const& file, Kind const*& kind, unsigned int& index)
{
    std::size_t const underscore = file.find('_');
    if (underscore == std::string::npos || file.compare(underscore, std::string::npos, "_input") != 0)
        return false;
    std::string const stem = file.substr(0, underscore);
    for (Kind const& k : kKinds) {
        std::optional<unsigned int> const n = numberAfter(stem, k.prefix);
        if (n) {
            kind = &k;
            index = *n;
            return true;
        }
    }
    return false;
}

std::string show(long long v, Unit const& unit)
{
    return unit.milli ? milliToText(v, unit.decimals) : std::to_string(v);
}

} // namespace

void evaluate(Device& d, Reading const& r, Unit const& unit)
{
    std::string const u = unit.name;
    d.set("reading", r.value ? show(*r.value, unit) : "unknown", r.value ? u : "");
    // Drivers report 0 for an upper limit nobody programmed.
    auto upper = [](std::optional<long long> t) { return t && *t > 0 ? t : std::nullopt; };
    std::optional<long long> const uwarn = upper(r.upperWarning);
    std::optional<long long> const ucrit = upper(r.upperCritical);
    std::pair<char const*, std::optional<long long>> const limits[] = {
        {"lower_critical", r.lowerCritical},
        {"lower_warning", r.lowerWarning},
        {"upper_warning", uwarn},
        {"upper_critical", ucrit}};
    for (auto const& l : limits)
        if (l.second)
            d.set(l.first, show(*l.second, unit), u);

    auto crossing = [&](char const* how, long long limit) {
        return d.description + " " + show(*r.value, unit) + " " + u + " " + how + " " +
               show(limit, unit) + " " + u;
    };
    auto alarm = [&](bool critical) -> std::string {
        for (auto const& a : r.alarms)
            if (a.second == critical)
                return d.description + ": hwmon alarm " + a.first + " is set";
        return std::string();
    };
    std::string why;
    unsigned int status = shipped::kStatusNormal;
    if (r.value && ucrit && *r.value > *ucrit)
        why = crossing("above critical", *ucrit);
    else if (r.value && r.lowerCritical && *r.value < *r.lowerCritical)
        why = crossing("below critical", *r.lowerCritical);
    else
        why = alarm(true);
    if (!why.empty()) {
        status = shipped::kStatusCritical;
    } else {
        if (r.value && uwarn && *r.value > *uwarn)
            why = crossing("above warning", *uwarn);
        else if (r.value && r.lowerWarning && *r.value < *r.lowerWarning)
            why = crossing("below warning", *r.lowerWarning);
        else
            why = alarm(false);
        if (!why.empty())
            status = shipped::kStatusWarning;
    }
    if (status == shipped::kStatusNormal && !r.value) {
        // Nothing known: the last status stands.
        d.status = kStatusUnknown;
        d.message.clear();
        return;
    }
    d.status = status;
    d.message = status == shipped::kStatusNormal
                    ? d.description + " back to normal at " + show(*r.value, unit) + " " + u
                    : why;
}

std::size_t HwmonScanner::scanHwmon(DeviceList& out)
{
    std::vector<std::pair<unsigned int, std::string>> dirs;
    for (std::string const& name : reader_.list(kHwmonDir))
        if (std::optional<unsigned int> const n = numberAfter(name, "hwmon"))
            dirs.emplace_back(*n, name);
    std::sort(dirs.begin(), dirs.end());

    std::size_t chips = 0;
    std::map<std::string, unsigned int> unlinked; // chips of a name without a device link
    for (auto const& entry : dirs) {
        std::string const dir = kHwmonDir + "/" + entry.second;
        std::optional<std::string> name = reader_.text(dir + "/name");
        std::string attrDir = dir;
        std::vector<std::string> files = reader_.list(dir);
        auto const hasInput = [](std::vector<std::string> const& names) {
            return std::any_of(names.begin(), names.end(), [](std::string const& f) {
                Kind const* k = nullptr;
                unsigned int i = 0;
                return parseInput(f, k, i);
            });
        };
        if (!hasInput(files) && reader_.isDirectory(dir + "/device")) {
            // Older drivers keep their attributes on the device.
            std::vector<std::string> deviceFiles = reader_.list(dir + "/device");
            if (hasInput(deviceFiles)) {
                attrDir = dir + "/device";
                files = std::move(deviceFiles);
                if (!name)
                    name = reader_.text(attrDir + "/name");
            }
        }
        if (!name || name->empty()) {
            reader_.complain(dir + "/name", "hwmon chip without a name");
            continue;
        }
        ++chips;
        std::string id = reader_.linkName(dir + "/device");
        if (id.empty())
            id = "#" + std::to_string(unlinked[*name]++);
        std::string const chipKey = *name + "@" + id;
        unsigned int chipHash = stableHash16(chipKey);
        if (chipHash == 0)
            chipHash = 1; // keeps instances clear of the thermal zones' 0..255

        std::set<std::string> const present(files.begin(), files.end());
        auto const file = [&](std::string const& f, bool canBeNegative) -> std::optional<long long> {
            if (present.count(f) == 0)
                return std::nullopt;
            return canBeNegative ? reader_.integer(attrDir + "/" + f) : reader_.count(attrDir + "/" + f);
        };
        auto const label = [&](std::string const& prefix) -> std::string {
            std::optional<std::string> l;
            if (present.count(prefix + "_label") != 0)
                l = reader_.text(attrDir + "/" + prefix + "_label");
            return l && !l->empty() ? *l : prefix;
        };

        // coretemp has one chip per package; its package label names it.
        std::optional<unsigned int> package;
        if (*name == "coretemp") {
            for (std::string const& f : files) {
                if (f.size() < 7 || f.compare(f.size() - 6, 6, "_label") != 0)
                    continue;
                std::string const l = label(f.substr(0, f.size() - 6));
                if (std::optional<unsigned int> const p = numberAfter(l, "Package id "))
                    package = *p;
            }
            if (!package)
                package = numberAfter(id, "coretemp.");
            if (package && packages_.count(*package) == 0)
                package.reset();
        }
        // Plain values from here on: GCC's -O2 flow analysis misreads the
        // optional inside the loop below.
        bool const onPackage = package.has_value();
        unsigned int const packageId = package.value_or(0);

        for (std::string const& f : files) {
            Kind const* kind = nullptr;
            unsigned int index = 0;
            if (!parseInput(f, kind, index))
                continue;
            if (index > 0xFF) {
                reader_.complain(attrDir + "/" + f, "input index above 255");
                continue;
            }
            std::string const prefix = kind->prefix + std::to_string(index);
            std::string const l = label(prefix);
            Device d;
            d.key = "hwmon:" + chipKey + ":" + prefix;
            d.type = kind->type;
            d.watch = Watch::Condition;
            if (onPackage) {
                d.parentKey = cpuKey(packageId);
                d.instance = index;
                d.description = "CPU " + std::to_string(packageId) + " " + l + " " + kind->word;
            } else {
                d.parentKey = kChassisKey;
                d.instance = chipHash << 8 | index;
                d.probeStep = 1u << 24;
                d.description = *name + " " + l + " " + kind->word;
            }
            d.set("label", l);
            d.set("chip", *name);
            Reading r;
            bool const signedValue = kind->unit.canBeNegative;
            r.value = file(f, signedValue);
            r.lowerCritical = file(prefix + "_lcrit", signedValue);
            r.lowerWarning = file(prefix + "_min", signedValue);
            r.upperWarning = file(prefix + "_max", signedValue);
            r.upperCritical = file(prefix + "_crit", signedValue);
            std::pair<char const*, bool> const alarms[] = {
                {"_alarm", false}, {"_min_alarm", false}, {"_max_alarm", false},
                {"_fault", false}, {"_lcrit_alarm", true}, {"_crit_alarm", true}};
            for (auto const& a : alarms) {
                // Anything but 0 and 1 is no answer.
                std::optional<long long> const set = file(prefix + a.first, false);
                if (set && *set == 1)
                    r.alarms.emplace_back(prefix + a.first, a.second);
            }
            evaluate(d, r, kind->unit);
            out.push_back(std::move(d));
        }
    }
    return chips;
}

void HwmonScanner::scanThermalZones(DeviceList& out)
{
    for (std::string const& name : reader_.list(kThermalDir)) {
        std::optional<unsigned int> const zone = numberAfter(name, "thermal_zone");
        if (!zone)
            continue;
        if (*zone > 0xFF) {
            reader_.complain(kThermalDir + "/" + name, "thermal zone number above 255");
            continue;
        }
        std::string const dir = kThermalDir + "/" + name + "/";
        std::string const type = reader_.text(dir + "type").value_or("");
        Device d;
        d.key = "thermal:" + name;
        d.parentKey = kChassisKey;
        d.type = IC::Node::TemperatureSensor;
        d.instance = *zone;
        d.watch = Watch::Condition;
        d.description = "Thermal zone " + std::to_string(*zone);
        if (!type.empty())
            d.description += " (" + type + ")";
        d.set("label", type.empty() ? name : type);
        Reading r;
        r.value = reader_.integer(dir + "temp");
        // Trip points: "hot" warns, "critical" is where the kernel shuts down.
        for (std::string const& f : reader_.list(dir)) {
            if (f.size() < 5 || f.compare(f.size() - 5, 5, "_type") != 0)
                continue;
            std::optional<unsigned int> const trip =
                numberAfter(f.substr(0, f.size() - 5), "trip_point_");
            if (!trip)
                continue;
            std::string const base = dir + "trip_point_" + std::to_string(*trip);
            std::optional<std::string> const kind = reader_.text(base + "_type");
            // Passive and active points steer cooling; they are no limits.
            if (!kind || (*kind != "critical" && *kind != "hot"))
                continue;
            std::optional<long long> const temp = reader_.integer(base + "_temp");
            std::optional<long long>& slot = *kind == "critical" ? r.upperCritical : r.upperWarning;
            if (temp && (!slot || *temp < *slot))
                slot = temp;
        }
        evaluate(d, r, kKinds[0].unit);
        out.push_back(std::move(d));
    }
}

} // namespace linuxhw
