#include "SystemScanner.h"

#include "Log.h"

#include <algorithm>
#include <map>
#include <optional>
#include <sstream>
#include <vector>

namespace linuxhw {

namespace {

std::string const kDmi = "sys/class/dmi/id/";
std::string const kCpuDir = "sys/devices/system/cpu";
std::string const kEdacDir = "sys/devices/system/edac/mc";

// What /proc/cpuinfo says about one logical CPU.
struct CpuInfo {
    std::string model;
    std::string vendor;
    std::optional<long long> package;
    std::optional<long long> core;
};

std::map<unsigned int, CpuInfo> parseCpuInfo(std::string const& text)
{
    std::map<unsigned int, CpuInfo> cpus;
    std::istringstream in(text);
    std::string line;
    std::optional<unsigned int> current;
    while (std::getline(in, line)) {
        std::size_t const colon = line.find(':');
        if (colon == std::string::npos)
            continue;
        std::string const key = trim(line.substr(0, colon));
        std::string const value = trim(line.substr(colon + 1));
        if (key == "processor") {
            std::optional<long long> const n = parseInteger(value);
            current = n && *n >= 0 && *n <= 0xFFFFFFF ? std::optional<unsigned int>(static_cast<unsigned int>(*n))
                                   : std::nullopt;
            continue;
        }
        if (!current)
            continue;
        CpuInfo& info = cpus[*current];
        if (key == "model name")
            info.model = value;
        else if (key == "vendor_id")
            info.vendor = value;
        else if (key == "physical id")
            info.package = parseInteger(value);
        else if (key == "core id")
            info.core = parseInteger(value);
    }
    return cpus;
}

std::string joinNumbers(std::vector<unsigned int> const& numbers)
{
    std::string out;
    for (unsigned int n : numbers)
        out += (out.empty() ? "" : ",") + std::to_string(n);
    return out;
}

} // namespace

std::string cpuKey(unsigned int package)
{
    return "cpu:" + std::to_string(package);
}

void SystemScanner::scanFixed(DeviceList& out, std::set<unsigned int>& packages)
{
    Device root;
    root.key = kRootKey;
    root.type = IC::Node::ROOT;
    std::optional<std::string> const host = reader_.text("proc/sys/kernel/hostname");
    root.description = host && !host->empty() ? "Linux host " + *host : "Linux host";
    if (host && !host->empty())
        root.set("label", *host);
    out.push_back(root);

    scanChassis(out);
    scanCpus(out, packages);
    scanMemory(out);
}

std::string SystemScanner::dmi(std::string const& file)
{
    std::optional<std::string> const v = reader_.text(kDmi + file);
    if (!v)
        return std::string();
    static char const* const placeholders[] = {"To Be Filled By O.E.M.", "Default string",
                                               "Not Applicable", "None",
                                               "System Product Name", "System manufacturer"};
    for (char const* p : placeholders)
        if (*v == p)
            return std::string();
    return *v;
}

void SystemScanner::scanChassis(DeviceList& out)
{
    Device chassis;
    chassis.key = kChassisKey;
    chassis.parentKey = kRootKey;
    chassis.type = IC::Node::Chassis;
    std::string const vendor = dmi("sys_vendor");
    std::string const product = dmi("product_name");
    std::string description = trim(vendor + " " + product);
    chassis.description = description.empty() ? "System" : "System " + description;
    std::pair<char const*, std::string> const fields[] = {
        {"vendor", vendor},
        {"model", product},
        {"version", dmi("product_version")},
        {"serial", dmi("product_serial")},
        {"board", trim(dmi("board_vendor") + " " + dmi("board_name"))}};
    for (auto const& f : fields)
        if (!f.second.empty())
            chassis.set(f.first, f.second);
    out.push_back(chassis);

    std::string const biosVendor = dmi("bios_vendor");
    std::string const biosVersion = dmi("bios_version");
    std::string const biosDate = dmi("bios_date");
    if (biosVendor.empty() && biosVersion.empty() && biosDate.empty())
        return;
    Device bios;
    bios.key = "bios";
    bios.parentKey = kChassisKey;
    bios.type = IC::Node::BIOS;
    bios.description = trim("BIOS " + biosVendor + " " + biosVersion);
    if (!biosDate.empty())
        bios.description += " (" + biosDate + ")";
    if (!biosVendor.empty())
        bios.set("vendor", biosVendor);
    if (!biosVersion.empty())
        bios.set("version", biosVersion);
    if (!biosDate.empty())
        bios.set("date", biosDate);
    out.push_back(bios);
}

void SystemScanner::scanCpus(DeviceList& out, std::set<unsigned int>& packages)
{
    std::map<unsigned int, CpuInfo> info;
    if (std::optional<std::string> const text = reader_.contents("proc/cpuinfo"))
        info = parseCpuInfo(*text);

    // package -> core -> logical CPUs
    std::map<unsigned int, std::map<unsigned int, std::vector<unsigned int>>> layout;
    std::map<unsigned int, CpuInfo> firstOfPackage;
    auto place = [&](unsigned int cpu, long long package, long long core) {
        if (package < 0 || core < 0 || package > 0xFFFF || core > 0xFFFF) {
            reader_.complain(kCpuDir + "/cpu" + std::to_string(cpu) + "/topology",
                             "odd package or core id");
            return;
        }
        auto const p = static_cast<unsigned int>(package);
        layout[p][static_cast<unsigned int>(core)].push_back(cpu);
        auto const i = info.find(cpu);
        if (i != info.end() && firstOfPackage.count(p) == 0)
            firstOfPackage[p] = i->second;
    };

    std::vector<unsigned int> numbers;
    for (std::string const& name : reader_.list(kCpuDir))
        if (std::optional<unsigned int> const n = numberAfter(name, "cpu"))
            numbers.push_back(*n);
    std::sort(numbers.begin(), numbers.end());
    for (unsigned int cpu : numbers) {
        std::string const topo = kCpuDir + "/cpu" + std::to_string(cpu) + "/topology/";
        std::optional<long long> package = reader_.integer(topo + "physical_package_id");
        std::optional<long long> core = reader_.integer(topo + "core_id");
        auto const i = info.find(cpu);
        if (!package && i != info.end())
            package = i->second.package;
        if (!core && i != info.end())
            core = i->second.core;
        if (!package && !core && !reader_.exists(topo)) {
            // Offline CPUs have no topology; they come back with a restart.
            LHW_LOG(kProgress, "cpu", cpu, " has no topology, left out");
            continue;
        }
        place(cpu, package.value_or(0), core.value_or(cpu));
    }
    if (layout.empty()) {
        // No sysfs CPU directory (some containers): procfs alone.
        for (auto const& [cpu, i] : info)
            place(cpu, i.package.value_or(0), i.core.value_or(cpu));
    }

    for (auto const& [package, cores] : layout) {
        packages.insert(package);
        CpuInfo const& first = firstOfPackage[package];
        Device d;
        d.key = cpuKey(package);
        d.parentKey = kChassisKey;
        d.type = IC::Node::CPU;
        d.instance = package;
        std::string const model = first.model.empty() ? "unknown model" : first.model;
        d.description = "CPU " + std::to_string(package) + ": " + model;
        if (!first.vendor.empty())
            d.set("vendor", first.vendor);
        if (!first.model.empty())
            d.set("model", first.model);
        std::size_t threads = 0;
        for (auto const& c : cores)
            threads += c.second.size();
        d.set("cores", std::to_string(cores.size()));
        d.set("threads", std::to_string(threads));
        out.push_back(d);
        for (auto const& [core, cpus] : cores) {
            Device c;
            c.key = d.key + ":core:" + std::to_string(core);
            c.parentKey = d.key;
            c.type = IC::Node::CPUCore;
            c.instance = core;
            c.description = "CPU " + std::to_string(package) + " core " + std::to_string(core);
            c.set("threads", joinNumbers(cpus));
            out.push_back(c);
        }
    }
}

void SystemScanner::scanMemory(DeviceList& out)
{
    Device mem;
    mem.key = kMemoryKey;
    mem.parentKey = kChassisKey;
    mem.type = IC::Node::RAM;
    mem.description = "System memory";
    if (std::optional<std::string> const text = reader_.contents("proc/meminfo")) {
        std::istringstream in(*text);
        std::string line;
        bool found = false;
        while (std::getline(in, line)) {
            if (line.compare(0, 9, "MemTotal:") != 0)
                continue;
            found = true;
            std::istringstream fields(line.substr(9));
            std::string number;
            std::string unit;
            fields >> number >> unit;
            std::optional<long long> const kb = parseInteger(number);
            if (!kb || *kb <= 0 || unit != "kB") {
                reader_.complain("proc/meminfo", "odd MemTotal line '" + line + "'");
                mem.set("size", "unknown");
                break;
            }
            long long const mb = *kb / 1024;
            mem.description += " " + milliToText(mb * 1000 / 1024, 1) + " GB";
            mem.set("size", std::to_string(mb), "MB");
            break;
        }
        if (!found)
            reader_.complain("proc/meminfo", "no MemTotal line");
    }
    out.push_back(mem);
}

void SystemScanner::scanDimms(DeviceList& out)
{
    for (std::string const& mcName : reader_.list(kEdacDir)) {
        std::optional<unsigned int> const mc = numberAfter(mcName, "mc");
        if (!mc || *mc > 0xFF)
            continue;
        std::string const mcDir = kEdacDir + "/" + mcName;
        for (std::string const& name : reader_.list(mcDir)) {
            // Newer kernels call them dimmN, older ones rankN.
            std::optional<unsigned int> slot = numberAfter(name, "dimm");
            if (!slot)
                slot = numberAfter(name, "rank");
            if (!slot || *slot > 0xFF)
                continue;
            std::string const dir = mcDir + "/" + name + "/";
            std::optional<long long> const size = reader_.count(dir + "size");
            if (size && *size == 0)
                continue; // an empty slot
            Device d;
            d.key = "dimm:" + mcName + ":" + name;
            d.parentKey = kMemoryKey;
            d.type = IC::Node::DIMM;
            d.instance = *mc << 8 | *slot;
            d.watch = Watch::MemoryErrors;
            std::optional<std::string> label = reader_.text(dir + "dimm_label");
            if (!label || label->empty())
                label = mcName + " " + name;
            d.description = "DIMM " + *label;
            d.set("label", *label);
            if (std::optional<std::string> const loc = reader_.text(dir + "dimm_location"))
                d.set("location", *loc);
            d.set("size", size ? std::to_string(*size) : "unknown", size ? "MB" : "");
            if (std::optional<std::string> const type = reader_.text(dir + "dimm_mem_type"))
                d.set("type", *type);
            d.corrected = reader_.count(dir + "dimm_ce_count").value_or(-1);
            d.uncorrected = reader_.count(dir + "dimm_ue_count").value_or(-1);
            auto count = [](long long v) { return v < 0 ? std::string("unknown") : std::to_string(v); };
            d.set("corrected_errors", count(d.corrected));
            d.set("uncorrected_errors", count(d.uncorrected));
            out.push_back(d);
        }
    }
}

} // namespace linuxhw
