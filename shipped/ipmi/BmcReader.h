// BmcReader: one pass over the sensors of one BMC, through FreeIPMI's
// libipmimonitoring (readings, units, discrete states) and the SDR cache it
// keeps in the data directory, read with libfreeipmi (entity id and
// instance, thresholds). The in-band BMC and the out-of-band ones share
// everything but the connection settings. Used by one thread at a time.
#pragma once

#include "IpmiConfig.h"

#include <ipmi_monitoring.h>
#include <ipmi_monitoring_bitmasks.h>

#include <freeipmi/api/ipmi-api.h>

#include <array>
#include <ctime>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace ipmi {

struct Sensor {
    std::string name;
    int type = 0;              // IPMI sensor type
    unsigned int entityId = 0; // from the SDR; 0 when unknown
    unsigned int entityInstance = 0;
    bool thresholdBased = false; // judged by thresholds, so it has a reading
    std::optional<double> reading;
    std::string unit;
    // lower_critical, lower_warning, upper_warning, upper_critical
    std::array<std::optional<double>, 4> thresholds;
    std::string state; // ok, warning, critical, unknown
    std::string event; // FreeIPMI's words for what the sensor says
};

// What a FRU of the BMC says about the entity it belongs to.
struct Inventory {
    unsigned int entityId = 0;
    unsigned int entityInstance = 0;
    std::string vendor, model, serial; // "" when the FRU does not say
};

// A new record of the BMC's event log (SEL).
struct SelEvent {
    unsigned int id = 0;
    std::string sensor; // the sensor's name; "" when the record names none
    std::string text;
    int state = 0; // IPMI_MONITORING_STATE_*
};

class BmcReader {
public:
    // The session time-out: a BMC that does not answer fails a pass after
    // about this long.
    static constexpr int kSessionTimeoutMs = 2000;

    BmcReader(BmcConfig config, std::string cacheDir);
    ~BmcReader();
    BmcReader(BmcReader const&) = delete;
    BmcReader& operator=(BmcReader const&) = delete;

    // Every sensor, in SDR order; false with error set when the BMC could not
    // be read.
    bool read(std::vector<Sensor>& out, std::string& error);

    // The SEL records added since the last call (and the BMC's versions, on
    // the first call that reaches it), by the seen-state kept in
    // the cache directory: the last record id with the SEL's last add and
    // erase time stamps, since record ids restart after a clear. A BMC seen
    // for the first time has its log taken as seen. False when the BMC could
    // not be asked.
    bool newEvents(std::vector<SelEvent>& out, std::string& error);

    // The BMC's firmware and IPMI versions ("" until newEvents has asked).
    std::string const& firmware() const { return firmware_; }
    std::string const& ipmiVersion() const { return ipmiVersion_; }
    // The FRU inventory of the entities the SDR names FRUs for, read once
    // with the versions; empty until then or when the BMC keeps none.
    std::vector<Inventory> const& inventory() const { return inventory_; }

    BmcConfig const& config() const { return config_; }
    // How many times read() found the SDR downloaded anew (logged at debug
    // level): once on a cold cache, then only when the BMC's SDR changed.
    unsigned int sdrDownloads() const { return sdrDownloads_; }

private:
    struct SdrFacts {
        unsigned int entityId = 0;
        unsigned int entityInstance = 0;
        bool sensor = false; // a sensor record, not a locator or OEM one
        std::array<std::optional<double>, 4> thresholds;
    };
    // A FRU the BMC itself serves (a logical FRU device at its address) and
    // the entity it describes.
    struct FruLocator {
        unsigned int deviceId = 0;
        unsigned int entityId = 0;
        unsigned int entityInstance = 0;
    };
    void loadSdrFacts();
    void readInventory(ipmi_ctx_t ctx);
    ipmi_monitoring_ipmi_config ipmiConfig() const;
    char const* hostname() const;

    BmcConfig const config_;
    std::string const cacheDir_;
    ipmi_monitoring_ctx_t ctx_ = nullptr;
    std::map<int, SdrFacts> facts_; // by SDR record id, for this cache file
    std::vector<FruLocator> frus_;  // from the same SDR
    std::string factsFile_;
    std::time_t factsTime_ = 0;
    std::string host_; // "host:port"; unused in-band
    std::string firmware_;
    std::string ipmiVersion_;
    std::vector<Inventory> inventory_;
    unsigned int sdrDownloads_ = 0;
};

} // namespace ipmi
