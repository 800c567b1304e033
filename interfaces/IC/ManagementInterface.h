// IC::ManagementInterface: the object a management-interface plug-in hands to
// the library. A plug-in library exports
//
//     extern "C" unsigned char OpenMI(IC::ManagementInterface** mi, IC::Error** err);
//
// which returns 0, a new object in *mi and an error of status 0 in *err on
// success. The library then calls, in this order: registerNodeCallBacks,
// Initialize, registerForAlerts, getMap; at the end shutdown, then release.
#pragma once

#include <IC/Alert.h>
#include <IC/CommonExport.h>
#include <IC/Error.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <string>
#include <vector>

namespace IC {

// A node found after loading: the node and the context given with the callback.
using NodeArrivalCallBack = Error (*)(Node* const& node, void const* context);
// Looks a node up by its binary path.
using NodeLookupCallBack = Error (*)(std::string const& path, Node** node);

class ICCOMMON_API ManagementInterface {
public:
    virtual ~ManagementInterface();

    // Fills nodes (empty on entry) with the interface's nodes.
    virtual Error getMap(std::vector<Node*>& nodes) = 0;
    // nodeIdBase carries the plug-in's load number in its upper 16 bits; the
    // interface's node ids should carry it too.
    virtual Error Initialize(unsigned int nodeIdBase, Number interfaceVersion,
                             Number moduleVersion) = 0;
    // The interface reports its alerts through callback, passing context back.
    virtual Error registerForAlerts(AlertCallBack callback, void const* context) = 0;
    // Nodes found later go to arrival (with context); lookup finds known nodes.
    virtual void registerNodeCallBacks(NodeArrivalCallBack arrival, void const* context,
                                       NodeLookupCallBack lookup) = 0;
    // Stops the interface's own threads; called once, before release().
    virtual Error shutdown() = 0;
    // Ends the interface; the library does not touch the object again.
    virtual void release() = 0;
};

using OpenMIFunction = unsigned char (*)(ManagementInterface** mi, Error** err);

} // namespace IC
