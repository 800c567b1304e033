#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include "HexText.h"
#include "InstCtrlPrivate.h"

#include <algorithm>
#include <memory>
#include <ostream>
#include <set>

namespace IC {
namespace InstCtrl {

// The library's state, constructed in this order when the library is loaded.
std::string loggerIC = "Helmgard.IC.InstrumentationControl";
InstrumentationControl ic;
Error myice(0, Number(0u), "");
Error lderr(5, Number(1u), "Load Library");
Error donegood(0, Number(Number::Generic), "");
std::map<CallbackKey, AlertRegister*, CallbackKeyLess> callbacks;
std::multimap<std::string, AlertRegister*> nodepathTOalertregister;
std::multimap<Node::SensorType, AlertRegister*> sensortypeTOalertregister;
std::multimap<Alert::ClassType, AlertRegister*> classtypeTOalertregister;
std::vector<SimpleAlertRegister> mysam;
NodeStore nodestore;
AlertStore alertstore;
SD::Mutex registerlock;

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

} // namespace

namespace InstCtrl {

void diagError(Error* error, std::string context)
{
    if (error)
        IC_LOG(6000, context, ": ", *error);
    else
        IC_LOG(6000, context, ": ", "(no error)");
}

std::string hexstring(std::string s)
{
    return detail::hexText(s);
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

Error AlertCallBackCommon(std::vector<Alert> const& alerts, void const*, MyAlertType type)
{
    std::vector<std::string> removed;
    std::vector<AlertCall> calls;
    {
        SD::MutexGuard guard(registerlock);
        std::set<AlertRegister*> selected;
        for (Alert const& alert : alerts) {
            auto byClass = classtypeTOalertregister.equal_range(alert.getClass());
            for (auto it = byClass.first; it != byClass.second; ++it)
                selected.insert(it->second);
            for (std::string const& path : alert.nodePaths()) {
                if (alert.getClass() == Alert::NodeRemoval &&
                    std::find(removed.begin(), removed.end(), path) == removed.end())
                    removed.push_back(path);
                auto bySensor = sensortypeTOalertregister.equal_range(nodestore.nodePathToSensor(path));
                for (auto it = bySensor.first; it != bySensor.second; ++it)
                    selected.insert(it->second);
                auto byPath = nodepathTOalertregister.equal_range(path);
                for (auto it = byPath.first; it != byPath.second; ++it)
                    selected.insert(it->second);
            }
        }
        for (AlertRegister* reg : selected)
            if (reg->filterAlerts(nodestore, alerts, calls, type))
                IC_LOG(3000, "InstrumentationControl ER_CLEANED from AlertRegister ", reg);
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
            nodepathTOalertregister.erase(path);
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

} // namespace IC
