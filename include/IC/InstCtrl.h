// The library's exported global state and the functions of namespace
// IC::InstCtrl that it hands to plug-ins and hosts.
//
// Locks: registerlock guards the four registration indexes, the registers
// and mysam; the node store and the alert store guard themselves. Take
// registerlock before the node store's lock, never the other way round.
#pragma once

#include <IC/Alert.h>
#include <IC/AlertRegister.h>
#include <IC/AlertStore.h>
#include <IC/Error.h>
#include <IC/Export.h>
#include <IC/Node.h>
#include <IC/NodeStore.h>
#include <SD/Mutex.h>

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <utility>
#include <vector>

namespace IC {
namespace InstCtrl {

// A registration's key: the callback and the context it was registered with.
using CallbackKey = std::pair<AlertCallBack, void const*>;

// Orders keys by callback, then context, as addresses.
struct CallbackKeyLess {
    bool operator()(CallbackKey const& a, CallbackKey const& b) const
    {
        auto const fa = reinterpret_cast<std::uintptr_t>(a.first);
        auto const fb = reinterpret_cast<std::uintptr_t>(b.first);
        if (fa != fb)
            return fa < fb;
        return std::less<void const*>()(a.second, b.second);
    }
};

// ---- global state ----
// The shared success value of the alert functions.
IC_API extern Error donegood;
// Every register, by (callback, context); owns the registers.
IC_API extern std::map<CallbackKey, AlertRegister*, CallbackKeyLess> callbacks;
// Reverse indexes used by the dispatcher; at most one entry per (key, register).
IC_API extern std::multimap<std::string, AlertRegister*> nodepathTOalertregister;
IC_API extern std::multimap<Node::SensorType, AlertRegister*> sensortypeTOalertregister;
IC_API extern std::multimap<Alert::ClassType, AlertRegister*> classtypeTOalertregister;
// Simple-alert slots, sorted by slot number.
IC_API extern std::vector<SimpleAlertRegister> mysam;
// The node registry.
IC_API extern NodeStore nodestore;
// The alerts currently asserted.
IC_API extern AlertStore alertstore;
// Serialises registration and dispatch.
IC_API extern SD::Mutex registerlock;

// ---- diagnostics ----
// Logs "<context>: <error text>" as an error on the library's logger.
IC_API void diagError(Error* error, std::string context);
// Lower-case hexadecimal of a binary path, for logs.
IC_API std::string hexstring(std::string s);

// ---- alert entry points handed to plug-ins ----
// A management interface's batch: reaches functional plug-in registrations.
IC_API Error AlertCallBackMI(std::vector<Alert> const& alerts, void const* context);
// A functional plug-in's batch: reaches every registration and updates the
// alert store.
IC_API Error AlertCallBackFP(std::vector<Alert> const& alerts);
// Records a functional plug-in's batch in the alert store without delivery.
IC_API Error AssertCallBackFP(std::vector<Alert> const& alerts);
// The dispatcher behind the entry points.
IC_API Error AlertCallBackCommon(std::vector<Alert> const& alerts, void const* context,
                                 MyAlertType type);
// Adapter of the simple alerts: its context is a slot number of mysam.
IC_API Error AlertCallBackSimple(std::vector<Alert> const& alerts, void const* context);

// ---- registration ----
// By alert class (client registrations); lock registerlock themselves.
IC_API Error registerForAlerts(AlertCallBack callback, Alert::ClassType cls, void const* context);
IC_API Error deRegisterForAlerts(AlertCallBack callback, Alert::ClassType cls, void const* context);
// By node paths (client registrations).
IC_API Error registerForAlerts(AlertCallBack callback, std::vector<std::string> const& paths,
                               void const* context);
IC_API Error deRegisterForAlerts(AlertCallBack callback, std::vector<std::string> const& paths,
                                 void const* context);
// The functional plug-ins' forms, by node paths and by sensor type.
IC_API Error regFPAlerts(AlertCallBack callback, std::vector<std::string> const& paths,
                         void const* context);
IC_API Error deRegFPAlerts(AlertCallBack callback, std::vector<std::string> const& paths,
                           void const* context);
IC_API Error regFPsensorAlerts(AlertCallBack callback, Node::SensorType sensor,
                               void const* context);
IC_API Error deRegFPsensorAlerts(AlertCallBack callback, Node::SensorType sensor,
                                 void const* context);
// Workers. The sensor forms expect the caller to hold registerlock; the path
// forms take it themselves.
IC_API Error regAlerts(AlertCallBack callback, Node::SensorType sensor, void const* context,
                       MyRegType regType);
IC_API Error deRegAlerts(AlertCallBack callback, Node::SensorType sensor, void const* context,
                         MyRegType regType);
IC_API Error regAlerts(AlertCallBack callback, std::vector<std::string> const& paths,
                       void const* context, MyRegType regType);
IC_API Error deRegAlerts(AlertCallBack callback, std::vector<std::string> const& paths,
                         void const* context, MyRegType regType);

} // namespace InstCtrl
} // namespace IC
