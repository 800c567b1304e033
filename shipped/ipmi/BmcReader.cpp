#include "BmcReader.h"

#include "Log.h"

#include <freeipmi/freeipmi.h>

#include <dirent.h>
#include <dlfcn.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>

namespace ipmi {

namespace {

// Keeps the library holding fn loaded for good: FreeIPMI's global state
// (made by ipmi_monitoring_init, which has no counterpart) would otherwise
// be lost, and made again, every time a reload unloads this plug-in.
void pin(void* fn)
{
    Dl_info info{};
    if (::dladdr(fn, &info) != 0 && info.dli_fname)
        ::dlopen(info.dli_fname, RTLD_NOW | RTLD_NOLOAD | RTLD_NODELETE);
}

bool initLibrary()
{
    static bool const ok = [] {
        pin(reinterpret_cast<void*>(&ipmi_monitoring_init));
        pin(reinterpret_cast<void*>(&ipmi_ctx_create));
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

// The BMC's own address on the IPMB, as the SDR writes it (7 bits, shifted).
constexpr uint8_t kBmcAddress = 0x20;

// The FRU the current SDR record locates, when the BMC itself serves it: a
// logical FRU device at the BMC's address, or the BMC's own FRU 0.
template <class Locator>
void addFruLocator(ipmi_sdr_ctx_t sdr, uint8_t recordType, std::vector<Locator>& out)
{
    uint8_t address = 0, device = 0, bus = 0, lun = 0, logical = 0, channel = 0, eid = 0, einst = 0;
    if (recordType == IPMI_SDR_FORMAT_FRU_DEVICE_LOCATOR_RECORD) {
        if (ipmi_sdr_parse_fru_device_locator_parameters(sdr, nullptr, 0, &address, &device, &bus, &lun, &logical,
                                                         &channel) < 0 ||
            ipmi_sdr_parse_fru_entity_id_and_instance(sdr, nullptr, 0, &eid, &einst) < 0 || !logical ||
            (address << 1) != kBmcAddress || bus != 0 || lun != 0 || channel != 0)
            return;
        out.push_back({device, eid, einst});
        return;
    }
    uint8_t slave = 0, f[14] = {};
    if (ipmi_sdr_parse_management_controller_device_locator_parameters(
            sdr, nullptr, 0, &slave, &channel, &f[0], &f[1], &f[2], &f[3], &f[4], &f[5], &f[6], &f[7], &f[8], &f[9],
            &f[10], &f[11], &f[12], &f[13]) < 0 ||
        ipmi_sdr_parse_entity_id_instance_type(sdr, nullptr, 0, &eid, &einst, &bus) < 0)
        return;
    // f[9]: the controller is a FRU inventory device (its FRU 0).
    if ((slave << 1) == kBmcAddress && channel == 0 && f[9])
        out.push_back({0, eid, einst});
}

// What tells one SDR cache file from another: name, inode, time and size;
// "" when there is none.
std::string cacheStamp(std::string const& dir)
{
    std::string const file = cacheFileIn(dir);
    struct stat st {};
    if (file.empty() || ::stat(file.c_str(), &st) != 0)
        return std::string();
    return file + " " + std::to_string(st.st_ino) + " " + std::to_string(st.st_mtim.tv_sec) + "." +
           std::to_string(st.st_mtim.tv_nsec) + " " + std::to_string(st.st_size);
}

} // namespace

BmcReader::BmcReader(BmcConfig config, std::string cacheDir)
    : config_(std::move(config)), cacheDir_(std::move(cacheDir)),
      host_(config_.host + ":" + std::to_string(config_.port))
{
}

char const* BmcReader::hostname() const
{
    return config_.name.empty() ? nullptr : host_.c_str();
}

ipmi_monitoring_ipmi_config BmcReader::ipmiConfig() const
{
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
    return cfg;
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
    frus_.clear();
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
            if (recordType == IPMI_SDR_FORMAT_FRU_DEVICE_LOCATOR_RECORD ||
                recordType == IPMI_SDR_FORMAT_MANAGEMENT_CONTROLLER_DEVICE_LOCATOR_RECORD)
                addFruLocator(sdr, recordType, frus_);
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
    ipmi_monitoring_ipmi_config cfg = ipmiConfig();
    unsigned int const flags = IPMI_MONITORING_SENSOR_READING_FLAGS_DISCRETE_READING;
    std::string const before = cacheStamp(cacheDir_);
    int const n = ipmi_monitoring_sensor_readings_by_record_id(ctx_, hostname(), &cfg, flags, nullptr, 0, nullptr, nullptr);
    if (n < 0) {
        error = ipmi_monitoring_ctx_errormsg(ctx_);
        return false;
    }
    // libipmimonitoring downloads the SDR only when the cache is missing or
    // older than the BMC's repository.
    if (std::string const after = cacheStamp(cacheDir_); after != before) {
        ++sdrDownloads_;
        IPMI_LOG(kDebug, "SDR of ", config_.name.empty() ? "the in-band BMC" : host_, " downloaded (",
                 sdrDownloads_, " since start): ", after);
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

namespace {

struct SelState {
    unsigned int lastId = 0;
    unsigned long long added = 0;
    unsigned long long erased = 0;
};

// Runs ask on a libfreeipmi session with the BMC; false with error set when
// the session or ask fails.
template <class Ask>
bool withSession(BmcConfig const& c, char const* hostname, std::string& error, Ask ask)
{
    ipmi_ctx_t ctx = ipmi_ctx_create();
    if (!ctx) {
        error = "out of memory";
        return false;
    }
    int const opened =
        hostname ? ipmi_ctx_open_outofband_2_0(ctx, hostname, c.user.c_str(), c.password.c_str(), nullptr, 0,
                                               static_cast<uint8_t>(c.privilege + IPMI_PRIVILEGE_LEVEL_USER),
                                               static_cast<uint8_t>(c.cipherSuite), BmcReader::kSessionTimeoutMs,
                                               500, c.workarounds, 0)
                 : ipmi_ctx_open_inband(ctx, IPMI_DEVICE_OPENIPMI, 1, 0, 0, "/dev/ipmi0", 0, 0);
    bool const done = opened >= 0 && ask(ctx);
    if (!done)
        error = ipmi_ctx_errormsg(ctx);
    if (opened >= 0)
        ipmi_ctx_close(ctx);
    ipmi_ctx_destroy(ctx);
    return done;
}

// Reads the fields of a response template; false when the command fails.
template <class Command>
bool fields(ipmi_ctx_t ctx, fiid_template_t tmpl, Command command,
            std::initializer_list<std::pair<char const*, uint64_t*>> wanted)
{
    fiid_obj_t rs = fiid_obj_create(tmpl);
    bool ok = rs && command(ctx, rs) >= 0;
    for (auto const& [name, value] : wanted)
        ok = ok && fiid_obj_get(rs, name, value) >= 0;
    if (rs)
        fiid_obj_destroy(rs);
    return ok;
}

// The text of a FRU field, without the padding FRUs often carry and with
// control characters (a BMC's data is not trusted) shown as '?'; "" when it
// is empty or cannot be read.
std::string fruText(ipmi_fru_ctx_t fru, ipmi_fru_field_t const& field, uint8_t language)
{
    char text[IPMI_FRU_AREA_STRING_MAX + 1] = {};
    unsigned int length = IPMI_FRU_AREA_STRING_MAX;
    if (field.type_length_field_length == 0 ||
        ipmi_fru_type_length_field_to_string(fru, field.type_length_field, field.type_length_field_length, language,
                                             text, &length) < 0)
        return std::string();
    std::string out(text, std::min<unsigned int>(length, IPMI_FRU_AREA_STRING_MAX));
    for (char& c : out)
        if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f)
            c = '?';
    // Padding: spaces, or NULs (now '?') after the text.
    std::size_t const first = out.find_first_not_of(' '), last = out.find_last_not_of(" ?");
    return last == std::string::npos ? std::string() : out.substr(first, last + 1 - first);
}

} // namespace

void BmcReader::readInventory(ipmi_ctx_t ctx)
{
    inventory_.clear();
    ipmi_fru_ctx_t fru = ipmi_fru_ctx_create(ctx);
    if (!fru)
        return;
    std::vector<unsigned char> area(IPMI_FRU_AREA_SIZE_MAX + 1);
    for (FruLocator const& at : frus_) {
        if (ipmi_fru_open_device_id(fru, static_cast<uint8_t>(at.deviceId)) < 0) {
            IPMI_LOG(kWarning, "FRU ", at.deviceId, " of ", host_, " cannot be read: ", ipmi_fru_ctx_errormsg(fru));
            continue;
        }
        // The product area names the part that was sold; the board area is
        // the fall-back (a board often has nothing else).
        std::string product[3], board[3];
        do {
            unsigned int type = 0, length = 0;
            if (ipmi_fru_read_data_area(fru, &type, &length, area.data(), IPMI_FRU_AREA_SIZE_MAX) < 0)
                break;
            uint8_t language = 0;
            uint32_t made = 0;
            ipmi_fru_field_t f[7] = {};
            if (type == IPMI_FRU_AREA_TYPE_PRODUCT_INFO_AREA &&
                ipmi_fru_product_info_area(fru, area.data(), length, &language, &f[0], &f[1], &f[2], &f[3], &f[4], &f[5],
                                           &f[6], nullptr, 0) == 0) {
                product[0] = fruText(fru, f[0], language);
                product[1] = fruText(fru, f[1], language);
                product[2] = fruText(fru, f[4], language);
            } else if (type == IPMI_FRU_AREA_TYPE_BOARD_INFO_AREA &&
                       ipmi_fru_board_info_area(fru, area.data(), length, &language, &made, &f[0], &f[1], &f[2], &f[3],
                                                &f[4], nullptr, 0) == 0) {
                for (int k = 0; k < 3; ++k)
                    board[k] = fruText(fru, f[k], language);
            }
        } while (ipmi_fru_next(fru) == 1);
        ipmi_fru_close_device_id(fru);
        Inventory item{at.entityId, at.entityInstance, {}, {}, {}};
        std::string* fields[3] = {&item.vendor, &item.model, &item.serial};
        for (int k = 0; k < 3; ++k)
            *fields[k] = product[k].empty() ? board[k] : product[k];
        if (!item.vendor.empty() || !item.model.empty() || !item.serial.empty())
            inventory_.push_back(std::move(item));
    }
    ipmi_fru_ctx_destroy(fru);
}

bool BmcReader::newEvents(std::vector<SelEvent>& out, std::string& error)
{
    std::string const stateFile = cacheDir_ + "/sel-seen";
    SelState seen, now;
    bool const known = static_cast<bool>(std::ifstream(stateFile) >> seen.lastId >> seen.added >> seen.erased);
    uint64_t added = 0, erased = 0;
    bool const wantId = firmware_.empty();
    uint64_t major = 0, minor = 0, ipmiMajor = 0, ipmiMinor = 0;
    if (!withSession(config_, hostname(), error, [&](ipmi_ctx_t ctx) {
            if (!fields(ctx, tmpl_cmd_get_sel_info_rs, ipmi_cmd_get_sel_info,
                        {{"most_recent_addition_timestamp", &added}, {"most_recent_erase_timestamp", &erased}}))
                return false;
            if (!wantId)
                return true;
            // Versions and inventory do not change while the BMC runs: asked once.
            if (!fields(ctx, tmpl_cmd_get_device_id_rs, ipmi_cmd_get_device_id,
                        {{"firmware_revision1.major_revision", &major},
                         {"firmware_revision2.minor_revision", &minor},
                         {"ipmi_version_major", &ipmiMajor},
                         {"ipmi_version_minor", &ipmiMinor}}))
                return false;
            readInventory(ctx);
            return true;
        }))
        return false;
    now.added = added;
    now.erased = erased;
    if (wantId) {
        char text[32];
        std::snprintf(text, sizeof text, "%u.%02x", static_cast<unsigned int>(major), static_cast<unsigned int>(minor));
        firmware_ = text;
        ipmiVersion_ = std::to_string(ipmiMajor) + "." + std::to_string(ipmiMinor);
    }
    if (known && now.added == seen.added && now.erased == seen.erased)
        return true;
    ipmi_monitoring_ipmi_config cfg = ipmiConfig();
    int const n = ipmi_monitoring_sel_by_record_id(ctx_, hostname(), &cfg, 0, nullptr, 0, nullptr, nullptr);
    if (n < 0 && ipmi_monitoring_ctx_errnum(ctx_) != IPMI_MONITORING_ERR_NO_SEL_RECORDS) {
        error = ipmi_monitoring_ctx_errormsg(ctx_);
        return false;
    }
    // After a clear every record is new, whatever its id.
    bool const cleared = known && now.erased != seen.erased;
    now.lastId = cleared ? 0 : seen.lastId;
    for (int i = 0; i < n; ++i, ipmi_monitoring_sel_iterator_next(ctx_)) {
        int const id = ipmi_monitoring_sel_read_record_id(ctx_);
        if (id < 0 || (!cleared && static_cast<unsigned int>(id) <= seen.lastId))
            continue;
        now.lastId = std::max(now.lastId, static_cast<unsigned int>(id));
        if (!known)
            continue; // a log met for the first time is history, not news
        SelEvent e;
        e.id = static_cast<unsigned int>(id);
        e.state = ipmi_monitoring_sel_read_sel_state(ctx_);
        char const* sensor = ipmi_monitoring_sel_read_sensor_name(ctx_);
        char const* what = ipmi_monitoring_sel_read_event_offset_string(ctx_);
        e.sensor = sensor ? sensor : "";
        e.text = std::string("SEL record ") + std::to_string(id) + ": " + (sensor ? sensor : "no sensor") + ": " +
                 (what ? what : "unknown event");
        out.push_back(std::move(e));
    }
    std::ofstream(stateFile + ".new") << now.lastId << ' ' << now.added << ' ' << now.erased << '\n';
    if (std::rename((stateFile + ".new").c_str(), stateFile.c_str()) != 0)
        IPMI_LOG(kWarning, "cannot keep the SEL seen-state in ", stateFile, ": ", std::strerror(errno));
    return true;
}

} // namespace ipmi
