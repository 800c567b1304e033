#include "HealthPlugIn.h"

#include "ShippedAlerts.h"

#include <HGLog/HGLogger.h>
#include <IC/InstrumentationControl.h>
#include <IC/Number.h>

#include <chrono>
#include <condition_variable>
#include <exception>
#include <string>
#include <utility>

namespace health {
namespace {

std::string const kLogger = "Helmgard.IC.Health";

#define HEALTH_LOG(level, ...) HGLOG_EVENT("Health", kLogger, level, __VA_ARGS__)

// Sensor types 0..73; 74 is the answer for an unknown node.
constexpr unsigned int kSensorTypes = IC::Node::invalid;

IC::Error ok()
{
    return IC::Error(0, IC::Number(IC::Number::Generic), std::string());
}

// Non-zero while this thread raises alerts. The library delivers a raised
// batch synchronously, to our own registration too, on the raising thread;
// those deliveries are our own alerts coming back and are not raised again.
thread_local int tRaising = 0;

struct RaisingScope {
    RaisingScope() { ++tRaising; }
    ~RaisingScope() { --tRaising; }
    RaisingScope(RaisingScope const&) = delete;
    RaisingScope& operator=(RaisingScope const&) = delete;
};

// The instances alive in this image and the callbacks each has under way. A
// delivery the library had already picked when release() deregistered still
// arrives; it must find out that the object is gone before touching it.
struct Live {
    int active = 0;
    bool closing = false;
};
std::mutex gLiveLock;
std::condition_variable gLiveChanged;
std::map<HealthPlugIn const*, Live> gLive;

char const* severityName(unsigned int severity)
{
    switch (severity) {
    case shipped::kSeverityInfo: return "information";
    case shipped::kSeverityWarning: return "warning";
    case shipped::kSeverityCritical: return "critical";
    case shipped::kSeverityFatal: return "fatal";
    default: return "unknown";
    }
}

bool isCritical(unsigned int status, unsigned int severity)
{
    return status == shipped::kStatusCritical || severity >= shipped::kSeverityCritical;
}

} // namespace

HealthPlugIn::HealthPlugIn() = default;
HealthPlugIn::~HealthPlugIn() = default;

IC::Error HealthPlugIn::getMap(std::vector<IC::Node*>&)
{
    // The plug-in adds no nodes of its own: the roll-up goes on the chassis.
    return ok();
}

IC::Error HealthPlugIn::Initialize(unsigned int, IC::ICforFP const& services)
{
    raise_ = services.getAlertCallBackFP();
    assert_ = services.getAssertCallBackFP();
    deRegister_ = services.getDeRegFPsensorAlerts();
    ic_ = services.getInstrumentationControl();
    IC::SensorAlertRegistration const reg = services.getRegFPsensorAlerts();
    if (!raise_ || !assert_ || !deRegister_ || !reg || !ic_)
        return IC::Error(1, IC::Number(1u), "health: the library's services are incomplete");

    for (IC::ManagementInterface* mi : services.getMIs())
        learnOwners(mi);
    {
        std::lock_guard<std::mutex> g(lock_);
        ++looking_;
    }
    {
        std::lock_guard<std::mutex> g(gLiveLock);
        gLive[this] = Live();
    }
    // Every sensor type: the interfaces' nodes may be of any kind.
    for (unsigned int s = 0; s < kSensorTypes; ++s) {
        auto const sensor = static_cast<IC::Node::SensorType>(s);
        IC::Error const e = reg(&HealthPlugIn::onAlerts, sensor, this);
        if (e.getStatus() != 0) {
            HEALTH_LOG(6000, "Initialize: registration for sensor type ", s, " failed: ", e);
            deregisterAll();
            std::lock_guard<std::mutex> g(gLiveLock);
            gLive.erase(this);
            return IC::Error(1, IC::Number(2u), "health: cannot register for alerts");
        }
        registered_.push_back(sensor);
    }
    // When the plug-in is loaded again by a reload, the asserted store still
    // holds what the interfaces reported before: take it over, and the
    // roll-up the previous instance left. What was wrong before anything
    // could hear of it is on the nodes.
    lookAtNodes(true);
    HEALTH_LOG(3000, "Initialize: watching ", registered_.size(), " sensor types");
    publishRollup(false);
    return ok();
}

IC::Error HealthPlugIn::updatedMis(std::vector<IC::ManagementInterface*> const& added,
                                   std::vector<IC::ManagementInterface*> const& removed)
{
    std::vector<std::string> gone;
    {
        std::lock_guard<std::mutex> g(lock_);
        std::set<unsigned int> dead;
        for (IC::ManagementInterface* mi : removed) {
            auto it = owners_.find(mi);
            if (it == owners_.end())
                continue;
            dead.insert(it->second.begin(), it->second.end());
            owners_.erase(it);
        }
        for (auto const& live : owners_)
            for (unsigned int n : live.second)
                dead.erase(n);
        // A removed interface clears nothing any more: what it asserted goes.
        for (auto it = asserted_.begin(); it != asserted_.end();) {
            if (dead.count(it->second.owner) != 0) {
                gone.push_back(it->first);
                it = asserted_.erase(it);
            } else {
                ++it;
            }
        }
        if (dead.count(rollupOwner_) != 0) {
            if (!raisedPath_.empty() && raisedPath_ == rollupPath_) {
                gone.push_back(raisedPath_);
                raisedPath_.clear();
                raised_ = Level{shipped::kStatusNormal, shipped::kSeverityInfo};
            }
            rollupPath_.clear();
            rollupOwner_ = kNoOwner;
        }
        // A new interface may bring the chassis that was missing.
        if (!added.empty())
            rollupPath_.clear();
    }
    // After the removals: a new interface may have the address of one that
    // went.
    for (IC::ManagementInterface* mi : added)
        learnOwners(mi);
    if (!added.empty()) {
        {
            std::lock_guard<std::mutex> g(lock_);
            ++looking_;
        }
        lookAtNodes(false);
    }
    HEALTH_LOG(3000, "updatedMis: added ", added.size(), " removed ", removed.size(),
               ", withdrew ", gone.size(), " asserted alerts");
    if (!gone.empty())
        withdraw(gone);
    publishRollup(false);
    return ok();
}

void HealthPlugIn::release()
{
    deregisterAll();
    {
        std::unique_lock<std::mutex> g(gLiveLock);
        auto it = gLive.find(this);
        if (it != gLive.end()) {
            it->second.closing = true;
            // Bounded: a client that unloads from inside its alert callback
            // would otherwise wait for itself.
            gLiveChanged.wait_for(g, std::chrono::seconds(5),
                                  [&it] { return it->second.active == 0; });
            gLive.erase(it);
        }
    }
    HEALTH_LOG(3000, "release: done");
    delete this;
}

IC::Error HealthPlugIn::onAlerts(std::vector<IC::Alert> const& alerts, void const* context)
{
    if (tRaising > 0)
        return ok();
    auto* const self = const_cast<HealthPlugIn*>(static_cast<HealthPlugIn const*>(context));
    {
        std::lock_guard<std::mutex> g(gLiveLock);
        auto it = gLive.find(self);
        if (it == gLive.end() || it->second.closing)
            return ok();
        ++it->second.active;
    }
    try {
        self->handle(alerts);
    } catch (std::exception const& e) {
        HEALTH_LOG(6000, "onAlerts: ", e.what());
    } catch (...) {
        HEALTH_LOG(6000, "onAlerts: unknown exception");
    }
    // Notified under the lock: once release() sees no callback under way,
    // the library may unmap this image, condition variable included.
    std::lock_guard<std::mutex> g(gLiveLock);
    auto it = gLive.find(self);
    if (it != gLive.end())
        --it->second.active;
    gLiveChanged.notify_all();
    return ok();
}

void HealthPlugIn::handle(std::vector<IC::Alert> const& alerts)
{
    // Roll-ups are never relayed: not ours coming back, nor another's.
    std::vector<IC::Alert> relay;
    relay.reserve(alerts.size());
    for (IC::Alert const& a : alerts)
        if (a.getClass() != shipped::kHealthRollup)
            relay.emplace_back(a.getSeverity(), a.getClass(), a.getNodePaths(), a.getStatus(),
                               a.getMessage());
    if (relay.empty())
        return; // the library also delivers empty batches

    // Looked up before taking the lock: it calls the library.
    std::map<std::string, unsigned int> owners;
    for (IC::Alert const& a : relay)
        if (a.getClass() != shipped::kNodeRemoval && a.getStatus() != shipped::kStatusNormal)
            for (std::string const& path : a.nodePaths())
                owners.emplace(path, ownerOf(path));

    std::vector<std::string> gone;
    bool touched = false;
    {
        std::lock_guard<std::mutex> g(lock_);
        for (IC::Alert const& a : relay) {
            if (a.getClass() == shipped::kNodeArrival && !rollupIsChassis_)
                rollupPath_.clear(); // perhaps the chassis we are missing
            for (std::string const& path : a.nodePaths()) {
                if (looking_ > 0)
                    touched_.insert(path);
                if (path == raisedPath_)
                    touched = true;
                if (a.getClass() == shipped::kNodeRemoval) {
                    asserted_.erase(path);
                    gone.push_back(path);
                    if (path == rollupPath_) {
                        rollupPath_.clear();
                        rollupOwner_ = kNoOwner;
                    }
                    if (path == raisedPath_) {
                        raisedPath_.clear();
                        raised_ = Level{shipped::kStatusNormal, shipped::kSeverityInfo};
                    }
                } else if (a.getStatus() == shipped::kStatusNormal) {
                    asserted_.erase(path);
                } else {
                    asserted_[path] = Entry{a.getClass(), a.getSeverity(), a.getStatus(), owners[path],
                                            a.getMessage()};
                }
            }
        }
    }
    raise(relay);
    // A node that is gone keeps no asserted alert, whatever status its
    // removal carried.
    if (!gone.empty())
        withdraw(gone);
    // An interface's alert on the chassis itself replaced the roll-up in the
    // store (one alert per path): put the roll-up back.
    publishRollup(touched);
}

void HealthPlugIn::lookAtNodes(bool fromStore)
{
    std::vector<IC::Alert> stored;
    if (fromStore)
        ic_->getAssertedAlerts(stored);
    std::vector<IC::Node*> nodes;
    ic_->getAllNodes(nodes);
    std::vector<IC::Alert> found;
    for (IC::Node* node : nodes)
        if (node)
            shipped::conditionOf(*node, found);
    // Looked up before taking the lock: it calls the library.
    std::map<std::string, unsigned int> owners;
    for (auto const* list : {&stored, &found})
        for (IC::Alert const& a : *list)
            for (std::string const& path : a.nodePaths())
                owners.emplace(path, ownerOf(path));

    std::vector<IC::Alert> news;
    {
        std::lock_guard<std::mutex> g(lock_);
        for (IC::Alert const& a : stored) {
            for (std::string const& path : a.nodePaths()) {
                if (a.getClass() == shipped::kHealthRollup) {
                    raisedPath_ = path;
                    raised_ = Level{a.getStatus(), a.getSeverity()};
                } else if (touched_.count(path) == 0) {
                    asserted_[path] = Entry{a.getClass(), a.getSeverity(), a.getStatus(), owners[path],
                                            a.getMessage()};
                }
            }
        }
        for (IC::Alert const& a : found) {
            std::string const& path = a.nodePaths().front();
            if (touched_.count(path) != 0 || asserted_.count(path) != 0)
                continue;
            asserted_[path] = Entry{a.getClass(), a.getSeverity(), a.getStatus(), owners[path], a.getMessage()};
            news.push_back(a);
        }
    }
    if (!news.empty())
        raise(news);
    // An alert that came while ours were on their way is newer: the store
    // must say what it said.
    std::vector<IC::Alert> newer;
    std::vector<std::string> cleared;
    {
        std::lock_guard<std::mutex> g(lock_);
        for (IC::Alert const& a : news) {
            std::string const& path = a.nodePaths().front();
            if (touched_.count(path) == 0)
                continue;
            auto const e = asserted_.find(path);
            if (e == asserted_.end())
                cleared.push_back(path);
            else
                newer.emplace_back(e->second.severity, e->second.cls, std::vector<std::string>{path},
                                   e->second.status, e->second.message);
        }
        if (--looking_ == 0)
            touched_.clear();
    }
    if (!newer.empty())
        assert_(newer);
    if (!cleared.empty())
        withdraw(cleared);
    HEALTH_LOG(3000, "lookAtNodes: ", stored.size(), " asserted alerts taken over, ", news.size(),
               " conditions found on the nodes");
}

void HealthPlugIn::publishRollup(bool force)
{
    {
        std::lock_guard<std::mutex> g(lock_);
        dirty_ = true;
        force_ = force_ || force;
        if (publishing_)
            return; // the thread publishing now picks the change up
        publishing_ = true;
    }
    for (;;) {
        Level want{shipped::kStatusNormal, shipped::kSeverityInfo};
        std::string worstPath;
        std::string worstMessage;
        std::size_t count = 0;
        bool forced = false;
        std::string target;
        {
            std::lock_guard<std::mutex> g(lock_);
            if (!dirty_) {
                publishing_ = false;
                return;
            }
            dirty_ = false;
            forced = force_;
            force_ = false;
            want = worstLocked(&worstPath, &worstMessage);
            count = asserted_.size();
            target = rollupPath_;
        }
        if (target.empty()) {
            unsigned int owner = kNoOwner;
            bool chassis = false;
            findRollupTarget(&target, &owner, &chassis);
            std::lock_guard<std::mutex> g(lock_);
            rollupPath_ = target;
            rollupOwner_ = owner;
            rollupIsChassis_ = chassis;
        }
        if (target.empty())
            continue; // no node to carry it yet; kept for the next change

        std::string previous;
        {
            std::lock_guard<std::mutex> g(lock_);
            bool const nothingRaised =
                raisedPath_.empty() && want.status == shipped::kStatusNormal;
            bool const unchanged = want == raised_ && target == raisedPath_;
            if (nothingRaised || (unchanged && !(forced && want.status != shipped::kStatusNormal)))
                continue;
            if (!raisedPath_.empty() && raisedPath_ != target &&
                raised_.status != shipped::kStatusNormal)
                previous = raisedPath_;
            raised_ = want;
            raisedPath_ = target;
        }

        std::vector<IC::Alert> batch;
        if (!previous.empty())
            batch.emplace_back(shipped::kSeverityInfo, shipped::kHealthRollup,
                               std::vector<std::string>{previous}, shipped::kStatusNormal,
                               "health: roll-up moved to another node");
        std::string message;
        if (want.status == shipped::kStatusNormal) {
            message = "health: all clear, no asserted alerts";
        } else {
            message = "health: " + std::to_string(count) +
                      (count == 1 ? " asserted alert" : " asserted alerts") + ", worst " +
                      severityName(want.severity) + " on " + ic_->pathToPrintablePath(worstPath) +
                      ": " + worstMessage;
        }
        batch.emplace_back(want.severity, shipped::kHealthRollup,
                           std::vector<std::string>{target}, want.status, message);
        HEALTH_LOG(3000, "roll-up: status ", want.status, " severity ",
                   static_cast<unsigned int>(want.severity), ": ", message);
        raise(batch);
    }
}

HealthPlugIn::Level HealthPlugIn::worstLocked(std::string* worstPath,
                                              std::string* worstMessage) const
{
    if (asserted_.empty())
        return Level{shipped::kStatusNormal, shipped::kSeverityInfo};
    Level level{shipped::kStatusWarning, shipped::kSeverityInfo};
    bool first = true;
    unsigned int worstRank = 0;
    for (auto const& entry : asserted_) {
        Entry const& e = entry.second;
        bool const critical = isCritical(e.status, e.severity);
        if (critical)
            level.status = shipped::kStatusCritical;
        if (e.severity > level.severity)
            level.severity = e.severity;
        unsigned int const rank = (critical ? 0x100u : 0u) + e.severity;
        if (first || rank > worstRank) {
            first = false;
            worstRank = rank;
            *worstPath = entry.first;
            *worstMessage = e.message;
        }
    }
    return level;
}

void HealthPlugIn::findRollupTarget(std::string* path, unsigned int* owner, bool* chassis) const
{
    std::vector<IC::Node*> nodes;
    if (ic_->getAllNodes(nodes).getStatus() != 0)
        return;
    std::string bestChassis;
    std::string bestRoot;
    unsigned int chassisOwner = kNoOwner;
    unsigned int rootOwner = kNoOwner;
    // The shortest path is the node nearest the root.
    for (IC::Node* node : nodes) {
        if (!node)
            continue;
        IC::Node::SensorType const type = node->getSensor();
        if (type != IC::Node::Chassis && type != IC::Node::ROOT)
            continue;
        std::string const p = node->getPath();
        if (p.empty())
            continue;
        std::string& best = type == IC::Node::Chassis ? bestChassis : bestRoot;
        if (best.empty() || p.size() < best.size()) {
            best = p;
            (type == IC::Node::Chassis ? chassisOwner : rootOwner) = node->getNodeId() >> 16;
        }
    }
    *chassis = !bestChassis.empty();
    *path = *chassis ? bestChassis : bestRoot;
    *owner = *chassis ? chassisOwner : rootOwner;
}

unsigned int HealthPlugIn::ownerOf(std::string const& path) const
{
    IC::Node* node = nullptr;
    if (ic_->getNode(path, &node).getStatus() != 0 || !node)
        return kNoOwner;
    return node->getNodeId() >> 16;
}

void HealthPlugIn::learnOwners(IC::ManagementInterface* mi)
{
    if (!mi)
        return;
    std::vector<IC::Node*> nodes;
    try {
        if (mi->getMap(nodes).getStatus() != 0)
            nodes.clear();
    } catch (...) {
        nodes.clear(); // an interface that cannot list its nodes owns none we know of
    }
    std::set<unsigned int> loads;
    for (IC::Node* node : nodes)
        if (node)
            loads.insert(node->getNodeId() >> 16);
    std::lock_guard<std::mutex> g(lock_);
    owners_[mi] = std::move(loads);
}

IC::Error HealthPlugIn::raise(std::vector<IC::Alert> const& alerts) const
{
    RaisingScope scope;
    IC::Error const e = raise_(alerts);
    if (e.getStatus() != 0)
        HEALTH_LOG(6000, "raise: the library refused ", alerts.size(), " alerts: ", e);
    return e;
}

void HealthPlugIn::withdraw(std::vector<std::string> const& paths) const
{
    // Through the store only: the clients were told already.
    std::vector<IC::Alert> clear;
    clear.emplace_back(shipped::kSeverityInfo, shipped::kHealthRollup, paths,
                       shipped::kStatusNormal, "health: withdrawn");
    assert_(clear);
}

void HealthPlugIn::deregisterAll()
{
    for (IC::Node::SensorType sensor : registered_)
        deRegister_(&HealthPlugIn::onAlerts, sensor, this);
    registered_.clear();
}

} // namespace health

extern "C" __attribute__((visibility("default"))) unsigned char OpenFP(IC::FunctionalPlugIn** fp,
                                                                        IC::Error** err)
{
    static IC::Error good(0, IC::Number(IC::Number::Generic), std::string());
    static IC::Error bad(1, IC::Number(1u), "health: cannot create the plug-in");
    if (!fp || !err)
        return 1;
    try {
        *fp = new health::HealthPlugIn();
        *err = &good;
        return 0;
    } catch (...) {
        *fp = nullptr;
        *err = &bad;
        return 1;
    }
}
