#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include <IC/FPControl.h>
#include <IC/MIControl.h>
#include <SD/PlatformUtilities.h>

#include "DiagError.h"
#include "HexText.h"
#include "InstCtrlPrivate.h"

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <ostream>
#include <set>
#include <unordered_set>

namespace IC {
namespace ALERT_REGISTER {
extern std::string loggerAlertRegister;
} // namespace ALERT_REGISTER

namespace InstCtrl {

// The library's state, constructed in this order when the library is loaded.
std::string loggerIC = "Helmgard.IC.InstrumentationControl";
InstrumentationControl ic;
Error myice(0, Number(0u), "");
Error lderr(5, Number(1u), "Load Library");
std::set<std::string> icbaselibpath;
std::vector<libstruct> mymilibs;
std::vector<libstruct> myfplibs;
std::vector<ManagementInterface*> mymis;
std::vector<FunctionalPlugIn*> myfps;
Error donegood(0, Number(Number::Generic), "");
std::map<CallbackKey, AlertRegister*, CallbackKeyLess> callbacks;
std::multimap<std::string, AlertRegister*> nodepathTOalertregister;
std::multimap<Node::SensorType, AlertRegister*> sensortypeTOalertregister;
std::multimap<Alert::ClassType, AlertRegister*> classtypeTOalertregister;
std::vector<SimpleAlertRegister> mysam;
NodeStore nodestore;
std::uint32_t ICloadCount = 0;
LoaderThread* lt = nullptr;
AlertStore alertstore;
SD::Mutex loadlock;
SD::Mutex registerlock;
bool unloaddone = false;
std::uint16_t mymifpctr = 1;

// Set while the last unload stops and joins the loader thread, which it does
// holding loadlock: a reload that is waiting for loadlock then gives up
// instead of waiting for the join that waits for it.
std::atomic<bool> joiningLoaderThread{false};

} // namespace InstCtrl

namespace {

using namespace InstCtrl;

Error success()
{
    return Error(0, Number(Number::Generic), std::string());
}

Error failure()
{
    return Error(1, Number(Number::Generic), std::string());
}

// Function pointers print as addresses, like the contexts.
void const* address(AlertCallBack cb)
{
    return reinterpret_cast<void const*>(cb);
}
void const* address(SimpleAlertCallBack cb)
{
    return reinterpret_cast<void const*>(cb);
}

// A path list as it appears in the registration log lines: each path in
// hexadecimal followed by a blank. Rendered only when the line is written.
struct PathList {
    std::vector<std::string> const& paths;
};
std::ostream& operator<<(std::ostream& os, PathList const& list)
{
    for (std::string const& path : list.paths)
        os << detail::hexText(path) << ' ';
    return os;
}

// One binary path in hexadecimal, rendered only when the line is written.
struct HexPath {
    std::string const& path;
};
std::ostream& operator<<(std::ostream& os, HexPath const& hex)
{
    return os << detail::hexText(hex.path);
}

// The keys a filter value puts into its index: the value itself, or each
// path of a list.
template <class F>
void forEachKey(Node::SensorType sensor, F f)
{
    f(sensor);
}
template <class F>
void forEachKey(Alert::ClassType cls, F f)
{
    f(cls);
}
template <class F>
void forEachKey(std::vector<std::string> const& paths, F f)
{
    for (std::string const& path : paths)
        f(path);
}

// Adds a filter to the register of (callback, context), creating it if
// needed, and indexes it. Caller holds registerlock.
template <class Value, class Index>
Error addRegistration(AlertCallBack callback, Value const& value, void const* context,
                      unsigned int regType, Index& index)
{
    Error result = failure();
    CallbackKey const key(callback, context);
    AlertRegister* reg = nullptr;
    auto found = callbacks.find(key);
    if (found == callbacks.end()) {
        auto created = std::make_unique<AlertRegister>(callback, context, regType);
        if (created->add(callback, value)) {
            reg = created.release();
            callbacks.emplace(key, reg);
            result = success();
        }
    } else {
        reg = found->second;
        if (reg->add(callback, value))
            result = success();
    }
    if (result.getStatus() != 0)
        return result;
    forEachKey(value, [&index, reg](typename Index::key_type const& k) {
        auto range = index.equal_range(k);
        for (auto it = range.first; it != range.second; ++it)
            if (it->second == reg)
                return;
        index.emplace(k, reg);
    });
    return result;
}

// Removes a filter from the register of (callback, context), and the
// register itself once it is empty. Caller holds registerlock.
template <class Value, class Index>
Error removeRegistration(AlertCallBack callback, Value const& value, void const* context,
                         Index& index)
{
    auto found = callbacks.find(CallbackKey(callback, context));
    if (found == callbacks.end())
        return failure();
    AlertRegister* const reg = found->second;
    unsigned char const r = reg->del(callback, value);
    if (r == 2)
        return failure();
    if (r == 1)
        callbacks.erase(found);
    forEachKey(value, [&index, reg](typename Index::key_type const& k) {
        auto range = index.equal_range(k);
        for (auto it = range.first; it != range.second; ++it) {
            if (it->second == reg) {
                index.erase(it);
                return;
            }
        }
    });
    if (r == 1)
        delete reg;
    return donegood;
}

// The sensor type of a simple registration: its 16 bits, sign-extended.
Node::SensorType simpleSensor(std::uint16_t sensor)
{
    return static_cast<Node::SensorType>(
        static_cast<std::uint32_t>(static_cast<std::int32_t>(static_cast<std::int16_t>(sensor))));
}

void const* slotContext(unsigned int slot)
{
    return reinterpret_cast<void const*>(static_cast<std::uintptr_t>(slot));
}

// The plug-in part of an open or a reload; the results are the callers'.
Error reloadManagementInterfaces()
{
    return MIControl().reLoadMIs(mymifpctr, mymilibs, mymis, AlertCallBackMI, myfps,
                                 ic.getInterfaceVersion(), ic.getModuleVersion(), nodestore,
                                 icbaselibpath, LoadCallBackMI, &ic, getNodeCallBackMI);
}

Error reloadFunctionalPlugIns()
{
    // Lives only for this pass: a plug-in copies what it keeps.
    NodeAnnouncement const announce = MapNewFPNode;
    ICforFP const services(mymis, regFPAlerts, deRegFPAlerts, AlertCallBackFP, AssertCallBackFP,
                           ic.getInterfaceVersion(), ic.getModuleVersion(), announce, &ic,
                           regFPsensorAlerts, deRegFPsensorAlerts);
    AlertSink const raise = AlertCallBackFP;
    return FPControl().reLoadFPs(mymifpctr, myfplibs, myfps, nodestore, services, raise,
                                 icbaselibpath);
}

std::uint32_t openCount()
{
    SD::MutexGuard guard(loadlock);
    return ICloadCount;
}

} // namespace

namespace InstCtrl {

void diagError(Error* error, std::string context)
{
    detail::reportError("InstrumentationControl", loggerIC, error, context);
}

std::string hexstring(std::string s)
{
    return detail::hexText(s);
}

// --------------------------------------------------------- open and reload

unsigned char openLib(InstrumentationControl** control, Error** error, std::string basePath,
                      std::string logDir)
{
    char const separator = SD::PlatformUtilities::getSeparator();
    unsigned char code = 0;
    {
        SD::MutexGuard guard(loadlock);
        ++ICloadCount;
        if (!basePath.empty()) {
            if (basePath.back() != separator)
                basePath += separator;
            icbaselibpath.insert(basePath);
        }
        if (ICloadCount == 1) {
            // First open: start from nothing. The pointers are dropped, not
            // deleted: the last unload has ended their objects.
            mymilibs.clear();
            myfplibs.clear();
            mymis.clear();
            myfps.clear();
            {
                SD::MutexGuard registrations(registerlock);
                callbacks.clear();
                nodepathTOalertregister.clear();
                sensortypeTOalertregister.clear();
                classtypeTOalertregister.clear();
                mysam.clear();
            }
            nodestore.clear();
            alertstore.clear();
            unloaddone = false;
            // The logging library finds its own configuration; the path of
            // the one in the log directory is worked out and not used.
            std::string logConfig = logDir;
            if (logConfig.empty() || logConfig.back() != separator)
                logConfig += separator;
            logConfig += "log4cxx.properties";
            (void)logConfig;

            IC_LOG(3000, "InstrumentationControl: entry Open count=", ICloadCount);
            if (reloadManagementInterfaces().getStatus() != 0) {
                code = 15;
            } else if (reloadFunctionalPlugIns().getStatus() != 0) {
                code = 31;
            }
            if (code != 0 && error)
                *error = &lderr;
        }
    }
    if (code == 0) {
        if (control)
            *control = &ic;
        if (error)
            *error = &myice;
    } else {
        // A failed first open undoes itself and takes its count back.
        ic.doUnload();
    }
    IC_LOG(3000, "InstrumentationControl: Open count=", openCount(), " exit code=",
           static_cast<unsigned int>(code));
    return code;
}

void TimedReload()
{
    IC_LOG(3000, "Instrumentation Control Timed Reload");
    std::unique_lock<SD::Mutex> guard(loadlock, std::defer_lock);
    while (!guard.owns_lock()) {
        if (loadlock.lock(50) == 0)
            guard = std::unique_lock<SD::Mutex>(loadlock, std::adopt_lock);
        else if (joiningLoaderThread.load())
            return; // the unload has begun; nothing is left to reload
    }
    if (unloaddone || ICloadCount == 0)
        return;
    // Failures are logged by the reloads themselves.
    reloadManagementInterfaces();
    reloadFunctionalPlugIns();
}

// ---------------------------------------------------- node entries for plug-ins

Error getNodeCallBackMI(std::string const& path, Node** node)
{
    IC_LOG(3000, "getNodeCallBack:");
    Error result = nodestore.getNode(path, node);
    if (result.getStatus() != 0)
        diagError(&result, "getNodeCallBackMI: failure");
    return result;
}

Error MapNewFPNode(Node* const& node)
{
    return nodestore.addNode(node);
}

Error LoadCallBackMI(Node* const& node, void const* context)
{
    if (!node) {
        IC_LOG(6000, "LoadCallBackMI: null node ignored");
        return failure();
    }
    IC_LOG(3000, "LoadCallBack: NodePtr=", node, " desc=", node->getDescription(), " index=",
           node->getInstance());
    Error result = nodestore.addMINode(std::vector<Node*>{node});
    if (result.getStatus() == 6) {
        IC_LOG(3000, "LoadCallBack: NodeStore:addMINode duplicate Node =", node->getDescription(),
               " index=", node->getInstance());
        return result;
    }
    if (result.getStatus() != 0) {
        IC_LOG(3000, "LoadCallBackMI: NodeStore::addMINode failed. Node=", node->getDescription(),
               " index=", node->getInstance(), " Error= ", result);
        return result;
    }
    std::string const path = node->getPath();
    if (path.empty()) {
        IC_LOG(6000, "LoadCallBackMI: Node ", node, " path is empty: '", path, "'.");
        return result;
    }
    Alert const arrival(0, Alert::NodeArrival, std::vector<std::string>{path}, 1,
                        node->getDescription());
    result = AlertCallBackMI(std::vector<Alert>{arrival}, context);
    if (result.getStatus() == 0)
        IC_LOG(3000, "LoadCallbackMI: sent alert= ", arrival);
    else
        diagError(&result, "LoadCallBackMI: failure");
    return result;
}

// ------------------------------------------------------------------ dispatch

Error AlertCallBackMI(std::vector<Alert> const& alerts, void const* context)
{
    return AlertCallBackCommon(alerts, context, MI_ALERT);
}

Error AlertCallBackFP(std::vector<Alert> const& alerts)
{
    return AlertCallBackCommon(alerts, nullptr, FP_ALERT);
}

Error AssertCallBackFP(std::vector<Alert> const& alerts)
{
    alertstore.newAlerts(alerts, FP_ALERT);
    return success();
}

namespace {

// A register found in an index for one alert: through the alert's class
// (every path) or through path number `path` of the alert.
struct Hit {
    static constexpr std::uint32_t kAllPaths = 0xFFFFFFFFu;
    AlertRegister* reg;
    std::uint32_t alert;
    std::uint32_t path;
};

bool operator<(Hit const& x, Hit const& y)
{
    if (x.reg != y.reg)
        return std::less<AlertRegister*>()(x.reg, y.reg);
    if (x.alert != y.alert)
        return x.alert < y.alert;
    return x.path < y.path;
}

bool operator==(Hit const& x, Hit const& y)
{
    return x.reg == y.reg && x.alert == y.alert && x.path == y.path;
}

// Paths erased from nodepathTOalertregister by removal alerts while a
// register held them: those registers keep the paths in their own sets, so
// for a batch naming one, the index alone does not tell what they match.
// Guarded by registerlock.
std::unordered_set<std::string> pathsBeyondIndex;

// One register's delivery worked out from the index hits alone, which name
// exactly what its filter would match when every path of the batch has a
// node and every path the register holds is indexed. Hits are sorted and
// hold one register.
AlertCall deliveryFromHits(AlertRegister const& reg, std::vector<Alert> const& alerts,
                           Hit const* first, Hit const* last)
{
    AlertCall call(reg.getCallback(), reg.getContext());
    while (first != last) {
        Alert const& alert = alerts[first->alert];
        Hit const* const end = std::find_if(
            first, last, [first](Hit const& h) { return h.alert != first->alert; });
        std::vector<std::string> matched;
        if (end[-1].path == Hit::kAllPaths) {
            matched = alert.nodePaths();
        } else {
            matched.reserve(static_cast<std::size_t>(end - first));
            for (Hit const* h = first; h != end; ++h)
                matched.push_back(alert.nodePaths()[h->path]);
        }
        if (!matched.empty()) // a class match of an alert without paths
            call.addRestricted(alert, std::move(matched));
        first = end;
    }
    return call;
}

} // namespace

Error AlertCallBackCommon(std::vector<Alert> const& alerts, void const*, MyAlertType type)
{
    std::vector<std::string> removed;
    std::vector<AlertCall> calls;
    {
        SD::MutexGuard guard(registerlock);
        if (callbacks.empty())
            pathsBeyondIndex.clear(); // no register holds a path any more
        std::unordered_set<std::string> removedSeen;
        std::vector<Hit> hits;
        hits.reserve(alerts.size() * 2);
        bool exact = !HGLog::HGLogger::isEnabled(ALERT_REGISTER::loggerAlertRegister, 3000);
        for (std::size_t a = 0; a < alerts.size(); ++a) {
            Alert const& alert = alerts[a];
            auto const n = static_cast<std::uint32_t>(a);
            auto byClass = classtypeTOalertregister.equal_range(alert.getClass());
            for (auto it = byClass.first; it != byClass.second; ++it)
                hits.push_back(Hit{it->second, n, Hit::kAllPaths});
            auto const& paths = alert.nodePaths();
            for (std::size_t p = 0; p < paths.size(); ++p) {
                std::string const& path = paths[p];
                auto const at = static_cast<std::uint32_t>(p);
                if (alert.getClass() == Alert::NodeRemoval && removedSeen.insert(path).second)
                    removed.push_back(path);
                Node::SensorType const sensor = nodestore.nodePathToSensor(path);
                if (sensor == Node::invalid ||
                    (!pathsBeyondIndex.empty() && pathsBeyondIndex.count(path) != 0))
                    exact = false;
                auto bySensor = sensortypeTOalertregister.equal_range(sensor);
                for (auto it = bySensor.first; it != bySensor.second; ++it)
                    hits.push_back(Hit{it->second, n, at});
                auto byPath = nodepathTOalertregister.equal_range(path);
                for (auto it = byPath.first; it != byPath.second; ++it)
                    hits.push_back(Hit{it->second, n, at});
            }
        }
        std::sort(hits.begin(), hits.end());
        hits.erase(std::unique(hits.begin(), hits.end()), hits.end());
        // Every register found is given its turn, in ascending address. The
        // full filter runs whenever something would be logged or the hits
        // may not tell the whole match.
        std::unique_ptr<AlertBatch> batch;
        for (auto first = hits.begin(); first != hits.end();) {
            AlertRegister* const reg = first->reg;
            auto const last = std::find_if(first, hits.end(),
                                           [reg](Hit const& h) { return h.reg != reg; });
            bool cleaned = false;
            if (exact && reg->getCallback()) {
                // Clients see only what functional plug-ins raise.
                if (reg->getRegType() != CLIENT_REGISTRATION || type != MI_ALERT)
                    calls.push_back(deliveryFromHits(*reg, alerts, &*first, &*first + (last - first)));
            } else {
                if (!batch)
                    batch = std::make_unique<AlertBatch>(nodestore, alerts);
                cleaned = reg->filterAlerts(*batch, alerts, calls, type);
            }
            if (cleaned)
                IC_LOG(3000, "InstrumentationControl ER_CLEANED from AlertRegister ", reg);
            first = last;
        }
    }
    // Callbacks run without the lock, so that they may register and
    // deregister themselves.
    for (std::string const& path : removed)
        nodestore.delNodeFromGetMap(path);
    for (AlertCall& call : calls)
        call.callBack(alertstore, type);
    if (!removed.empty()) {
        // The index is shared with registrations on other threads. The
        // registers keep the path in their own sets, so that deregistering
        // it later still succeeds.
        SD::MutexGuard guard(registerlock);
        for (std::string const& path : removed) {
            nodestore.erase(path);
            if (nodepathTOalertregister.erase(path) != 0)
                pathsBeyondIndex.insert(path);
        }
    }
    return success();
}

Error AlertCallBackSimple(std::vector<Alert> const& alerts, void const* context)
{
    SD::MutexGuard guard(registerlock);
    auto const slot = static_cast<unsigned int>(reinterpret_cast<std::uintptr_t>(context));
    auto found = std::find_if(mysam.begin(), mysam.end(), [slot](SimpleAlertRegister const& r) {
        return r.index == slot;
    });
    if (found == mysam.end())
        return success();
    SimpleAlertRegister const entry = *found;
    for (Alert const& alert : alerts) {
        unsigned int const cls = alert.getClass();
        if (cls == Alert::NodeRemoval)
            continue; // removals are not passed on
        unsigned int const code = cls == 5 ? 1 : cls == Alert::NodeArrival ? 2 : 0;
        for (std::string const& path : alert.nodePaths())
            entry.callback(code, alert.getTimeStamp(), path, entry.context);
    }
    return success();
}

// -------------------------------------------------------------- registration

Error regAlerts(AlertCallBack callback, Node::SensorType sensor, void const* context,
                MyRegType regType)
{
    return addRegistration(callback, sensor, context, regType, sensortypeTOalertregister);
}

Error deRegAlerts(AlertCallBack callback, Node::SensorType sensor, void const* context, MyRegType)
{
    return removeRegistration(callback, sensor, context, sensortypeTOalertregister);
}

Error regAlerts(AlertCallBack callback, std::vector<std::string> const& paths, void const* context,
                MyRegType regType)
{
    SD::MutexGuard guard(registerlock);
    return addRegistration(callback, paths, context, regType, nodepathTOalertregister);
}

Error deRegAlerts(AlertCallBack callback, std::vector<std::string> const& paths,
                  void const* context, MyRegType)
{
    SD::MutexGuard guard(registerlock);
    return removeRegistration(callback, paths, context, nodepathTOalertregister);
}

Error registerForAlerts(AlertCallBack callback, Alert::ClassType cls, void const* context)
{
    SD::MutexGuard guard(registerlock);
    return addRegistration(callback, cls, context, CLIENT_REGISTRATION, classtypeTOalertregister);
}

Error deRegisterForAlerts(AlertCallBack callback, Alert::ClassType cls, void const* context)
{
    SD::MutexGuard guard(registerlock);
    return removeRegistration(callback, cls, context, classtypeTOalertregister);
}

Error registerForAlerts(AlertCallBack callback, std::vector<std::string> const& paths,
                        void const* context)
{
    IC_LOG(3000, "registerFor Alerts paths={ ", PathList{paths}, "}", " Callback=", address(callback),
           " *p=", context);
    return regAlerts(callback, paths, context, CLIENT_REGISTRATION);
}

Error deRegisterForAlerts(AlertCallBack callback, std::vector<std::string> const& paths,
                          void const* context)
{
    IC_LOG(3000, "deRegisterForAlerts: Node paths={ ", PathList{paths}, "} Callback=",
           address(callback), " *p=", context);
    return deRegAlerts(callback, paths, context, CLIENT_REGISTRATION);
}

Error regFPAlerts(AlertCallBack callback, std::vector<std::string> const& paths, void const* context)
{
    return regAlerts(callback, paths, context, FP_REGISTRATION);
}

Error deRegFPAlerts(AlertCallBack callback, std::vector<std::string> const& paths,
                    void const* context)
{
    return deRegAlerts(callback, paths, context, FP_REGISTRATION);
}

Error regFPsensorAlerts(AlertCallBack callback, Node::SensorType sensor, void const* context)
{
    IC_LOG(3000, "registerFPsensorAlerts: sensor ", sensor, " Callback=", address(callback),
           " *p=", context);
    SD::MutexGuard guard(registerlock);
    return regAlerts(callback, sensor, context, FP_REGISTRATION);
}

Error deRegFPsensorAlerts(AlertCallBack callback, Node::SensorType sensor, void const* context)
{
    IC_LOG(3000, "deRegFPsensorAlerts: sensor ", sensor, " Callback=", address(callback), " *p=",
           context);
    SD::MutexGuard guard(registerlock);
    return deRegAlerts(callback, sensor, context, FP_REGISTRATION);
}

} // namespace InstCtrl

// -------------------------------------------------------------------- facade

namespace {
Number const kVersion(Version2{1, 0});
} // namespace

Number InstrumentationControl::getModuleVersion() const
{
    IC_LOG(3000, "getModuleVersion:");
    return kVersion;
}

Number InstrumentationControl::getInterfaceVersion() const
{
    IC_LOG(3000, "getInterfaceVersion:");
    return kVersion;
}

Error InstrumentationControl::registerForAlerts(AlertCallBack callback, Node::SensorType sensor,
                                                void const* context)
{
    IC_LOG(3000, "registerForAlerts: sensor=", sensor, " Callback=", address(callback), " *p=",
           context);
    SD::MutexGuard guard(registerlock);
    return regAlerts(callback, sensor, context, CLIENT_REGISTRATION);
}

Error InstrumentationControl::deRegisterForAlerts(AlertCallBack callback, Node::SensorType sensor,
                                                  void const* context)
{
    IC_LOG(3000, "deRegisterForAlerts: sensor ", sensor, " Callback=", address(callback), " *p=",
           context);
    SD::MutexGuard guard(registerlock);
    return deRegAlerts(callback, sensor, context, CLIENT_REGISTRATION);
}

Error InstrumentationControl::registerForSimpleAlerts(SimpleAlertCallBack callback,
                                                      unsigned int sensor, void const* context)
{
    IC_LOG(3000, "registerForSimpleAlerts: Sensor=", sensor, " Callback=", address(callback),
           "*p=", context);
    auto const sensor16 = static_cast<std::uint16_t>(sensor);
    SD::MutexGuard guard(registerlock);
    // A repeated registration changes nothing; otherwise the new slot takes
    // the smallest free number.
    bool haveFree = false;
    unsigned int freeSlot = 0;
    for (std::size_t i = 0; i < mysam.size(); ++i) {
        SimpleAlertRegister const& r = mysam[i];
        if (r.callback == callback && r.context == context && r.sensor == sensor16)
            return success();
        if (!haveFree && r.index > i) {
            haveFree = true;
            freeSlot = static_cast<unsigned int>(i);
        }
    }
    unsigned int slot;
    if (!haveFree) {
        slot = static_cast<unsigned int>(mysam.size());
        mysam.emplace_back(callback, sensor16, context, slot);
    } else {
        slot = freeSlot;
        auto pos = std::find_if(mysam.begin(), mysam.end(), [slot](SimpleAlertRegister const& r) {
            return !(r.index < slot);
        });
        if (pos == mysam.end()) { // unreachable while mysam stays sorted
            IC_LOG(6000, "registerForSimpleAlerts: SimpleAlertHandler mapping error");
            mysam.emplace_back(callback, sensor16, context, slot);
        } else {
            mysam.insert(pos, SimpleAlertRegister(callback, sensor16, context, slot));
        }
    }
    return regAlerts(AlertCallBackSimple, simpleSensor(sensor16), slotContext(slot),
                     CLIENT_REGISTRATION);
}

Error InstrumentationControl::deRegisterForSimpleAlerts(SimpleAlertCallBack callback,
                                                        unsigned int sensor, void const* context)
{
    IC_LOG(3000, "deRegisterForSimpleAlerts: sensor=", sensor, " Callback=", address(callback),
           " *p=", context);
    auto const sensor16 = static_cast<std::uint16_t>(sensor);
    SD::MutexGuard guard(registerlock);
    auto found = std::find_if(mysam.begin(), mysam.end(), [&](SimpleAlertRegister const& r) {
        return r.callback == callback && r.context == context && r.sensor == sensor16;
    });
    if (found == mysam.end())
        return failure();
    Error result = deRegAlerts(AlertCallBackSimple, simpleSensor(sensor16),
                               slotContext(found->index), CLIENT_REGISTRATION);
    mysam.erase(found);
    return result;
}

Error InstrumentationControl::getAssertedAlerts(std::vector<Alert>& alerts) const
{
    IC_LOG(3000, "getAssertedAlerts:");
    return alertstore.getAsserted(alerts);
}

Error InstrumentationControl::getNode(unsigned int nodeId, Node** node) const
{
    IC_LOG(3000, "getNode: nodeId ", nodeId);
    return nodestore.getNode(nodeId, node);
}

Error InstrumentationControl::getNode(std::string path, Node** node) const
{
    IC_LOG(3000, "getNode: path ", HexPath{path});
    return nodestore.getNode(std::move(path), node);
}

Error InstrumentationControl::getMap(std::vector<Node*>& nodes) const
{
    IC_LOG(3000, "getMap: all");
    return nodestore.getMap(nodes);
}

Error InstrumentationControl::getMap(std::vector<Node*>& nodes, unsigned int sensor) const
{
    IC_LOG(3000, "getMap: sensor ", sensor);
    return nodestore.getMap(nodes, sensor);
}

Error InstrumentationControl::getAllNodes(std::vector<Node*>& nodes) const
{
    IC_LOG(3000, "getAllNodes:");
    return nodestore.getAllNodes(nodes);
}

std::string InstrumentationControl::getNodeHierarchy(Node* node, Node::SensorType sensor) const
{
    IC_LOG(3000, "getNodeHierarchy: parent sensor ", sensor);
    return nodestore.getNodeHierarchy(node, sensor);
}

std::string InstrumentationControl::getNodeHierarchy(Node* node) const
{
    IC_LOG(3000, "getNodeHierarchy: ");
    return nodestore.getNodeHierarchy(node);
}

std::string InstrumentationControl::getNodeUniqueId(Node* node) const
{
    IC_LOG(3000, "getNodeUniqueId:");
    return nodestore.getNodePath(node);
}

std::string InstrumentationControl::pathToPrintablePath(std::string const& path) const
{
    IC_LOG(3000, "pathToPrintablePath: ", HexPath{path});
    return nodestore.hexstring(path);
}

std::string InstrumentationControl::printablePathToPath(std::string const& printable) const
{
    IC_LOG(3000, "printabePathToPath: ", printable);
    return nodestore.stringhex(printable);
}

void InstrumentationControl::doUnload()
{
    SD::MutexGuard guard(loadlock);
    if (unloaddone)
        return;
    // An unload without a matching open tears down whatever there is.
    if (ICloadCount != 0 && --ICloadCount != 0)
        return;
    unloaddone = true;

    // The loader thread goes first, before anything it might use.
    if (lt) {
        struct JoinFlag {
            JoinFlag() { joiningLoaderThread = true; }
            ~JoinFlag() { joiningLoaderThread = false; }
        } joining;
        lt->stop();
        IC_LOG(3000, "doUnload: waiting for LoaderThread Termination ");
        lt->join();
        IC_LOG(3000, "doUnload: LoaderThread ended ");
        delete lt;
    }
    lt = nullptr;

    // Functional plug-ins use the management interfaces, so they end first;
    // each group's objects end before their code is unmapped.
    while (!myfps.empty()) {
        myfps.back()->release();
        myfps.pop_back();
    }
    while (!myfplibs.empty()) {
        SD::PlatformUtilities::unloadLibrary(myfplibs.back().handle);
        myfplibs.pop_back();
    }
    while (!mymis.empty()) {
        ManagementInterface* const mi = mymis.back();
        mi->shutdown();
        mi->release();
        mymis.pop_back();
    }
    while (!mymilibs.empty()) {
        SD::PlatformUtilities::unloadLibrary(mymilibs.back().handle);
        mymilibs.pop_back();
    }
    {
        SD::MutexGuard registrations(registerlock);
        for (auto const& entry : callbacks)
            delete entry.second;
        callbacks.clear();
        nodepathTOalertregister.clear();
        sensortypeTOalertregister.clear();
        classtypeTOalertregister.clear();
    }
    IC_LOG(3000, "InstrumentationControl unload done");
}

} // namespace IC

// ------------------------------------------------------------- entry points

extern "C" {

unsigned char Open(IC::InstrumentationControl** control, IC::Error** error)
{
    return Openlib(control, error, std::string());
}

unsigned char Openlib(IC::InstrumentationControl** control, IC::Error** error,
                      std::string basePath)
{
    return IC::InstCtrl::openLib(control, error, std::move(basePath),
                                 SD::PlatformUtilities::getBriscaDataDir());
}

unsigned char Openliblog(IC::InstrumentationControl** control, IC::Error** error,
                         std::string basePath, std::string logDir)
{
    return IC::InstCtrl::openLib(control, error, std::move(basePath), std::move(logDir));
}

void Unloadlib()
{
    IC::InstCtrl::ic.doUnload();
}

} // extern "C"
