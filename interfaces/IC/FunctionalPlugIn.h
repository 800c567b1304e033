// IC::FunctionalPlugIn: the object a functional plug-in hands to the library.
// A plug-in library exports
//
//     extern "C" unsigned char OpenFP(IC::FunctionalPlugIn** fp, IC::Error** err);
//
// which returns 0, a new object in *fp and an error of status 0 in *err on
// success. The library calls Initialize() once with the plug-in's node-id base
// and its services, and release() at the end.
#pragma once

#include <IC/CommonExport.h>
#include <IC/Error.h>
#include <IC/ICforFP.h>
#include <IC/Node.h>

#include <vector>

namespace IC {

class ManagementInterface;

class ICCOMMON_API FunctionalPlugIn {
public:
    virtual ~FunctionalPlugIn();

    // Fills nodes (empty on entry) with the plug-in's own nodes.
    virtual Error getMap(std::vector<Node*>& nodes) = 0;
    // The services object lives only during this call; copy what you keep.
    virtual Error Initialize(unsigned int nodeIdBase, ICforFP const& services) = 0;
    // Management interfaces came and went. Removed ones are already ended and
    // serve only as identities.
    virtual Error updatedMis(std::vector<ManagementInterface*> const& added,
                             std::vector<ManagementInterface*> const& removed) = 0;
    // Ends the plug-in; the library does not touch the object again.
    virtual void release() = 0;
};

using OpenFPFunction = unsigned char (*)(FunctionalPlugIn** fp, Error** err);

} // namespace IC
