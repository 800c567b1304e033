// IC::Node: one hardware component reported by a plug-in.
//
// Plug-ins derive their nodes from this class and own them; the library only
// keeps pointers. A node's identity in the hardware tree is its sensor type
// and instance, chained through its parent (linked id) up to the root; the
// library computes the resulting path and hands it back through setPath().
//
// Besides its identity a node carries a property list: named values that a
// user of a hardware view reads (a reading with its unit, thresholds, vendor
// data). Plug-ins fill it; tools print it. The property list may be updated
// from a plug-in's thread while other threads read it. The identity fields
// (type, instance, ids, description, paths) are meant to be set before the
// node is handed to the library and not changed afterwards.
#pragma once

#include <IC/CommonExport.h>
#include <IC/Error.h>

#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

namespace IC {

class ICCOMMON_API Node {
public:
    // The kind of a node. 74 means "invalid" and is also the answer for an
    // unknown node.
    enum SensorType : std::uint32_t {
        Unknown = 0, Chassis = 1, BIOS = 2, Firmware = 3, CPU = 4, USBController = 5,
        USBPort = 6, SerialPort = 7, ParallelPort = 8, Video = 9, FloppyDrive = 10,
        HardDrive = 11, NetworkPort = 12, BMC = 13, KVR = 14, SMBIOS = 15, VPD = 16,
        OS = 17, RAM = 18, DIMM = 19, Fan = 20, VoltageSensor = 21,
        TemperatureSensor = 22, Intrusion = 23, PFA = 24, PowerSupply = 25,
        BlueLight = 26, FrontPanel = 27, BackPanel = 28, NetworkIPConfiguration = 29,
        System = 30, Cache = 31, MemoryArray = 32, MemoryDevice = 33, IPMI = 34,
        Log = 35, Tallowmere = 36, ServiceProcessor = 37, OsHw = 38, OsSw = 39,
        Computer = 40, Planar = 41, CPUCore = 42, Application = 43, Driver = 44,
        Partition = 45, User = 46, LogEntry = 47, PFASensor = 48,
        NetworkController = 49, DiskController = 50, Group = 51,
        KelmarAlertConfig = 52, Diagnostics = 53, SMBIOSData = 54, SMBIOSTable = 55,
        NetworkTeaming = 56, ScalablePartition = 57, ScalableSystem = 58, ROOT = 59,
        ModularChassis = 60, SlotGroup = 61, Slot = 62, CMM = 63, IOModule = 64,
        CoolingDomain = 65, PowerDomain = 66, ChassisMidPlaneCard = 67,
        ModularGroup = 68, AlertIndication = 69, Connector = 70, BMCUser = 71,
        DriveSlotSensor = 72, LANEndPoint = 73, invalid = 74
    };

    // One named value of a node. Conventional names (plug-ins may add their
    // own, tools print whatever is there, in list order):
    //   "reading"                       current value, with its unit
    //   "lower_critical", "lower_warning",
    //   "upper_warning", "upper_critical"   thresholds, in the reading's unit
    //   "state"                          "ok", "warning", "critical", "absent"...
    //   "vendor", "model", "serial", "version", "label"   descriptive data
    // Values are text so that any kind of value can be carried; numbers are
    // written in decimal with '.' as decimal point.
    struct Property {
        std::string name;
        std::string value;
        std::string unit; // "C", "RPM", "V", "W", "MB", "bytes", "%", or ""
    };

    Node(SensorType type, unsigned int instance, unsigned int nodeId, unsigned int linkedId,
         std::string description, unsigned int nodeNumber = 0);
    Node(Node const& other);
    Node& operator=(Node const& other);
    virtual ~Node();

    SensorType getSensor() const { return type_; }
    operator SensorType() const { return type_; }
    // What the last setPath() gave; "" before.
    std::string getPath() const { return path_; }
    // What the last setLinkedPath() gave; "" before.
    std::string getLinkedPath() const { return linkedPath_; }

    virtual unsigned int getNodeNumber() const;
    virtual std::string getDescription() const;

    // A copy of the property list, in the order the names were first set.
    virtual std::vector<Property> getProperties() const;
    // True and *out filled when the property exists.
    virtual bool getProperty(std::string const& name, Property* out) const;
    // Sets (or adds, at the end) the property of that name.
    virtual void setProperty(std::string const& name, std::string const& value,
                             std::string const& unit = std::string());
    // Returns true when the property existed.
    virtual bool removeProperty(std::string const& name);

    virtual unsigned int getNodeId() const;
    virtual unsigned int getLinkedId() const;
    virtual unsigned int getInstance() const;

    virtual void setInstance(unsigned int instance);
    virtual void setLinkedId(unsigned int linkedId);
    virtual void setNodeId(unsigned int nodeId);
    virtual void setDescription(std::string const& description);

    virtual Error setPath(std::string const& path);
    virtual Error setLinkedPath(std::string const& path);

private:
    SensorType type_;
    unsigned int instance_;
    unsigned int nodeId_;
    unsigned int linkedId_;
    unsigned int nodeNumber_;
    std::string description_;
    std::string path_;
    std::string linkedPath_;
    mutable std::mutex propertiesLock_;
    std::vector<Property> properties_;
};

} // namespace IC
