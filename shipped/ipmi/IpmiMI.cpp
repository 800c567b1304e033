#include "IpmiMI.h"

#include "IpmiConfig.h"
#include "Log.h"
#include "SharedTree.h"
#include "OpenShippedMI.h"
#include "ShippedAlerts.h"

#include <SD/PlatformUtilities.h>

#include <freeipmi/freeipmi.h>

#include <sys/stat.h>

#include <cstdio>
#include <filesystem>
#include <cstdlib>
#include <system_error>

#ifndef IC_IPMI_DEFAULT_CONFIG
#define IC_IPMI_DEFAULT_CONFIG "/etc/instrumentationcontrol/ipmi.conf"
#define IC_IPMI_CONFIG_FROM_LIBDIR ""
#endif

namespace ipmi {

namespace {

using IC::Node;

IC::Error ok()
{
    return IC::Error(0, IC::Number(IC::Number::Generic), std::string());
}

// FNV-1a folded to 16 bits: short instances that do not move when others
// come and go.
unsigned int digest(std::string const& s)
{
    std::uint32_t h = 2166136261u;
    for (unsigned char c : s)
        h = (h ^ c) * 16777619u;
    return (h >> 16) ^ (h & 0xFFFF);
}

// The node type nearest to an IPMI sensor type (README.md has the table).
Node::SensorType typeOf(int ipmiType)
{
    switch (ipmiType) {
    case IPMI_MONITORING_SENSOR_TYPE_TEMPERATURE: return Node::TemperatureSensor;
    case IPMI_MONITORING_SENSOR_TYPE_VOLTAGE:
    case IPMI_MONITORING_SENSOR_TYPE_CURRENT: return Node::VoltageSensor;
    case IPMI_MONITORING_SENSOR_TYPE_FAN:
    case IPMI_MONITORING_SENSOR_TYPE_COOLING_DEVICE: return Node::Fan;
    case IPMI_MONITORING_SENSOR_TYPE_PHYSICAL_SECURITY: return Node::Intrusion;
    case IPMI_MONITORING_SENSOR_TYPE_PROCESSOR: return Node::CPU;
    case IPMI_MONITORING_SENSOR_TYPE_POWER_SUPPLY:
    case IPMI_MONITORING_SENSOR_TYPE_POWER_UNIT: return Node::PowerSupply;
    case IPMI_MONITORING_SENSOR_TYPE_MEMORY: return Node::DIMM;
    case IPMI_MONITORING_SENSOR_TYPE_DRIVE_SLOT: return Node::DriveSlotSensor;
    case IPMI_MONITORING_SENSOR_TYPE_SYSTEM_FIRMWARE_PROGRESS: return Node::BIOS;
    case IPMI_MONITORING_SENSOR_TYPE_EVENT_LOGGING_DISABLED: return Node::Log;
    case IPMI_MONITORING_SENSOR_TYPE_WATCHDOG1:
    case IPMI_MONITORING_SENSOR_TYPE_WATCHDOG2: return Node::BMC;
    default: return Node::PFASensor;
    }
}

// The node type of an IPMI entity that gets a node of its own, grouping its
// sensors and carrying its FRU inventory (README.md has the table); Unknown
// for the others, whose sensors hang below the chassis.
Node::SensorType entityTypeOf(unsigned int entityId)
{
    switch (entityId) {
    case IPMI_ENTITY_ID_PROCESSOR:
    case IPMI_ENTITY_ID_PROCESSOR_MODULE: return Node::CPU;
    case IPMI_ENTITY_ID_SYSTEM_BOARD: return Node::Planar;
    case IPMI_ENTITY_ID_MEMORY_MODULE:
    case IPMI_ENTITY_ID_MEMORY_DEVICE: return Node::DIMM;
    case IPMI_ENTITY_ID_POWER_SUPPLY:
    case IPMI_ENTITY_ID_POWER_MODULE_DC_TO_DC_CONVERTER: return Node::PowerSupply;
    case IPMI_ENTITY_ID_POWER_UNIT_POWER_DOMAIN: return Node::PowerDomain;
    case IPMI_ENTITY_ID_COOLING_UNIT_COOLING_DOMAIN: return Node::CoolingDomain;
    case IPMI_ENTITY_ID_FRONT_PANEL_BOARD: return Node::FrontPanel;
    case IPMI_ENTITY_ID_BACK_PANEL_BOARD: return Node::BackPanel;
    default: return Node::Unknown;
    }
}

std::string number(double v)
{
    char text[64];
    std::snprintf(text, sizeof text, "%.2f", v);
    return text;
}

unsigned int statusOf(std::string const& state)
{
    return state == "critical" ? shipped::kStatusCritical
           : state == "warning" ? shipped::kStatusWarning
                                : shipped::kStatusNormal;
}

unsigned int pollInterval()
{
    char const* text = std::getenv("IC_IPMI_POLL_MS");
    if (!text || !*text)
        return 10000;
    char* end = nullptr;
    unsigned long const ms = std::strtoul(text, &end, 10);
    if (*end || ms < 100 || ms > 3600000) {
        IPMI_LOG(kWarning, "IC_IPMI_POLL_MS='", text, "' is not 100..3600000; polling every 10000 ms");
        return 10000;
    }
    return static_cast<unsigned int>(ms);
}

} // namespace

IpmiMI::IpmiMI() = default;

IpmiMI::~IpmiMI()
{
    stop();
}

void IpmiMI::registerNodeCallBacks(IC::NodeArrivalCallBack arrival, void const* context,
                                   IC::NodeLookupCallBack lookup)
{
    std::lock_guard<std::mutex> g(lock_);
    arrivalCB_ = arrival;
    arrivalContext_ = context;
    lookup_ = lookup;
}

IC::Error IpmiMI::registerForAlerts(IC::AlertCallBack callback, void const* context)
{
    std::lock_guard<std::mutex> g(lock_);
    alertCB_ = callback;
    alertContext_ = context;
    return ok();
}

IpmiMI::Node* IpmiMI::newNode(Node::SensorType type, unsigned int instance, unsigned int parent,
                              std::string const& desc)
{
    unsigned int const id = base_ | (nextNumber_++ & 0xFFFF);
    nodes_.push_back(std::make_unique<Node>(type, instance, id, parent, desc, id));
    order_.push_back(nodes_.back().get());
    return nodes_.back().get();
}

IC::Error IpmiMI::Initialize(unsigned int nodeIdBase, IC::Number, IC::Number)
{
    char const* env = std::getenv("IC_IPMI_CONFIG");
    std::string const configPath =
        env && *env ? env : SD::PlatformUtilities::getInstalledPath(IC_IPMI_CONFIG_FROM_LIBDIR, IC_IPMI_DEFAULT_CONFIG);
    std::vector<BmcConfig> configs = readConfig(configPath);
    struct stat st {};
    bool const inBand = ::stat("/dev/ipmi0", &st) == 0 && S_ISCHR(st.st_mode);
    if (inBand)
        configs.insert(configs.begin(), BmcConfig());
    std::string const dataDir = SD::PlatformUtilities::getBriscaDataDir() + "/ipmi";
    std::error_code ec;
    std::filesystem::create_directories(dataDir, ec);
    if (ec)
        IPMI_LOG(kError, "cannot make ", dataDir, " (", ec.message(), "): no SDR cache, no SEL seen-state");

    std::unique_lock<std::mutex> g(lock_);
    if (initialized_)
        return IC::Error(1, IC::Number(IC::Number::Generic), "ipmi: initialised twice");
    initialized_ = true;
    base_ = nodeIdBase & 0xFFFF0000u;
    pollMs_ = pollInterval();
    if (configs.empty()) {
        IPMI_LOG(kProgress, "no BMC: no /dev/ipmi0 and no BMC configured in ", configPath,
                 "; reporting nothing");
        return ok();
    }
    // The shared top of the tree (SharedTree.h): adopt what another plug-in
    // reports, or report it ourselves. The host's chassis too, even with
    // out-of-band BMCs only, so that a plug-in loaded later finds both.
    shipped::SharedTop const top = shipped::sharedTop();
    unsigned int rootId = shipped::adoptedNodeId(lookup_, top.rootId, shipped::kRootPath);
    unsigned int chassisId = shipped::adoptedNodeId(lookup_, top.chassisId, shipped::kChassisPath);
    adoptedRootId_ = rootId;
    adoptedChassisId_ = chassisId;
    if (rootId == 0) {
        rootId = ownRootId_ = newNode(Node::ROOT, 0, 0, "Server with a BMC")->getNodeId();
        if (chassisId == 0)
            chassisId = newNode(Node::Chassis, 0, rootId, "This server")->getNodeId();
        shipped::announceTop({rootId, chassisId});
    } else if (chassisId == 0) {
        chassisId = newNode(Node::Chassis, 0, rootId, "This server")->getNodeId();
    }
    chassisId_ = chassisId;
    std::set<unsigned int> chassisInstances{0};
    for (BmcConfig& c : configs) {
        auto b = std::make_unique<Bmc>();
        bool const local = c.name.empty();
        b->label = local ? "in-band BMC" : "BMC " + c.name + " (" + c.host + ":" + std::to_string(c.port) + ")";
        std::string const dir = dataDir + "/" + (local ? std::string("local") : std::to_string(digest(c.name)));
        if (local) {
            b->parentId = chassisId;
        } else {
            unsigned int instance = digest(c.name);
            while (!chassisInstances.insert(instance).second)
                instance = (instance + 1) & 0xFFFF;
            b->chassis = newNode(Node::Chassis, instance, rootId, "Chassis of " + b->label);
            b->parentId = b->chassis->getNodeId();
        }
        b->bmcNode.node = newNode(Node::BMC, 0, b->parentId, b->label);
        b->bmcNode.node->setProperty("host", local ? "/dev/ipmi0" : c.host + ":" + std::to_string(c.port));
        b->reader = std::make_unique<BmcReader>(std::move(c), dir);
        bmcs_.push_back(std::move(b));
    }
    // One thread per BMC: each has its own session, and one that does not
    // answer holds up only its own readings.
    for (auto& b : bmcs_) {
        try {
            b->thread = std::thread([this, bmc = b.get()] { run(*bmc); });
        } catch (std::system_error const& e) {
            ++firstPasses_; // nothing to wait for
            IPMI_LOG(kError, "no thread to read ", b->label, " (", e.what(), "); it is not read");
        }
    }
    // Open waits for one pass, but not for a BMC that does not answer.
    if (!wake_.wait_for(g, std::chrono::milliseconds(kOpenWaitMs), [this] { return firstPasses_ == bmcs_.size(); }))
        IPMI_LOG(kWarning, "the BMCs did not all answer within ", kOpenWaitMs,
                 " ms; their sensors are reported when they do");
    IPMI_LOG(kProgress, "reporting ", order_.size(), " nodes from ", bmcs_.size(), " BMCs, polling every ",
             pollMs_, " ms");
    return ok();
}

IC::Error IpmiMI::getMap(std::vector<IC::Node*>& nodes)
{
    std::lock_guard<std::mutex> g(lock_);
    nodes.insert(nodes.end(), order_.begin(), order_.end());
    mapped_ = true;
    return ok();
}

void IpmiMI::run(Bmc& b)
{
    // bmcs_ is fixed once the threads run; b's reader is this thread's.
    std::unique_lock<std::mutex> g(lock_);
    for (bool first = true; !stopping_; first = false) {
        Outbox moved;
        // The adopted ROOT is gone once the plug-in that reported it withdrew
        // it (it was released); its node is never touched from here.
        // Whichever thread sees it first moves every BMC's nodes.
        if (mapped_ && shipped::adoptedTopGone(adoptedRootId_))
            rehome(moved);
        bool const due = std::chrono::steady_clock::now() >= b.nextTry;
        g.unlock();
        deliver(moved);
        if (due) {
            Outbox out;
            readBmc(b, out);
            deliver(out);
        }
        g.lock();
        if (first) {
            ++firstPasses_;
            wake_.notify_all();
        }
        wake_.wait_for(g, std::chrono::milliseconds(pollMs_), [this] { return stopping_; });
    }
}

void IpmiMI::judge(Tracked& t, std::string const& state, std::string const& message, Outbox& out)
{
    t.state = state;
    unsigned int const status = statusOf(state);
    std::string const path = t.node->knownPath();
    // Unknown keeps the condition last reported; before the library has the
    // node (no path) a condition is only shown, for health to assert.
    if (state != "unknown" && status != t.raised) {
        t.raised = status;
        t.message = message;
        if (mapped_ && !path.empty()) {
            out.alerts.emplace_back(shipped::severityOf(status), shipped::kThreshold,
                                    std::vector<std::string>{path}, status, message);
            IPMI_LOG(status == shipped::kStatusNormal ? kProgress : kWarning, "alert: ", message);
        }
    }
    shipped::showCondition(*t.node, state, t.raised, shipped::kThreshold, t.message);
}

void IpmiMI::readBmc(Bmc& b, Outbox& out)
{
    std::vector<Sensor> sensors;
    std::vector<SelEvent> events;
    std::string error, selError;
    bool const answered = b.reader->read(sensors, error);
    if (answered && !b.reader->newEvents(events, selError))
        IPMI_LOG(kWarning, b.label, ": the event log could not be read: ", selError);
    std::lock_guard<std::mutex> g(lock_);
    if (!answered) {
        ++b.failures;
        // Back off: 2, 4, then 8 intervals between tries while it is away.
        b.nextTry = std::chrono::steady_clock::now() +
                    std::chrono::milliseconds(pollMs_) * ((1u << std::min(b.failures, 3u)) - 1);
        if (b.reachable || b.failures == 1)
            IPMI_LOG(kError, b.label, " does not answer: ", error);
        b.reachable = false;
        judge(b.bmcNode, "critical", b.label + " is unreachable: " + error, out);
        for (auto& s : b.sensors)
            judge(s.second, "unknown", s.second.message, out);
        return;
    }
    b.failures = 0;
    b.nextTry = {};
    if (!b.reachable)
        IPMI_LOG(kProgress, b.label, " answers again");
    b.reachable = true;
    judge(b.bmcNode, "ok", b.label + " answers again", out);
    Node::Property p;
    if (!b.reader->firmware().empty() && !b.bmcNode.node->getProperty("version", &p)) {
        b.bmcNode.node->setProperty("version", b.reader->firmware());
        b.bmcNode.node->setProperty("ipmi_version", b.reader->ipmiVersion());
    }
    for (Sensor const& s : sensors) {
        std::string const key = std::to_string(s.entityId) + "." + std::to_string(s.entityInstance) + "/" + s.name;
        auto it = b.sensors.find(key);
        if (it == b.sensors.end()) {
            Node::SensorType const type = typeOf(s.type);
            Node const* entity = entityNode(b, s.entityId, s.entityInstance, out);
            unsigned int const parent = entity ? entity->getNodeId() : b.parentId;
            // Identity from facts that survive restarts and SDR reorders:
            // entity id, entity instance and name, never the record id.
            unsigned int const instance = claimInstance(b, parent, type, digest(key));
            it = b.sensors.emplace(key, Tracked()).first;
            it->second.node = newNode(type, instance, parent, s.name);
            it->second.node->setProperty("entity", std::to_string(s.entityId) + "." + std::to_string(s.entityInstance));
            if (mapped_)
                out.arrivals.push_back(it->second.node);
        }
        Node& n = *it->second.node;
        if (s.reading || s.thresholdBased)
            n.setProperty("reading", s.reading ? number(*s.reading) : "unknown", s.unit);
        static char const* const names[4] = {"lower_critical", "lower_warning", "upper_warning", "upper_critical"};
        for (int k = 0; k < 4; ++k)
            if (s.thresholds[k])
                n.setProperty(names[k], number(*s.thresholds[k]), s.unit);
        if (!s.event.empty())
            n.setProperty("event", s.event);
        std::string const message = b.label + " " + s.name + " " +
                                    (s.reading ? number(*s.reading) + (s.unit.empty() ? "" : " " + s.unit) + " " : "") +
                                    s.state + (s.event.empty() ? "" : ": " + s.event);
        judge(it->second, s.state, message, out);
    }
    if (!b.inventoryShown && !b.reader->inventory().empty()) {
        b.inventoryShown = true;
        for (Inventory const& item : b.reader->inventory())
            if (Node* n = entityNode(b, item.entityId, item.entityInstance, out))
                for (auto const& [name, value] : {std::pair{"vendor", &item.vendor}, {"model", &item.model},
                                                  {"serial", &item.serial}})
                    if (!value->empty())
                        n->setProperty(name, *value);
    }
    std::string const bmcPath = b.bmcNode.node->knownPath();
    for (SelEvent const& e : events) {
        unsigned char const severity = e.state == IPMI_MONITORING_STATE_CRITICAL  ? shipped::kSeverityCritical
                                       : e.state == IPMI_MONITORING_STATE_WARNING ? shipped::kSeverityWarning
                                                                                  : shipped::kSeverityInfo;
        IPMI_LOG(severity == shipped::kSeverityInfo ? kProgress : kWarning, b.label, " ", e.text);
        if (!bmcPath.empty())
            out.alerts.emplace_back(severity, shipped::kEventLog, std::vector<std::string>{bmcPath},
                                    shipped::kStatusNormal, b.label + " " + e.text);
    }
}

void IpmiMI::rehome(Outbox& out)
{
    // Our nodes hang below a ROOT (and maybe a Chassis) the library no longer
    // has: take them back and announce them again below our own, or below
    // those a plug-in loaded in the same reload reports already (adopted by
    // the ids of the record alone: their nodes are not touched from here).
    shipped::SharedTop const now = shipped::sharedTop();
    bool const ownChassis = adoptedChassisId_ == 0; // ours stays, relinked
    std::vector<std::string> paths;
    for (Node const* n : order_)
        if (std::string path = n->knownPath(); !path.empty())
            paths.push_back(std::move(path));
    std::string const message = shipped::rehomeMessage("ipmi", now);
    IPMI_LOG(kWarning, message);
    if (!paths.empty())
        out.removals.emplace_back(shipped::kSeverityInfo, shipped::kNodeRemoval, paths, shipped::kStatusNormal,
                                  message);
    std::vector<Node*> const announced = order_;
    if (now.rootId == 0)
        ownRootId_ = newNode(Node::ROOT, 0, 0, "Server with a BMC")->getNodeId();
    unsigned int const rootId = now.rootId != 0 ? now.rootId : ownRootId_;
    unsigned int const chassisId = ownChassis                          ? chassisId_
                                   : now.rootId != 0 && now.chassisId != 0 ? now.chassisId
                                       : newNode(Node::Chassis, 0, rootId, "This server")->getNodeId();
    out.arrivals.assign(order_.begin() + static_cast<std::ptrdiff_t>(announced.size()), order_.end());
    auto const moved = [&](unsigned int id) {
        return id == adoptedRootId_ ? rootId : id == adoptedChassisId_ && id != 0 ? chassisId : id;
    };
    for (Node* n : announced) {
        n->setLinkedId(moved(n->getLinkedId()));
        out.arrivals.push_back(n);
    }
    for (auto& b : bmcs_) {
        b->parentId = moved(b->parentId);
        decltype(b->instances) claims;
        for (auto const& [parent, type, instance] : b->instances)
            claims.emplace(moved(parent), type, instance);
        b->instances.swap(claims);
    }
    adoptedRootId_ = now.rootId;
    adoptedChassisId_ = chassisId == now.chassisId && !ownChassis ? chassisId : 0;
    chassisId_ = chassisId;
    if (now.rootId == 0)
        shipped::announceTop({rootId, chassisId});
}

unsigned int IpmiMI::claimInstance(Bmc& b, unsigned int parent, Node::SensorType type, unsigned int wanted)
{
    while (!b.instances.emplace(parent, type, wanted).second)
        wanted = (wanted + 1) & 0xFFFF;
    return wanted;
}

IpmiMI::Node* IpmiMI::entityNode(Bmc& b, unsigned int entityId, unsigned int entityInstance, Outbox& out)
{
    Node::SensorType const type = entityTypeOf(entityId);
    if (type == Node::Unknown)
        return nullptr;
    auto const key = std::make_pair(entityId, entityInstance);
    if (auto const found = b.entities.find(key); found != b.entities.end())
        return found->second;
    // The entity's own instance number; two entities of one node type with
    // the same number (a processor and a processor module) keep both facts.
    unsigned int const wanted = b.instances.count({b.parentId, type, entityInstance}) == 0
                                    ? entityInstance
                                    : (entityId << 8 | entityInstance);
    char const* name = ipmi_get_entity_id_string(static_cast<uint8_t>(entityId));
    Node* n = newNode(type, claimInstance(b, b.parentId, type, wanted), b.parentId,
                      std::string(name ? name : "Entity") + " " + std::to_string(entityInstance));
    n->setProperty("entity", std::to_string(entityId) + "." + std::to_string(entityInstance));
    b.entities.emplace(key, n);
    if (mapped_)
        out.arrivals.push_back(n);
    return n;
}

void IpmiMI::deliver(Outbox& out)
{
    IC::NodeArrivalCallBack arrival;
    IC::AlertCallBack alert;
    void const *arrivalContext, *alertContext;
    {
        std::lock_guard<std::mutex> g(lock_);
        arrival = arrivalCB_;
        alert = alertCB_;
        arrivalContext = arrivalContext_;
        alertContext = alertContext_;
    }
    if (alert && !out.removals.empty())
        alert(out.removals, alertContext);
    for (Node* n : out.arrivals) {
        if (!arrival)
            break;
        arrival(n, arrivalContext);
        // What was wrong with it is told once it has a path.
        if (shipped::conditionOf(*n, out.alerts))
            IPMI_LOG(kWarning, "alert: ", out.alerts.back().getMessage());
    }
    if (alert && !out.alerts.empty())
        alert(out.alerts, alertContext);
}

void IpmiMI::stop()
{
    {
        std::lock_guard<std::mutex> g(lock_);
        stopping_ = true;
    }
    wake_.notify_all();
    for (auto& b : bmcs_)
        if (b->thread.joinable())
            b->thread.join();
}

IC::Error IpmiMI::shutdown()
{
    stop();
    return ok();
}

void IpmiMI::release()
{
    stop();
    if (ownRootId_ != 0)
        shipped::withdrawTop(ownRootId_);
    // The library keeps pointers to our nodes, whose code leaves with us.
    std::vector<std::string> paths;
    for (auto const& n : nodes_) {
        std::string path = n->knownPath();
        if (!path.empty())
            paths.push_back(std::move(path));
    }
    if (alertCB_ && !paths.empty())
        alertCB_(std::vector<IC::Alert>{IC::Alert(shipped::kSeverityInfo, shipped::kNodeRemoval, paths,
                                                  shipped::kStatusNormal, "ipmi unloaded")},
                 alertContext_);
    delete this;
}

} // namespace ipmi

extern "C" __attribute__((visibility("default"))) unsigned char
OpenMI(IC::ManagementInterface** mi, IC::Error** err)
{
    return shipped::openMI<ipmi::IpmiMI>(mi, err, "ipmi");
}
