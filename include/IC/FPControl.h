// Loading, removal and reload of functional plug-ins. The class has no
// state: everything it changes is passed in. Callers serialise its use.
#pragma once

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/Export.h>
#include <IC/FunctionalPlugIn.h>
#include <IC/ICforFP.h>
#include <IC/LoadControl.h>
#include <IC/NodeStore.h>

#include <set>
#include <string>
#include <vector>

namespace IC {

class IC_API FPControl {
public:
    // Opens and initialises every FP of toLoad; records that fail are
    // unloaded and erased from toLoad. store is not used.
    Error myloadFPs(unsigned short& counter, std::vector<libstruct>& libs,
                    std::vector<FunctionalPlugIn*>& fps, NodeStore& store,
                    ICforFP const& services, std::vector<libstruct>& toLoad);
    // Releases the FP loaded from path and unloads its library.
    void deleteFP(std::vector<libstruct>& libs, std::string path, std::vector<FunctionalPlugIn*>& fps);
    // Brings the loaded FPs in line with the FP directory.
    Error reLoadFPs(unsigned short& counter, std::vector<libstruct>& libs,
                    std::vector<FunctionalPlugIn*>& fps, NodeStore& store, ICforFP const& services,
                    AlertSink const& alertCB, std::set<std::string>& names);
};

namespace FP_CONTROL {
// Kept for the exported interface; nothing reads it.
IC_API extern int fppfx;
// Orders records by bare file name, byte-wise.
IC_API bool libLT(libstruct a, libstruct b);
// Logs "<context>: <error text>" as an error on this module's logger.
IC_API void diagError(Error* error, std::string context);
} // namespace FP_CONTROL

} // namespace IC
