#include <IC/AlertRegister.h>

#include <IC/AlertStore.h>
#include <IC/NodeStore.h>

#include <HGLog/HGLogger.h>

#include <algorithm>

#include "../frame/HexText.h"

namespace IC {
namespace ALERT_REGISTER {

// Private to the library.
std::string loggerAlertRegister = "Helmgard.IC.InstrumentationControl.AlertRegister";

} // namespace ALERT_REGISTER

#define AR_LOG(level, ...) \
    HGLOG_EVENT("AlertRegister", ALERT_REGISTER::loggerAlertRegister, level, __VA_ARGS__)

// ----------------------------------------------------------------- AlertBatch

AlertBatch::AlertBatch(NodeStore& store, std::vector<Alert> const& alerts)
{
    sensors.resize(alerts.size());
    for (std::size_t a = 0; a < alerts.size(); ++a) {
        auto const& nodePaths = alerts[a].nodePaths();
        sensors[a].reserve(nodePaths.size());
        for (std::string const& path : nodePaths)
            sensors[a].push_back(store.nodePathToSensor(path));
    }
}

// ------------------------------------------------------------------ AlertCall

AlertCall::AlertCall(AlertCallBack callback, void const* context)
    : callback(callback), context(context)
{
}

void AlertCall::add(Alert alert, std::vector<std::string>& paths)
{
    addRestricted(alert, paths);
}

void AlertCall::addRestricted(Alert const& alert, std::vector<std::string> paths)
{
    alerts.emplace_back(alert.getSeverity(), alert.getClass(), std::move(paths),
                        alert.getStatus(), alert.getMessage());
}

void AlertCall::callBack(AlertStore& store, unsigned int type)
{
    // The call owns its alerts and nothing changes them while they are
    // recorded and delivered, so they go out as they are.
    store.newAlerts(alerts, type);
    callback(alerts, context);
}

// -------------------------------------------------------------- AlertRegister

AlertRegister::AlertRegister(AlertCallBack callback, void const* context, unsigned int regType)
    : callback(callback), context(context), regType(regType)
{
}

AlertRegister::~AlertRegister()
{
    callback = nullptr;
    context = nullptr;
    classes.clear();
    sensorTypes.clear();
    nodePaths.clear();
}

bool AlertRegister::add(AlertCallBack, Node::SensorType sensor)
{
    sensorTypes.insert(sensor);
    return true;
}

bool AlertRegister::add(AlertCallBack, Alert::ClassType cls)
{
    classes.insert(cls);
    return true;
}

bool AlertRegister::add(AlertCallBack, std::vector<std::string> const& paths)
{
    nodePaths.insert(paths.begin(), paths.end());
    return true;
}

// The sets hold each value once, so the "deregistered ... times" lines below
// are never written; they stay as a guard should the sets ever become
// multisets.

unsigned char AlertRegister::del(AlertCallBack cb, Node::SensorType sensor)
{
    if (cb != callback) {
        AR_LOG(6000, "del: ", this, " Callback mismatch: ", cb != nullptr, " != ",
               callback != nullptr, " p=", context);
        return 2;
    }
    std::size_t const erased = sensorTypes.erase(sensor);
    if (erased > 1)
        AR_LOG(3000, "del: ", this, " Sensor Type deregistered for callback=", cb != nullptr,
               " p=", context, " sensor=", static_cast<unsigned int>(sensor), " ", erased,
               " times");
    return testClean() ? 1 : 0;
}

unsigned char AlertRegister::del(AlertCallBack cb, Alert::ClassType cls)
{
    if (cb != callback) {
        AR_LOG(6000, "del: ", this, " Callback mismatch: ", cb != nullptr, " != ",
               callback != nullptr, " p=", context);
        return 2;
    }
    std::size_t const erased = classes.erase(cls);
    if (erased > 1)
        AR_LOG(3000, "del: ", this, " Alert Class deregistered for callback=", cb != nullptr,
               " p=", context, " class=", static_cast<unsigned int>(cls), " ", erased, " times");
    return testClean() ? 1 : 0;
}

unsigned char AlertRegister::del(AlertCallBack cb, std::vector<std::string> const& paths)
{
    if (cb != callback) {
        AR_LOG(6000, "del: ", this, " Callback mismatch: ", cb != nullptr, " p=", context,
               " != ", callback != nullptr);
        return 2;
    }
    for (std::string const& path : paths) {
        std::size_t const erased = nodePaths.erase(path);
        if (erased > 1)
            AR_LOG(3000, "del: ", this, " NodePath deregistered for callback=", cb != nullptr,
                   " p=", context, " NodePath=", hexstring(path), " ", erased, " times");
    }
    return testClean() ? 1 : 0;
}

bool AlertRegister::testClean()
{
    if (!classes.empty() || !sensorTypes.empty() || !nodePaths.empty())
        return false;
    callback = nullptr;
    return true;
}

std::string AlertRegister::hexstring(std::string const& s) const
{
    return detail::hexText(s);
}

bool AlertRegister::filterAlerts(NodeStore& store, std::vector<Alert> const& alerts,
                                 std::vector<AlertCall>& calls, unsigned int type)
{
    // Clients see only what functional plug-ins raise.
    if (regType == CLIENT_REGISTRATION && type == MI_ALERT)
        return false;
    return filterAlerts(AlertBatch(store, alerts), alerts, calls, type);
}

bool AlertRegister::filterAlerts(AlertBatch const& batch, std::vector<Alert> const& alerts,
                                 std::vector<AlertCall>& calls, unsigned int type)
{
    // Clients see only what functional plug-ins raise.
    if (regType == CLIENT_REGISTRATION && type == MI_ALERT)
        return false;
    if (!callback) {
        AR_LOG(6000, "filterAlerts: Alert Register has null callback address");
        return false;
    }
    AlertCall call(callback, context);
    std::vector<std::string> matched;

    for (std::size_t a = 0; a < alerts.size(); ++a) {
        Alert const& alert = alerts[a];
        AR_LOG(3000, "AlertRegister::filterAlerts Input Alert=", alert);
        matched.clear();
        auto const& alertPaths = alert.nodePaths();
        if (classes.count(alert.getClass()) != 0) {
            matched = alertPaths;
        } else {
            for (std::size_t p = 0; p < alertPaths.size(); ++p) {
                std::string const& path = alertPaths[p];
                if (nodePaths.count(path) != 0) {
                    matched.push_back(path);
                    continue;
                }
                Node::SensorType const sensor = batch.sensorOf(a, p);
                if (sensor == Node::invalid) {
                    AR_LOG(6000, "filterAlerts: could not find nodepath for NodePath=",
                           hexstring(path), " Sensor Class=", static_cast<unsigned int>(sensor));
                    continue;
                }
                if (sensorTypes.count(sensor) != 0)
                    matched.push_back(path);
            }
        }
        if (!matched.empty()) {
            call.add(alert, matched);
            AR_LOG(3000, "AlertRegister::filterAlerts output Alert=", alert);
        }
    }
    // Even an empty delivery is made: the callback is called with no alert.
    calls.push_back(std::move(call));
    return false;
}

} // namespace IC
