// IC::InstrumentationControl: the facade a client receives from the library.
// The object has no data of its own; all state is the library's.
#pragma once

#include <IC/Alert.h>
#include <IC/AlertRegister.h>
#include <IC/Error.h>
#include <IC/Export.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <string>
#include <vector>

namespace IC {

class IC_API InstrumentationControl {
public:
    // Version of this library, 1.0.
    Number getModuleVersion() const;
    // Version of the plug-in interface, 1.0.
    Number getInterfaceVersion() const;

    // Alerts raised by functional plug-ins on nodes of a sensor type reach
    // callback with context. One register per (callback, context) pair.
    Error registerForAlerts(AlertCallBack callback, Node::SensorType sensor, void const* context);
    Error deRegisterForAlerts(AlertCallBack callback, Node::SensorType sensor,
                              void const* context);

    // One call of callback per alert and node path, with an event code;
    // the callback runs under the registration lock and must not register
    // or deregister itself.
    Error registerForSimpleAlerts(SimpleAlertCallBack callback, unsigned int sensor,
                                  void const* context);
    Error deRegisterForSimpleAlerts(SimpleAlertCallBack callback, unsigned int sensor,
                                    void const* context);

    // alerts := the alerts currently asserted, by ascending node path.
    Error getAssertedAlerts(std::vector<Alert>& alerts) const;

    // ---- nodes ----
    // Status 1 (and *node untouched) when no node has that id or binary path.
    Error getNode(unsigned int nodeId, Node** node) const;
    Error getNode(std::string path, Node** node) const;
    // nodes := every node of the functional plug-ins and reloads, by sensor
    // type; or those of one sensor type.
    Error getMap(std::vector<Node*>& nodes) const;
    Error getMap(std::vector<Node*>& nodes, unsigned int sensor) const;
    // nodes := every registered node, those of the management interfaces
    // included (getMap lists only nodes of functional plug-ins and reloads),
    // by ascending node id. For tools that show the whole hardware tree.
    Error getAllNodes(std::vector<Node*>& nodes) const;
    // "ROOT:00000000->Chassis:00000000->CPU:00000001", from the nearest
    // ancestor of type sensor (or the root) down to the node.
    std::string getNodeHierarchy(Node* node, Node::SensorType sensor) const;
    std::string getNodeHierarchy(Node* node) const;
    // The node's binary path.
    std::string getNodeUniqueId(Node* node) const;
    // Binary path to lower-case hexadecimal and back; the second throws
    // std::invalid_argument for text that is not hexadecimal or holds a zero
    // byte.
    std::string pathToPrintablePath(std::string const& path) const;
    std::string printablePathToPath(std::string const& printable) const;

    // Undoes one open; the last one tears everything down.
    void doUnload();
};

} // namespace IC

// The entry points, with C linkage. Each open returns a load code: 0 success
// (*control and *error set), 15 management interfaces failed to load, 31
// functional plug-ins failed to load (*error set to the "Load Library"
// error, *control untouched). The returned objects belong to the library.
extern "C" {
// Open with no base path.
IC_API unsigned char Open(IC::InstrumentationControl** control, IC::Error** error);
// Open with a base library path.
IC_API unsigned char Openlib(IC::InstrumentationControl** control, IC::Error** error,
                             std::string basePath);
// Open with a base library path and a log directory.
IC_API unsigned char Openliblog(IC::InstrumentationControl** control, IC::Error** error,
                                std::string basePath, std::string logDir);
// Undoes one open.
IC_API void Unloadlib();
}
