#include <IC/MIControl.h>

#include <HGLog/HGLogger.h>
#include <SD/PlatformUtilities.h>

#include "../frame/DiagError.h"
#include "ReloadScan.h"

#include <algorithm>
#include <exception>
#include <typeinfo>

namespace IC {
namespace MI_CONTROL {

// Private to the library.
std::string loggerMIControl = "Helmgard.IC.InstrumentationControl.MIControl";

} // namespace MI_CONTROL

#define MI_LOG(level, ...) \
    HGLOG_EVENT("MIControl", MI_CONTROL::loggerMIControl, level, __VA_ARGS__)

namespace MI_CONTROL {

bool libLT(libstruct a, libstruct b)
{
    // std::string compares its bytes as unsigned characters, shorter first
    // on a common prefix.
    return a.name < b.name;
}

void diagError(Error* error, std::string context)
{
    detail::reportError("MIControl", loggerMIControl, error, context);
}

} // namespace MI_CONTROL

// The steps of one library are logged as the loader's own.
#define MI_LOG_LOAD(level, ...) \
    HGLog::logEvent("myloadMIs", "MIControl", __LINE__, MI_CONTROL::loggerMIControl, level, __VA_ARGS__)

namespace {

Error success()
{
    return Error(0, Number(Number::Generic), std::string());
}

// Steps of loading one MI library; false when the record failed.
bool loadOne(libstruct& record, unsigned short& counter, std::vector<libstruct>& libs,
             std::vector<ManagementInterface*>& mis, AlertCallBack alertCB,
             Number const& interfaceVersion, Number const& moduleVersion, NodeStore& store,
             NodeArrivalCallBack loadCB, void const* context, NodeLookupCallBack getNodeCB,
             MIControl& control)
{
    char symbol[] = "OpenMI";
    auto const open =
        reinterpret_cast<OpenMIFunction>(SD::PlatformUtilities::loadSymbol(record.handle, symbol));
    if (!open) {
        MI_LOG_LOAD(6000, "myloadMIs: ", record.path, " OpenMI() function is missing.");
        return false;
    }
    ManagementInterface* mi = nullptr;
    Error* err = nullptr;
    unsigned char const code = open(&mi, &err);
    if (code != 0) {
        MI_LOG_LOAD(6000, "myloadMIs: ", record.path, " OpenMI failed code=", code);
        return false;
    }
    if (!err) {
        MI_LOG_LOAD(6000, "myloadMIs: ", record.path, " Pointer to Error is NULL");
        return false;
    }
    if (err->getStatus() != 0) {
        MI_CONTROL::diagError(err, "OpenMI() failed");
        return false;
    }
    if (!mi) {
        MI_LOG_LOAD(6000, "myloadMIs: ", record.path, " OpenMI pointer to MI is NULL");
        return false;
    }
    // The MI may report nodes as soon as it has the callbacks, before it is
    // initialised.
    mi->registerNodeCallBacks(loadCB, context, getNodeCB);
    unsigned int const base = static_cast<unsigned int>(counter) << 16;
    MI_LOG_LOAD(3000, "myloadMIs: ", record.path, " Initialize");
    Error result = mi->Initialize(base, interfaceVersion, moduleVersion);
    MI_LOG_LOAD(3000, "myloadMIs: ", record.path, " Initialize Done");
    if (result.getStatus() != 0) {
        MI_CONTROL::diagError(&result, "MI Initialize");
        return false;
    }
    result = mi->registerForAlerts(alertCB, mi);
    if (result.getStatus() != 0) {
        MI_CONTROL::diagError(&result, "MIControl MI registerForAlerts");
        return false;
    }
    // An MI whose nodes cannot be read stays loaded.
    result = control.getMINodeSensors(mi, store);
    if (result.getStatus() != 0)
        MI_CONTROL::diagError(&result, "MIControl MI getMap()");
    mis.push_back(mi);
    record.plugin = mi;
    record.idbase = base;
    libs.push_back(record);
    ++counter;
    return true;
}

} // namespace

Error MIControl::myloadMIs(unsigned short& counter, std::vector<libstruct>& libs,
                           std::vector<ManagementInterface*>& mis, AlertCallBack alertCB,
                           std::vector<libstruct>& toLoad, Number interfaceVersion,
                           Number moduleVersion, NodeStore& store, NodeArrivalCallBack loadCB,
                           void const* context, NodeLookupCallBack getNodeCB)
{
    unsigned int const failed = detail::loadEach(
        toLoad,
        [&](libstruct& record) {
            return loadOne(record, counter, libs, mis, alertCB, interfaceVersion, moduleVersion,
                           store, loadCB, context, getNodeCB, *this);
        },
        [](libstruct const& record, std::exception const* e) {
            if (e)
                MI_LOG_LOAD(6000, "myloadMIs: Exception ", e->what(), " Type=", typeid(*e).name(),
                            " for ", record.path);
            else
                MI_LOG_LOAD(6000, "myloadMIs: ", record.path, " Exception loading library");
        });
    if (failed == 0)
        return success();
    MI_LOG(6000, "myloadMIs count of MIs that did not load ", failed);
    if (!mis.empty())
        return Error(0, Number(failed), "Count of MIs that did not load");
    return Error(1, Number(failed), "No MIs were loaded");
}

Error MIControl::getMINodeSensors(ManagementInterface* mi, NodeStore& store)
{
    Error result = success();
    std::vector<Node*> nodes;
    try {
        result = mi->getMap(nodes);
    } catch (std::exception const& e) {
        MI_LOG(6000, "getMINodeSensors getMap(): Exception ", e.what(), " Type=", typeid(e).name());
    } catch (...) {
        MI_LOG(6000, "getMINodeSensors: exception caught in getMap");
    }
    if (result.getStatus() != 0) {
        MI_CONTROL::diagError(&result, "MIControl MI getMap() Failed");
        return result;
    }
    for (Node* node : nodes) {
        if (!node) {
            MI_LOG(6000, "getMINodeSensors: getMap() gave a null node");
            continue;
        }
        result = store.addMINode(std::vector<Node*>{node});
        // 6: the store holds that node already.
        if (result.getStatus() != 0 && result.getStatus() != 6)
            MI_CONTROL::diagError(&result, "MIControl NodeStore addMInode() Failed");
    }
    return result;
}

void MIControl::deleteMI(std::vector<libstruct>& libs, std::string path,
                         std::vector<ManagementInterface*>& mis)
{
    auto record = std::find_if(libs.begin(), libs.end(),
                               [&path](libstruct const& l) { return l.path == path; });
    if (record == libs.end()) {
        MI_LOG(6000, "deleteMI: MI removal error.");
        return;
    }
    auto* const mi = static_cast<ManagementInterface*>(record->plugin);
    mi->release();
    auto listed = std::find(mis.begin(), mis.end(), mi);
    if (listed != mis.end())
        mis.erase(listed);
    else
        MI_LOG(6000, "deleteMI: MI not found in MI vector.");
    SD::PlatformUtilities::unloadLibrary(record->handle);
    libs.erase(record);
}

Error MIControl::reLoadMIs(unsigned short& counter, std::vector<libstruct>& libs,
                           std::vector<ManagementInterface*>& mis, AlertCallBack alertCB,
                           std::vector<FunctionalPlugIn*> const& fps, Number interfaceVersion,
                           Number moduleVersion, NodeStore& store, std::set<std::string>& names,
                           NodeArrivalCallBack loadCB, void const* context,
                           NodeLookupCallBack getNodeCB)
{
    MI_LOG(3000, " MIControl reLoadMIs:");
    std::vector<libstruct> gone;
    std::vector<libstruct> fresh;
    detail::scanAndMatch(SD::PlatformUtilities::getBriscaMIDir(), libs, names, MI_CONTROL::libLT,
                         gone, fresh);

    // Removed MIs are already ended; FPs get them only as identities.
    std::vector<ManagementInterface*> added;
    std::vector<ManagementInterface*> removed;
    for (libstruct const& record : gone) {
        removed.push_back(static_cast<ManagementInterface*>(record.plugin));
        deleteMI(libs, record.path, mis);
    }
    if (!fresh.empty()) {
        Error result = myloadMIs(counter, libs, mis, alertCB, fresh, interfaceVersion,
                                 moduleVersion, store, loadCB, context, getNodeCB);
        if (result.getStatus() != 0)
            return result;
        for (libstruct const& record : fresh)
            added.push_back(static_cast<ManagementInterface*>(record.plugin));
    }
    if (added.empty() && removed.empty()) {
        MI_LOG(3000, "MIControl reLoadMis End");
        return success();
    }

    unsigned int problems = 0;
    std::vector<Alert> alerts;
    for (FunctionalPlugIn* fp : fps) {
        std::vector<Node*> nodes;
        try {
            MI_LOG(3000, "reloadMIs: FP updatedMis");
            if (fp->updatedMis(added, removed).getStatus() != 0) {
                ++problems;
                continue;
            }
            MI_LOG(3000, "reloadMIs: FP getMap");
            Error result = fp->getMap(nodes);
            if (result.getStatus() != 0) {
                MI_CONTROL::diagError(&result, "MIControl FP getMap()");
                ++problems;
                continue;
            }
        } catch (std::exception const& e) {
            // A plug-in's exception must not end the reload of the others.
            MI_LOG(6000, "reloadMIs: FP Exception ", e.what(), " Type=", typeid(e).name());
            ++problems;
            continue;
        } catch (...) {
            MI_LOG(6000, "reloadMIs: FP exception caught");
            ++problems;
            continue;
        }
        std::vector<Node*> fresh;
        for (Node* node : nodes) {
            MI_LOG(3000, "reloadMIs: NodeStore::addNodeIfNew");
            bool isNew = false;
            Error result = store.addNodeIfNew(node, isNew);
            if (isNew)
                fresh.push_back(node);
            if (result.getStatus() != 0) {
                MI_CONTROL::diagError(&result, "MIControl duplicate FP nodes found");
                ++problems;
            }
        }
        for (Node* node : fresh)
            alerts.emplace_back(3, Alert::NodeArrival, std::vector<std::string>{node->getPath()},
                                node->getNodeNumber(), "MIControl");
    }
    if (!alerts.empty()) {
        MI_LOG(3000, "reloadMIs: callback Alerts");
        Error result = alertCB(alerts, nullptr);
        if (result.getStatus() != 0) {
            MI_CONTROL::diagError(&result, "MIControl Throw Load Alerts");
            ++problems;
        }
    }
    if (problems > 0)
        return Error(1, Number(problems), std::string());
    return success();
}

} // namespace IC
