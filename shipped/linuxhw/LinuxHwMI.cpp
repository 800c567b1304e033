#include "LinuxHwMI.h"

#include "DeviceScanner.h"
#include "HwmonScanner.h"
#include "Log.h"
#include "SharedTree.h"
#include "OpenShippedMI.h"
#include "ShippedAlerts.h"
#include "SystemScanner.h"

#include <SD/Event.h>
#include <SD/Thread.h>

#include <cstdlib>
#include <exception>

namespace linuxhw {

namespace {

constexpr unsigned int kDefaultPollMs = 5000;
constexpr unsigned int kMaxNumber = 0xFFFF; // node ids carry 16 bits of our own

IC::Error ok()
{
    return IC::Error(0, IC::Number(IC::Number::Generic), std::string());
}

unsigned int pollInterval()
{
    char const* text = std::getenv("IC_LINUXHW_POLL_MS");
    if (!text || !*text)
        return kDefaultPollMs;
    std::optional<long long> const ms = parseInteger(trim(text));
    if (!ms || *ms < 10 || *ms > 3600000) {
        LHW_LOG(kWarning, "IC_LINUXHW_POLL_MS='", text, "' is not 10..3600000; polling every ",
                kDefaultPollMs, " ms");
        return kDefaultPollMs;
    }
    return static_cast<unsigned int>(*ms);
}

void logAlert(IC::Alert const& a)
{
    LHW_LOG(a.getStatus() == shipped::kStatusNormal ? kProgress : kWarning, "alert: ", a.getMessage());
}

// Properties the plug-in keeps itself rather than take from a scan.
bool ownProperty(std::string const& name)
{
    return name == "state" || name == shipped::kConditionProperty || name == shipped::kConditionClassProperty;
}

} // namespace

class LinuxHwMI::PollThread : public SD::Thread {
public:
    PollThread(LinuxHwMI& mi, unsigned int ms) : mi_(mi), ms_(ms) {}
    ~PollThread() override { join(); }

    void stop() override { stop_.signal(); }

    void* run(void*) override
    {
        while (stop_.waitMilliseconds(ms_) != 0) {
            try {
                mi_.poll();
            } catch (std::exception const& e) {
                LHW_LOG(kError, "poll failed: ", e.what());
            } catch (...) {
                LHW_LOG(kError, "poll failed with an unknown exception");
            }
        }
        return nullptr;
    }

private:
    LinuxHwMI& mi_;
    unsigned int const ms_;
    SD::Event stop_{true};
};

LinuxHwMI::LinuxHwMI() = default;

LinuxHwMI::~LinuxHwMI()
{
    stopPolling();
}

void LinuxHwMI::registerNodeCallBacks(IC::NodeArrivalCallBack arrival, void const* context,
                                      IC::NodeLookupCallBack lookup)
{
    SD::MutexGuard g(lock_);
    arrivalCB_ = arrival;
    arrivalContext_ = context;
    lookup_ = lookup;
}

IC::Error LinuxHwMI::registerForAlerts(IC::AlertCallBack callback, void const* context)
{
    SD::MutexGuard g(lock_);
    alertCB_ = callback;
    alertContext_ = context;
    return ok();
}

IC::Error LinuxHwMI::Initialize(unsigned int nodeIdBase, IC::Number, IC::Number)
{
    char const* rootEnv = std::getenv("IC_SYSFS_ROOT");
    std::string const root = rootEnv && *rootEnv ? rootEnv : "/";
    unsigned int const ms = pollInterval();
    {
        SD::MutexGuard g(lock_);
        if (initialized_)
            return IC::Error(1, IC::Number(IC::Number::Generic), "linuxhw: initialised twice");
        initialized_ = true;
        base_ = nodeIdBase & 0xFFFF0000u;
        pollMs_ = ms;
        reader_ = std::make_unique<SysfsReader>(root);
        // The shared top of the tree (SharedTree.h): what another plug-in
        // already reports is adopted by id, not reported again.
        shipped::SharedTop const top = shipped::sharedTop();
        if (unsigned int const id = shipped::adoptedNodeId(lookup_, top.rootId, shipped::kRootPath))
            adopted_[kRootKey] = id;
        if (unsigned int const id = shipped::adoptedNodeId(lookup_, top.chassisId, shipped::kChassisPath))
            adopted_[kChassisKey] = id;
    }
    if (!reader_->isDirectory("sys") && !reader_->isDirectory("proc"))
        LHW_LOG(kError, "no sys or proc directory below ", reader_->root(),
                "; only the root and the system are reported");

    DeviceList fixed;
    std::set<unsigned int> packages;
    SystemScanner(*reader_).scanFixed(fixed, packages);
    {
        SD::MutexGuard g(lock_);
        packages_ = packages;
    }
    DeviceList changing = scanChanging();
    Outbox unused;
    SD::MutexGuard g(lock_);
    reconcile(fixed, false, false, unused);
    reconcile(changing, true, false, unused);
    announceOwnTop();
    LHW_LOG(kProgress, "reporting ", order_.size(), " nodes from ", reader_->root(),
            ", polling every ", pollMs_, " ms");
    return ok();
}

IC::Error LinuxHwMI::getMap(std::vector<IC::Node*>& nodes)
{
    SD::MutexGuard g(lock_);
    for (std::string const& key : order_) {
        Tracked const& t = tracked_.at(key);
        if (t.present && t.node)
            nodes.push_back(t.node);
    }
    // The polling starts once the library has the nodes and can take
    // alerts on their paths.
    if (!thread_ && initialized_) {
        thread_ = std::make_unique<PollThread>(*this, pollMs_);
        if (!thread_->start())
            LHW_LOG(kError, "the polling thread did not start; readings stay as loaded");
    }
    return ok();
}

IC::Error LinuxHwMI::shutdown()
{
    stopPolling();
    return ok();
}

void LinuxHwMI::release()
{
    // A reload releases without shutdown(); the thread must not outlive us.
    stopPolling();
    if (ownRootId_ != 0)
        shipped::withdrawTop(ownRootId_);
    // The library keeps pointers to our nodes, and their code leaves with
    // this library: have it forget them first, with one removal naming all.
    std::vector<std::string> paths;
    {
        SD::MutexGuard g(lock_);
        std::set<std::string> seen;
        for (auto const& node : nodes_) {
            std::string path = node->knownPath();
            if (!path.empty() && seen.insert(path).second)
                paths.push_back(std::move(path));
        }
    }
    if (alertCB_ && !paths.empty())
        alertCB_(std::vector<IC::Alert>{IC::Alert(shipped::kSeverityInfo, shipped::kNodeRemoval,
                                                  paths, shipped::kStatusNormal,
                                                  "linuxhw unloaded")},
                 alertContext_);
    delete this;
}

void LinuxHwMI::stopPolling()
{
    PollThread* thread = nullptr;
    {
        SD::MutexGuard g(lock_);
        thread = thread_.get();
    }
    if (thread) {
        thread->stop();
        thread->join();
    }
}

DeviceList LinuxHwMI::scanChanging()
{
    DeviceList out;
    SystemScanner(*reader_).scanDimms(out);
    DeviceScanner devices(*reader_);
    devices.scanNetwork(out);
    devices.scanDisks(out);
    devices.scanPowerSupplies(out);
    HwmonScanner sensors(*reader_, packages_);
    if (sensors.scanHwmon(out) == 0)
        sensors.scanThermalZones(out);
    return out;
}

void LinuxHwMI::poll()
{
    DeviceList found = scanChanging();
    Outbox out;
    // The adopted ROOT is gone once the plug-in that reported it withdrew it
    // (it was released); its node is never touched from here.
    bool orphaned = false;
    {
        SD::MutexGuard g(lock_);
        auto const root = adopted_.find(kRootKey);
        orphaned = root != adopted_.end() && shipped::adoptedTopGone(root->second);
    }
    DeviceList fixed;
    if (orphaned) {
        std::set<unsigned int> packages;
        SystemScanner(*reader_).scanFixed(fixed, packages);
    }
    {
        SD::MutexGuard g(lock_);
        if (orphaned)
            rehome(fixed, out);
        reconcile(found, true, true, out);
    }
    deliver(out);
}

void LinuxHwMI::rehome(DeviceList& fixed, Outbox& out)
{
    // Our nodes hang below a chassis the library no longer has: take them
    // back and announce them again below a ROOT and Chassis of our own, or
    // below those a plug-in loaded in the same reload reports already
    // (adopted by the record's ids alone: their nodes are not touched here).
    shipped::SharedTop const now = shipped::sharedTop();
    std::vector<std::string> paths;
    for (std::string const& key : order_) {
        Tracked& t = tracked_.at(key);
        std::string path = t.present && t.node ? t.node->knownPath() : std::string();
        if (!path.empty())
            paths.push_back(std::move(path));
        t.present = false;
    }
    std::string const message = shipped::rehomeMessage("linuxhw", now);
    LHW_LOG(kWarning, message);
    if (!paths.empty())
        out.removals.emplace_back(shipped::kSeverityInfo, shipped::kNodeRemoval, paths, shipped::kStatusNormal,
                                  message);
    adopted_.clear();
    if (now.rootId != 0) {
        adopted_[kRootKey] = now.rootId;
        if (now.chassisId != 0)
            adopted_[kChassisKey] = now.chassisId;
    }
    reconcile(fixed, false, true, out);
    announceOwnTop();
}

void LinuxHwMI::announceOwnTop()
{
    auto const id = [this](std::string const& key) {
        auto const t = tracked_.find(key);
        return t != tracked_.end() && t->second.present && t->second.node ? t->second.node->getNodeId() : 0u;
    };
    if (adopted_.count(kRootKey) == 0 && (ownRootId_ = id(kRootKey)) != 0)
        shipped::announceTop({ownRootId_, id(kChassisKey)});
}

unsigned int LinuxHwMI::claimInstance(Tracked& t, Device const& d)
{
    if (t.hasInstance && t.claimParent == d.parentKey && t.device.type == d.type)
        return t.instance;
    unsigned int instance = d.instance;
    for (int tries = 0; tries < 1024; ++tries, instance += d.probeStep) {
        auto const slot = std::make_tuple(d.parentKey, static_cast<unsigned int>(d.type), instance);
        auto const claim = claims_.find(slot);
        if (claim == claims_.end() || claim->second == d.key) {
            claims_[slot] = d.key;
            break;
        }
    }
    t.instance = instance;
    t.hasInstance = true;
    t.claimParent = d.parentKey;
    return instance;
}

void LinuxHwMI::reconcile(DeviceList& found, bool changing, bool announce, Outbox& out)
{
    std::set<std::string> seen;
    std::size_t leftOut = 0;
    // A new device is moved into its record, not copied: a scan of a very
    // large machine is most of the plug-in's memory.
    for (Device& d : found) {
        if (!seen.insert(d.key).second || adopted_.count(d.key) != 0)
            continue; // two entries of one identity: the first one counts
        auto it = tracked_.find(d.key);
        if (it != tracked_.end() && it->second.present) {
            update(it->second, d, out);
            continue;
        }
        unsigned int parentId = 0;
        if (auto const adopted = adopted_.find(d.parentKey); adopted != adopted_.end()) {
            parentId = adopted->second;
        } else if (!d.parentKey.empty()) {
            auto const parent = tracked_.find(d.parentKey);
            if (parent == tracked_.end() || !parent->second.present || !parent->second.node) {
                LHW_LOG(kWarning, d.description, " left out: its parent ", d.parentKey,
                        " is not there");
                continue;
            }
            parentId = parent->second.node->getNodeId();
        }
        bool const isNew = it == tracked_.end();
        if (isNew && nextNumber_ > kMaxNumber) {
            ++leftOut;
            d = Device(); // its text is of no further use
            continue;
        }
        Tracked& t = tracked_[d.key];
        if (isNew) {
            t.number = nextNumber_++;
            order_.push_back(d.key);
        }
        unsigned int const instance = claimInstance(t, d);
        unsigned int const id = base_ | t.number;
        // A device that comes back gets a new node: the library may still
        // hold the old one, which it dropped from its store.
        nodes_.push_back(std::make_unique<HwNode>(d.type, instance, id, parentId, d.description, id));
        t.node = nodes_.back().get();
        for (IC::Node::Property const& p : d.properties)
            t.node->setProperty(p.name, p.value, p.unit);
        t.device = std::move(d);
        t.present = true;
        t.changing = changing;
        judgeAtStart(t, t.device);
        show(t);
        if (announce) {
            out.arrivals.push_back(t.node);
            if (t.raised != shipped::kStatusNormal)
                out.troubled.push_back(t.node);
            LHW_LOG(kProgress, "arrived: ", t.device.description);
        }
    }
    // Node ids carry 16 bits of our own: said once a scan, not once a device.
    if (leftOut > 0)
        LHW_LOG(kError, leftOut, " devices left out: all ", kMaxNumber, " node ids of the plug-in are used");
    if (changing)
        removeMissing(seen, out);
}

void LinuxHwMI::judgeAtStart(Tracked& t, Device const& d)
{
    t.raised = shipped::kStatusNormal;
    t.raisedMessage.clear();
    if (d.watch == Watch::Condition && d.status != kStatusUnknown && d.status != shipped::kStatusNormal) {
        t.raised = d.status;
        t.raisedClass = shipped::kThreshold;
        t.raisedMessage = d.message;
    } else if (d.watch == Watch::MemoryErrors && (d.uncorrected > 0 || d.corrected > 0)) {
        bool const ue = d.uncorrected > 0;
        t.raised = ue ? shipped::kStatusCritical : shipped::kStatusWarning;
        t.raisedClass = shipped::kMemoryErrors;
        t.raisedMessage = d.description + ": " + std::to_string(ue ? d.uncorrected : d.corrected) +
                          (ue ? " uncorrected" : " corrected") + " memory errors counted";
    }
}

void LinuxHwMI::raiseCondition(Tracked& t, IC::Alert::ClassType cls, unsigned int status,
                               std::string const& path, std::string const& message, Outbox& out)
{
    t.raised = status;
    t.raisedClass = cls;
    t.raisedMessage = message;
    out.alerts.emplace_back(shipped::severityOf(status), cls, std::vector<std::string>{path}, status, message);
    logAlert(out.alerts.back());
}

void LinuxHwMI::show(Tracked const& t)
{
    HwNode* const node = t.node;
    Device const& d = t.device;
    if (d.watch == Watch::None)
        return;
    char const* state = t.raised == shipped::kStatusCritical  ? "critical"
                        : t.raised == shipped::kStatusWarning ? "warning"
                        : d.watch == Watch::Link && !d.linkUp ? "no link"
                                                              : "ok";
    if (d.watch == Watch::Condition && d.status == kStatusUnknown)
        state = "unknown"; // the condition last reported stands
    IC::Node::Property p;
    if (!node->getProperty("state", &p) || p.value != state)
        node->setProperty("state", state);
    if (t.raised == shipped::kStatusNormal) {
        node->removeProperty(shipped::kConditionProperty);
        node->removeProperty(shipped::kConditionClassProperty);
    } else if (!node->getProperty(shipped::kConditionProperty, &p) || p.value != t.raisedMessage) {
        node->setProperty(shipped::kConditionProperty, t.raisedMessage);
        node->setProperty(shipped::kConditionClassProperty, std::to_string(t.raisedClass));
    }
}

void LinuxHwMI::update(Tracked& t, Device const& d, Outbox& out)
{
    HwNode* const node = t.node;
    std::vector<IC::Node::Property> const now = node->getProperties();
    for (IC::Node::Property const& p : d.properties) {
        auto const same = std::find_if(now.begin(), now.end(), [&p](IC::Node::Property const& q) {
            return q.name == p.name && q.value == p.value && q.unit == p.unit;
        });
        if (same == now.end())
            node->setProperty(p.name, p.value, p.unit);
    }
    for (IC::Node::Property const& q : now) {
        bool const kept = ownProperty(q.name) ||
                          std::any_of(d.properties.begin(), d.properties.end(),
                                      [&q](IC::Node::Property const& p) { return p.name == q.name; });
        if (!kept)
            node->removeProperty(q.name);
    }

    Device const before = t.device;
    t.device = d;
    std::string const path = node->knownPath();
    auto raise = [&](IC::Alert::ClassType cls, unsigned int status, std::string const& message) {
        raiseCondition(t, cls, status, path, message, out);
    };

    switch (d.watch) {
    case Watch::None:
        break;
    case Watch::Condition:
        if (d.status == kStatusUnknown || d.status == t.raised || path.empty())
            break;
        raise(shipped::kThreshold, d.status, d.message);
        break;
    case Watch::Link:
        if (!d.linkKnown) {
            t.device.linkKnown = before.linkKnown; // keep the last known state
            t.device.linkUp = before.linkUp;
            break;
        }
        if (path.empty())
            break;
        if (!d.linkUp && t.raised == shipped::kStatusNormal && before.linkKnown && before.linkUp)
            raise(shipped::kLink, shipped::kStatusWarning, d.description + " lost its link");
        else if (d.linkUp && t.raised != shipped::kStatusNormal)
            raise(shipped::kLink, shipped::kStatusNormal, d.description + " has its link back");
        break;
    case Watch::MemoryErrors: {
        // An unreadable counter keeps its last value for the comparison.
        if (d.corrected < 0)
            t.device.corrected = before.corrected;
        if (d.uncorrected < 0)
            t.device.uncorrected = before.uncorrected;
        if (path.empty())
            break;
        long long const ceAll = t.device.corrected;
        long long const ueAll = t.device.uncorrected;
        auto growth = [](long long now, long long was) { return now >= 0 && was >= 0 && now > was ? now - was : 0; };
        long long const ce = growth(ceAll, before.corrected);
        long long const ue = growth(ueAll, before.uncorrected);
        // The level is that of all the errors counted, so that a DIMM with
        // uncorrected errors stays critical when corrected ones come.
        unsigned int const level = ueAll > 0 ? shipped::kStatusCritical
                                   : ceAll > 0 ? shipped::kStatusWarning
                                               : shipped::kStatusNormal;
        if (ue > 0)
            raise(shipped::kMemoryErrors, level,
                  d.description + ": " + std::to_string(ue) + " new uncorrected memory errors (" +
                      std::to_string(ueAll) + " in all)");
        else if (ce > 0)
            raise(shipped::kMemoryErrors, level,
                  d.description + ": " + std::to_string(ce) + " new corrected memory errors (" +
                      std::to_string(ceAll) + " in all)");
        else if (level != t.raised && ceAll >= 0 && ueAll >= 0)
            raise(shipped::kMemoryErrors, level, d.description + ": error counters were reset");
        break;
    }
    }
    show(t);
}

void LinuxHwMI::removeMissing(std::set<std::string> const& seen, Outbox& out)
{
    std::set<std::string> gone;
    std::multimap<std::string, std::string> children;
    for (std::string const& key : order_) {
        Tracked& t = tracked_.at(key);
        if (t.present && t.changing && seen.count(key) == 0) {
            gone.insert(key);
            t.present = false;
        }
    }
    if (gone.empty())
        return;
    for (std::string const& key : order_)
        children.emplace(tracked_.at(key).device.parentKey, key);
    for (std::string const& key : order_) {
        if (gone.count(key) == 0 || gone.count(tracked_.at(key).device.parentKey) != 0)
            continue;
        // One alert for the topmost removed device and its removed children.
        std::vector<std::string> paths;
        std::vector<std::string> pending{key};
        while (!pending.empty()) {
            std::string const k = pending.back();
            pending.pop_back();
            std::string const path = tracked_.at(k).node->knownPath();
            if (!path.empty())
                paths.push_back(path);
            auto const range = children.equal_range(k);
            for (auto c = range.first; c != range.second; ++c)
                if (gone.count(c->second) != 0)
                    pending.push_back(c->second);
        }
        std::string const message = tracked_.at(key).device.description + " was removed";
        LHW_LOG(kWarning, message);
        if (!paths.empty())
            out.removals.emplace_back(shipped::kSeverityWarning, shipped::kNodeRemoval, paths,
                                      shipped::kStatusNormal, message);
    }
}

void LinuxHwMI::deliver(Outbox& out)
{
    // Our lock is not held: the library's callbacks may call back into us.
    if (!out.removals.empty() && alertCB_)
        alertCB_(out.removals, alertContext_);
    for (HwNode* node : out.arrivals) {
        if (!arrivalCB_)
            break;
        IC::Error const e = arrivalCB_(node, arrivalContext_);
        if (e.getStatus() != 0)
            LHW_LOG(kWarning, "the library did not take ", node->getDescription(), ": ",
                    e.getText(), " (status ", static_cast<unsigned int>(e.getStatus()), ")");
    }
    // What was wrong with a device that arrived is told once it has a path.
    for (HwNode* node : out.troubled)
        if (shipped::conditionOf(*node, out.alerts))
            logAlert(out.alerts.back());
    if (!out.alerts.empty() && alertCB_)
        alertCB_(out.alerts, alertContext_);
}

} // namespace linuxhw

extern "C" __attribute__((visibility("default"))) unsigned char
OpenMI(IC::ManagementInterface** mi, IC::Error** err)
{
    return shipped::openMI<linuxhw::LinuxHwMI>(mi, err, "linuxhw");
}
