// The top of the tree that the shipped management interfaces share.
//
// linuxhw and ipmi both hang their nodes below one ROOT 0 and one
// Chassis 0, whichever of them is loaded. Plug-ins load in file-name order
// (ipmi.so before linuxhw.so), so the first one that has anything to report
// creates the two nodes and a later one adopts them:
//
// - The plug-in that reports them says so in the process-wide record of
//   libicshipped (announceTop), and takes it back when it is released
//   (withdrawTop).
// - In Initialize (which runs under the library's load lock, so the other
//   plug-in cannot be unloaded meanwhile) a plug-in reads the record; when
//   it names a ROOT or Chassis, it looks kRootPath / kChassisPath up through
//   the node look-up the library hands management interfaces, and found, it
//   keeps only the node's id, links its top-level nodes to it and reports no
//   ROOT or Chassis of its own. Otherwise it reports its own. (The record
//   comes first because the library logs a look-up that finds nothing as an
//   error, and most machines have no BMC.)
// - It never keeps the other plug-in's node object: once Initialize returns
//   that node's code may be unloaded by a reload.
// - Its removal alerts (release included) name only its own nodes.
// - When the adopted node goes away (the other plug-in removed by a
//   reload), the adopter removes its nodes and announces them again below a
//   ROOT and Chassis of its own, or, when the record names them already (a
//   plug-in loaded in the same reload, the other one replaced), below those,
//   adopted by the record's ids. Its polling thread learns all of it from the
//   record alone (adoptedTopGone, sharedTop), never from the nodes.
#pragma once

#include <IC/ManagementInterface.h>
#include <IC/Node.h>

#include <string>

namespace shipped {

// Packed paths (node first, then its parents) of ROOT 0 and of Chassis 0
// below it: letters "bpfma" and "bpcabpfma" packed two to a byte.
inline std::string const kRootPath("\x1f\x5c", 2);
inline std::string const kChassisPath("\x1f\x20\x1f\x5c", 4);

// Node ids of the shared ROOT and Chassis and who reports them; 0: none.
struct SharedTop {
    unsigned int rootId = 0;
    unsigned int chassisId = 0;
};

#define IC_SHIPPED_API __attribute__((visibility("default")))
// Records the ROOT and Chassis a plug-in reports (0 for one it does not).
IC_SHIPPED_API void announceTop(SharedTop const& reported);
// Clears the record if rootId is still the recorded ROOT.
IC_SHIPPED_API void withdrawTop(unsigned int rootId);
IC_SHIPPED_API SharedTop sharedTop();

// True when the ROOT adopted (adoptedRootId; 0: none adopted) is gone: the
// plug-in that reported it withdrew it as it was released. Reads only the
// record, so a polling thread may ask.
inline bool adoptedTopGone(unsigned int adoptedRootId)
{
    return adoptedRootId != 0 && sharedTop().rootId != adoptedRootId;
}

// What a plug-in says (its log line and removal alert) as it takes its
// nodes back after adoptedTopGone: now is the record as it then reads it.
inline std::string rehomeMessage(std::string const& plugin, SharedTop const& now)
{
    return plugin + (now.rootId != 0 ? ": the shared chassis went away; joining the one reported now"
                                     : ": the shared chassis went away; reporting a chassis of its own");
}

// The id of the node at path that another plug-in reports, or 0 when there
// is none, no look-up, or the record says nobody reports it (recorded: the
// id the record holds).
inline unsigned int adoptedNodeId(IC::NodeLookupCallBack lookup, unsigned int recorded, std::string const& path)
{
    if (!lookup || recorded == 0)
        return 0;
    IC::Node* node = nullptr;
    IC::Error const e = lookup(path, &node);
    return e.getStatus() == 0 && node ? node->getNodeId() : 0;
}

} // namespace shipped
