// Loading, node intake, removal and reload of management-interface plug-ins.
// The class has no state: everything it changes is passed in. Callers
// serialise its use (the library holds IC::InstCtrl::loadlock).
#pragma once

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/Export.h>
#include <IC/FunctionalPlugIn.h>
#include <IC/LoadControl.h>
#include <IC/ManagementInterface.h>
#include <IC/NodeStore.h>
#include <IC/Number.h>

#include <set>
#include <string>
#include <vector>

namespace IC {

class IC_API MIControl {
public:
    // Opens, initialises and registers every MI of toLoad; records that fail
    // are unloaded and erased from toLoad. Status 1 ("No MIs were loaded")
    // when some failed and no MI is loaded at all.
    Error myloadMIs(unsigned short& counter, std::vector<libstruct>& libs,
                    std::vector<ManagementInterface*>& mis, AlertCallBack alertCB,
                    std::vector<libstruct>& toLoad, Number interfaceVersion,
                    Number moduleVersion, NodeStore& store, NodeArrivalCallBack loadCB,
                    void const* context, NodeLookupCallBack getNodeCB);
    // Takes the MI's nodes into the store.
    Error getMINodeSensors(ManagementInterface* mi, NodeStore& store);
    // Releases the MI loaded from path and unloads its library.
    void deleteMI(std::vector<libstruct>& libs, std::string path,
                  std::vector<ManagementInterface*>& mis);
    // Brings the loaded MIs in line with the MI directory, then tells every
    // FP what changed and announces the FPs' new nodes.
    Error reLoadMIs(unsigned short& counter, std::vector<libstruct>& libs,
                    std::vector<ManagementInterface*>& mis, AlertCallBack alertCB,
                    std::vector<FunctionalPlugIn*> const& fps, Number interfaceVersion,
                    Number moduleVersion, NodeStore& store, std::set<std::string>& names,
                    NodeArrivalCallBack loadCB, void const* context, NodeLookupCallBack getNodeCB);
};

namespace MI_CONTROL {
// Orders records by bare file name, byte-wise.
IC_API bool libLT(libstruct a, libstruct b);
// Logs "<context>: <error text>" as an error on this module's logger.
IC_API void diagError(Error* error, std::string context);
} // namespace MI_CONTROL

} // namespace IC
