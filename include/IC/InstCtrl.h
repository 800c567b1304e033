// The library's exported global state and the functions of namespace
// IC::InstCtrl that it hands to plug-ins and hosts.
//
// Locks: loadlock serialises open, unload and reload, and guards the plug-in
// lists, the open count and the flags; registerlock guards the four registration indexes, the registers
// and mysam; the node store and the alert store guard themselves. Take
// registerlock before the node store's lock, never the other way round.
#pragma once

#include <IC/Alert.h>
#include <IC/AlertRegister.h>
#include <IC/AlertStore.h>
#include <IC/Error.h>
#include <IC/Export.h>
#include <IC/FunctionalPlugIn.h>
#include <IC/LoadControl.h>
#include <IC/LoaderThread.h>
#include <IC/ManagementInterface.h>
#include <IC/Node.h>
#include <IC/NodeStore.h>
#include <SD/Mutex.h>

#include <cstdint>
#include <functional>
#include <map>
#include <set>
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
// Base library paths given by clients, each ending with a separator.
IC_API extern std::set<std::string> icbaselibpath;
// Loaded plug-in libraries and objects, in load order.
IC_API extern std::vector<libstruct> mymilibs;
IC_API extern std::vector<libstruct> myfplibs;
IC_API extern std::vector<ManagementInterface*> mymis;
IC_API extern std::vector<FunctionalPlugIn*> myfps;
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
// Number of opens not yet matched by an unload.
IC_API extern std::uint32_t ICloadCount;
// The host's loader thread, if any; the last unload stops and deletes it.
IC_API extern LoaderThread* lt;
// The alerts currently asserted.
IC_API extern AlertStore alertstore;
// Serialises open, unload and reload.
IC_API extern SD::Mutex loadlock;
// Serialises registration and dispatch.
IC_API extern SD::Mutex registerlock;
// Set by the unload that tore the state down; cleared by the next first open.
IC_API extern bool unloaddone;
// Load number of the next plug-in; never reset.
IC_API extern std::uint16_t mymifpctr;

// ---- open and reload ----
// The open sequence behind the entry points; returns the load code (0, 15
// management interfaces failed, 31 functional plug-ins failed).
IC_API unsigned char openLib(InstrumentationControl** control, Error** error,
                             std::string basePath, std::string logDir);
// One reload pass of both plug-in directories; the function for a
// LoaderThread.
IC_API void TimedReload();

// ---- diagnostics ----
// Logs "<context>: <error text>" as an error on the library's logger.
IC_API void diagError(Error* error, std::string context);
// Lower-case hexadecimal of a binary path, for logs.
IC_API std::string hexstring(std::string s);

// ---- node entries handed to plug-ins ----
// A management interface's node found after loading.
IC_API Error LoadCallBackMI(Node* const& node, void const* context);
// Node look-up by binary path for management interfaces.
IC_API Error getNodeCallBackMI(std::string const& path, Node** node);
// A functional plug-in's own node.
IC_API Error MapNewFPNode(Node* const& node);

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
