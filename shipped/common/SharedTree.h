// The top of the tree that the shipped management interfaces share.
//
// linuxhw and ipmi both hang their nodes below one ROOT 0 and one
// Chassis 0, whichever of them is loaded. Plug-ins load in file-name order
// (ipmi.so before linuxhw.so), so the first one that has anything to report
// creates the two nodes and a later one adopts them:
//
// - In Initialize (which runs under the library's load lock, so the other
//   plug-in cannot be unloaded meanwhile) a plug-in looks kChassisPath (and
//   kRootPath) up through the node look-up the library hands management
//   interfaces. Found: it keeps only the node's id, links its top-level
//   nodes to it and reports no ROOT or Chassis of its own. Not found: it
//   reports its own.
// - It never keeps the other plug-in's node object: once Initialize returns
//   that node's code may be unloaded by a reload.
// - Its removal alerts (release included) name only its own nodes.
// - When the adopted node goes away (the other plug-in removed by a
//   reload), the adopter removes its nodes and announces them again below a
//   ROOT and Chassis of its own (linuxhw does; ipmi, which loads first,
//   does not yet).
#pragma once

#include <IC/ManagementInterface.h>
#include <IC/Node.h>

#include <string>

namespace shipped {

// Packed paths (node first, then its parents) of ROOT 0 and of Chassis 0
// below it: letters "bpfma" and "bpcabpfma" packed two to a byte.
inline std::string const kRootPath("\x1f\x5c", 2);
inline std::string const kChassisPath("\x1f\x20\x1f\x5c", 4);

// The id of the node at path that another plug-in reports, or 0 when
// there is none (or no look-up). The first plug-in a process loads (load
// number 1 in the upper half of its node-id base) has nothing to adopt and
// does not ask: the library logs a look-up that finds nothing as an error.
inline unsigned int adoptedNodeId(IC::NodeLookupCallBack lookup, unsigned int nodeIdBase, std::string const& path)
{
    if (!lookup || (nodeIdBase >> 16) <= 1)
        return 0;
    IC::Node* node = nullptr;
    IC::Error const e = lookup(path, &node);
    return e.getStatus() == 0 && node ? node->getNodeId() : 0;
}

} // namespace shipped
