// Uses the installed headers and libraries the way a client or plug-in
// author would. Exits non-zero when something does not hold.
#include <HGLog/HGLogger.h>
#include <HGLog/HGMessageBuffer.h>
#include <IC/Alert.h>
#include <IC/AlertRegister.h>
#include <IC/AlertStore.h>
#include <IC/Error.h>
#include <IC/FunctionalPlugIn.h>
#include <IC/ICforFP.h>
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>
#include <IC/ManagementInterface.h>
#include <IC/Node.h>
#include <IC/NodeStore.h>
#include <IC/Number.h>
#include <IC/Version2.h>
#include <SD/DateTime.h>
#include <SD/DirectoryReader.h>
#include <SD/Event.h>
#include <SD/Mutex.h>
#include <SD/PlatformUtilities.h>
#include <SD/Thread.h>

#include <cstdio>
#include <string>

// Every installed header is included above; a few calls into each library.
int main()
{
    IC::NodeStore store;
    IC::Node root(IC::Node::ROOT, 0, 0x10001, 0, "root"), chassis(IC::Node::Chassis, 0, 0x10002, 0x10001, "chassis");
    IC::Node *const rootPtr = &root, *const chassisPtr = &chassis;
    bool isNew = false;
    store.addNodeIfNew(rootPtr, isNew);
    store.addNodeIfNew(chassisPtr, isNew);
    SD::Mutex m;
    SD::MutexGuard g(m);
    bool const ok = store.hexstring(chassis.getPath()) == "1f201f5c" &&
                    store.getNodeHierarchy(&chassis) == "ROOT:00000000->Chassis:00000000" &&
                    IC::InstrumentationControl().getModuleVersion() == IC::Number(IC::Version2{1, 0}) &&
                    IC::InstCtrl::donegood.getStatus() == 0 && SD::PlatformUtilities::getSeparator() == '/';
    std::puts(ok ? "consumer: all checks passed" : "consumer: FAILED");
    return ok ? 0 : 1;
}
