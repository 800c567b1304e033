// Uses the installed headers and libraries the way a client or plug-in
// author would. Exits non-zero on the first thing that does not hold.
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

namespace {
int failures = 0;
void check(bool ok, char const* what)
{
    if (!ok) {
        std::fprintf(stderr, "consumer: FAILED: %s\n", what);
        ++failures;
    }
}
} // namespace

int main()
{
    IC::NodeStore store;
    IC::Node root(IC::Node::ROOT, 0, 0x10001, 0, "root");
    IC::Node chassis(IC::Node::Chassis, 0, 0x10002, 0x10001, "chassis");
    IC::Node* const rootPtr = &root;
    IC::Node* const chassisPtr = &chassis;
    bool isNew = false;
    check(store.addNodeIfNew(rootPtr, isNew).getStatus() == 0 && isNew, "root added");
    check(store.addNodeIfNew(chassisPtr, isNew).getStatus() == 0 && isNew, "chassis added");
    check(store.hexstring(chassis.getPath()) == "1f201f5c", "chassis path");
    check(store.getNodeHierarchy(&chassis) == "ROOT:00000000->Chassis:00000000", "hierarchy");

    IC::InstrumentationControl facade;
    check(facade.getModuleVersion() == IC::Number(IC::Version2{1, 0}), "module version");
    check(IC::InstCtrl::donegood.getStatus() == 0, "donegood exported");

    IC::Alert alert(3, IC::Alert::NodeRemoval, {chassis.getPath()}, 2, "gone");
    check(alert.getClass() == 4, "alert class");

    IC::AlertStore asserted;
    asserted.newAlerts({alert}, IC::FP_ALERT);
    std::vector<IC::Alert> out;
    asserted.getAsserted(out);
    check(out.size() == 1 && out[0].getMessage() == "gone", "alert store");

    SD::Mutex m;
    {
        SD::MutexGuard g(m);
    }
    check(SD::PlatformUtilities::getSeparator() == '/', "separator");
    if (failures == 0)
        std::puts("consumer: all checks passed");
    return failures == 0 ? 0 : 1;
}
