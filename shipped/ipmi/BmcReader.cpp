#include "BmcReader.h"

#include "Log.h"

#include <freeipmi/freeipmi.h>

#include <dirent.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>

namespace ipmi {

namespace {

bool initLibrary()
{
    static bool const ok = [] {
        int err = 0;
        return ipmi_monitoring_init(0, &err) == 0;
    }();
    return ok;
}

std::string unitOf(int units)
{
    switch (units) {
    case IPMI_MONITORING_SENSOR_UNITS_CELSIUS: return "C";
    case IPMI_MONITORING_SENSOR_UNITS_FAHRENHEIT: return "F";
    case IPMI_MONITORING_SENSOR_UNITS_VOLTS: return "V";
    case IPMI_MONITORING_SENSOR_UNITS_AMPS: return "A";
    case IPMI_MONITORING_SENSOR_UNITS_RPM: return "RPM";
    case IPMI_MONITORING_SENSOR_UNITS_WATTS: return "W";
    case IPMI_MONITORING_SENSOR_UNITS_PERCENT: return "%";
    default: return "";
    }
}

// Threshold sensors are judged from the comparison bits, because FreeIPMI's
// default interpretation counts the non-critical ones as nominal.
std::string thresholdState(int bits)
{
    if (bits < 0)
        return "unknown";
    int const critical = IPMI_MONITORING_SENSOR_BITMASK_THRESHOLD_AT_OR_BELOW_LOWER_CRITICAL_THRESHOLD |
                         IPMI_MONITORING_SENSOR_BITMASK_THRESHOLD_AT_OR_BELOW_LOWER_NON_RECOVERABLE_THRESHOLD |
                         IPMI_MONITORING_SENSOR_BITMASK_THRESHOLD_AT_OR_BELOW_UPPER_CRITICAL_THRESHOLD |
                         IPMI_MONITORING_SENSOR_BITMASK_THRESHOLD_AT_OR_BELOW_UPPER_NON_RECOVERABLE_THRESHOLD;
    int const warning = IPMI_MONITORING_SENSOR_BITMASK_THRESHOLD_AT_OR_BELOW_LOWER_NON_CRITICAL_THRESHOLD |
                        IPMI_MONITORING_SENSOR_BITMASK_THRESHOLD_AT_OR_BELOW_UPPER_NON_CRITICAL_THRESHOLD;
    return (bits & critical) ? "critical" : (bits & warning) ? "warning" : "ok";
}

std::string discreteState(int state)
{
    switch (state) {
    case IPMI_MONITORING_STATE_NOMINAL: return "ok";
    case IPMI_MONITORING_STATE_WARNING: return "warning";
    case IPMI_MONITORING_STATE_CRITICAL: return "critical";
    default: return "unknown";
    }
}

// The SDR cache file libipmimonitoring wrote into dir.
std::string cacheFileIn(std::string const& dir)
{
    std::string found;
    if (DIR* d = ::opendir(dir.c_str())) {
        while (dirent* e = ::readdir(d))
            if (std::string(e->d_name).compare(0, 9, "sdr-cache") == 0)
                found = dir + "/" + e->d_name;
        ::closedir(d);
    }
    return found;
}

} // namespace

BmcReader::BmcReader(BmcConfig config, std::string cacheDir)
    : config_(std::move(config)), cacheDir_(std::move(cacheDir))
{
}

BmcReader::~BmcReader()
{
    if (ctx_)
        ipmi_monitoring_ctx_destroy(ctx_);
}

void BmcReader::loadSdrFacts()
{
    std::string const file = cacheFileIn(cacheDir_);
    struct stat st {};
    if (file.empty() || ::stat(file.c_str(), &st) != 0)
        return;
    if (file == factsFile_ && st.st_mtime == factsTime_)
        return;
    facts_.clear();
    factsFile_ = file;
    factsTime_ = st.st_mtime;
    ipmi_sdr_ctx_t sdr = ipmi_sdr_ctx_create();
    if (!sdr)
        return;
    if (ipmi_sdr_cache_open(sdr, nullptr, file.c_str()) == 0) {
        uint16_t count = 0;
        ipmi_sdr_cache_record_count(sdr, &count);
        for (uint16_t i = 0; i < count; ++i, ipmi_sdr_cache_next(sdr)) {
            uint16_t id = 0;
            uint8_t recordType = 0;
            if (ipmi_sdr_parse_record_id_and_type(sdr, nullptr, 0, &id, &recordType) < 0)
                continue;
            SdrFacts f;
            f.sensor = recordType == IPMI_SDR_FORMAT_FULL_SENSOR_RECORD ||
                       recordType == IPMI_SDR_FORMAT_COMPACT_SENSOR_RECORD ||
                       recordType == IPMI_SDR_FORMAT_EVENT_ONLY_RECORD;
            uint8_t eid = 0, einst = 0, etype = 0;
            if (ipmi_sdr_parse_entity_id_instance_type(sdr, nullptr, 0, &eid, &einst, &etype) == 0) {
                f.entityId = eid;
                f.entityInstance = einst;
            }
            if (recordType == IPMI_SDR_FORMAT_FULL_SENSOR_RECORD) {
                uint8_t r[6] = {};
                double* t[6] = {};
                if (ipmi_sdr_parse_threshold_readable(sdr, nullptr, 0, &r[0], &r[1], &r[2], &r[3], &r[4], &r[5]) == 0 &&
                    ipmi_sdr_parse_thresholds(sdr, nullptr, 0, &t[0], &t[1], &t[2], &t[3], &t[4], &t[5]) == 0) {
                    // FreeIPMI's order: lnc lc lnr unc uc unr; ours: lc lnc unc uc.
                    int const pick[4] = {1, 0, 3, 4};
                    for (int k = 0; k < 4; ++k)
                        if (r[pick[k]] && t[pick[k]])
                            f.thresholds[k] = *t[pick[k]];
                }
                for (double* p : t)
                    std::free(p);
            }
            facts_[id] = f;
        }
        ipmi_sdr_cache_close(sdr);
    }
    ipmi_sdr_ctx_destroy(sdr);
}

bool BmcReader::read(std::vector<Sensor>& out, std::string& error)
{
    if (!initLibrary()) {
        error = "libipmimonitoring did not initialise";
        return false;
    }
    if (!ctx_ && !(ctx_ = ipmi_monitoring_ctx_create())) {
        error = "out of memory";
        return false;
    }
    ::mkdir(cacheDir_.c_str(), 0700);
    if (ipmi_monitoring_ctx_sdr_cache_directory(ctx_, cacheDir_.c_str()) < 0 ||
        ipmi_monitoring_ctx_sdr_cache_filenames(ctx_, "sdr-cache-%H") < 0) {
        error = std::string("SDR cache directory ") + cacheDir_ + ": " + ipmi_monitoring_ctx_errormsg(ctx_);
        return false;
    }
    ipmi_monitoring_ipmi_config cfg{};
    cfg.driver_type = IPMI_MONITORING_DRIVER_TYPE_OPENIPMI;
    cfg.disable_auto_probe = 1;
    cfg.driver_device = const_cast<char*>("/dev/ipmi0"); // in-band: the OpenIPMI driver only
    cfg.protocol_version = IPMI_MONITORING_PROTOCOL_VERSION_2_0;
    cfg.username = const_cast<char*>(config_.user.c_str());
    cfg.password = const_cast<char*>(config_.password.c_str());
    cfg.privilege_level = config_.privilege;
    cfg.authentication_type = -1;
    cfg.cipher_suite_id = config_.cipherSuite;
    cfg.session_timeout_len = kSessionTimeoutMs;
    cfg.retransmission_timeout_len = 500;
    cfg.workaround_flags = config_.workarounds;
    std::string const host = config_.host + ":" + std::to_string(config_.port);
    char const* hostname = config_.name.empty() ? nullptr : host.c_str();
    unsigned int const flags = IPMI_MONITORING_SENSOR_READING_FLAGS_DISCRETE_READING;
    int const n = ipmi_monitoring_sensor_readings_by_record_id(ctx_, hostname, &cfg, flags, nullptr, 0, nullptr, nullptr);
    if (n < 0) {
        error = ipmi_monitoring_ctx_errormsg(ctx_);
        return false;
    }
    loadSdrFacts();
    out.clear();
    for (int i = 0; i < n; ++i, ipmi_monitoring_sensor_iterator_next(ctx_)) {
        int const record = ipmi_monitoring_sensor_read_record_id(ctx_);
        auto const f = facts_.find(record);
        if (f != facts_.end() && !f->second.sensor)
            continue;
        Sensor s;
        char const* name = ipmi_monitoring_sensor_read_sensor_name(ctx_);
        s.name = name ? name : "";
        s.type = ipmi_monitoring_sensor_read_sensor_type(ctx_);
        s.unit = unitOf(ipmi_monitoring_sensor_read_sensor_units(ctx_));
        if (f != facts_.end()) {
            s.entityId = f->second.entityId;
            s.entityInstance = f->second.entityInstance;
            s.thresholds = f->second.thresholds;
        }
        int const readingType = ipmi_monitoring_sensor_read_sensor_reading_type(ctx_);
        void const* value = ipmi_monitoring_sensor_read_sensor_reading(ctx_);
        if (value && readingType == IPMI_MONITORING_SENSOR_READING_TYPE_DOUBLE)
            s.reading = *static_cast<double const*>(value);
        else if (value && readingType == IPMI_MONITORING_SENSOR_READING_TYPE_UNSIGNED_INTEGER32)
            s.reading = *static_cast<uint32_t const*>(value);
        int const state = ipmi_monitoring_sensor_read_sensor_state(ctx_);
        bool const threshold = ipmi_monitoring_sensor_read_sensor_bitmask_type(ctx_) ==
                               IPMI_MONITORING_SENSOR_BITMASK_TYPE_THRESHOLD;
        s.thresholdBased = threshold;
        s.state = state == IPMI_MONITORING_STATE_UNKNOWN || (threshold && !s.reading)
                      ? "unknown"
                  : threshold ? thresholdState(ipmi_monitoring_sensor_read_sensor_bitmask(ctx_))
                              : discreteState(state);
        if (char** words = ipmi_monitoring_sensor_read_sensor_bitmask_strings(ctx_))
            for (; *words; ++words)
                s.event += (s.event.empty() ? "" : "; ") + std::string(*words);
        out.push_back(std::move(s));
    }
    return true;
}

} // namespace ipmi
