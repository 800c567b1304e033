#include <IC/FPControl.h>

#include <HGLog/HGLogger.h>
#include <SD/PlatformUtilities.h>

#include "../frame/DiagError.h"
#include "ReloadScan.h"

#include <algorithm>
#include <exception>
#include <typeinfo>

namespace IC {
namespace FP_CONTROL {

int fppfx = 1;

// Private to the library.
std::string loggerFPControl = "Helmgard.IC.InstrumentationControl.FPControl";

} // namespace FP_CONTROL

#define FP_LOG(level, ...) \
    HGLOG_EVENT("FPControl", FP_CONTROL::loggerFPControl, level, __VA_ARGS__)

namespace FP_CONTROL {

bool libLT(libstruct a, libstruct b)
{
    // std::string compares its bytes as unsigned characters, shorter first
    // on a common prefix.
    return a.name < b.name;
}

void diagError(Error* error, std::string context)
{
    detail::reportError("FPControl", loggerFPControl, error, context);
}

} // namespace FP_CONTROL

// The steps of one library are logged as the loader's own.
#define FP_LOG_LOAD(level, ...) \
    HGLog::logEvent("myloadFPs", "FPControl", __LINE__, FP_CONTROL::loggerFPControl, level, __VA_ARGS__)

namespace {

Error success()
{
    return Error(0, Number(Number::Generic), std::string());
}

// Steps of loading one FP library; false when the record failed.
bool loadOne(libstruct& record, unsigned short& counter, std::vector<libstruct>& libs,
             std::vector<FunctionalPlugIn*>& fps, ICforFP const& services)
{
    char symbol[] = "OpenFP";
    auto const open =
        reinterpret_cast<OpenFPFunction>(SD::PlatformUtilities::loadSymbol(record.handle, symbol));
    if (!open) {
        FP_LOG_LOAD(6000, "myloadFPs: ", record.path, " OpenFP not found");
        return false;
    }
    FunctionalPlugIn* fp = nullptr;
    Error* err = nullptr;
    unsigned char const code = open(&fp, &err);
    if (code != 0) {
        FP_LOG_LOAD(6000, "myloadFPs: ", record.path, " OpenFP failed, code=", code);
        return false;
    }
    if (!err) {
        FP_LOG_LOAD(6000, "myloadFPs: ", record.path, " Pointer to Error is NULL");
        return false;
    }
    if (err->getStatus() != 0) {
        FP_CONTROL::diagError(err, "OpenFP()");
        return false;
    }
    if (!fp) {
        FP_LOG_LOAD(6000, "myloadFPs: ", record.path, " OpenFP pointer is NULL");
        return false;
    }
    unsigned int const base = static_cast<unsigned int>(counter) << 16;
    FP_LOG_LOAD(3000, "myloadFPs: ", record.path, " Initialize");
    Error result = fp->Initialize(base, services);
    FP_LOG_LOAD(3000, "myloadFPs: ", record.path, " Initialize Done");
    if (result.getStatus() != 0) {
        FP_CONTROL::diagError(&result, "FP Initialize()");
        return false;
    }
    fps.push_back(fp);
    record.plugin = fp;
    record.idbase = base;
    libs.push_back(record);
    ++counter;
    return true;
}

} // namespace

Error FPControl::myloadFPs(unsigned short& counter, std::vector<libstruct>& libs,
                           std::vector<FunctionalPlugIn*>& fps, NodeStore&,
                           ICforFP const& services, std::vector<libstruct>& toLoad)
{
    unsigned int const failed = detail::loadEach(
        toLoad, [&](libstruct& record) { return loadOne(record, counter, libs, fps, services); },
        [](libstruct const& record, std::exception const* e) {
            if (e)
                FP_LOG_LOAD(6000, "myloadFPs: Exception ", e->what(), " Type=", typeid(*e).name(),
                            " for ", record.path);
            else
                FP_LOG_LOAD(6000, "myloadFPs Caught exception for ", record.path);
        });
    if (failed == 0)
        return success();
    FP_LOG(6000, "myloadFPs count of FPs that did not load ", failed);
    if (!fps.empty())
        return Error(0, Number(failed), "Count of FPs that did not load");
    return Error(1, Number(failed), "No FPs were loaded");
}

void FPControl::deleteFP(std::vector<libstruct>& libs, std::string path,
                         std::vector<FunctionalPlugIn*>& fps)
{
    auto record = std::find_if(libs.begin(), libs.end(),
                               [&path](libstruct const& l) { return l.path == path; });
    if (record == libs.end()) {
        FP_LOG(6000, "deleteFP: FP not found in FP vector");
        return;
    }
    auto* const fp = static_cast<FunctionalPlugIn*>(record->plugin);
    fp->release();
    auto listed = std::find(fps.begin(), fps.end(), fp);
    bool const wasListed = listed != fps.end();
    if (wasListed)
        fps.erase(listed);
    SD::PlatformUtilities::unloadLibrary(record->handle);
    libs.erase(record);
    if (!wasListed)
        FP_LOG(6000, "deleteFP: FP not found in FP vector");
}

Error FPControl::reLoadFPs(unsigned short& counter, std::vector<libstruct>& libs,
                           std::vector<FunctionalPlugIn*>& fps, NodeStore& store,
                           ICforFP const& services, AlertSink const& alertCB,
                           std::set<std::string>& names)
{
    FP_LOG(3000, " reLoadFPs:");
    std::vector<libstruct> gone;
    std::vector<libstruct> fresh;
    detail::scanAndMatch(SD::PlatformUtilities::getBriscaFPDir(), libs, names, FP_CONTROL::libLT,
                         gone, fresh);
    for (libstruct const& record : gone)
        deleteFP(libs, record.path, fps);
    if (fresh.empty()) {
        FP_LOG(3000, " reloadFPs: Done - no additions");
        return success();
    }

    // The loader fills no store of its own, so this step finds no node; it
    // is where FP nodes would be announced.
    NodeStore loadedNodes;
    Error result = myloadFPs(counter, libs, fps, loadedNodes, services, fresh);
    std::vector<Alert> alerts;
    if (result.getStatus() == 0 && !fresh.empty()) {
        FP_LOG(3000, "reloadFPs: NodeStore::getMap");
        std::vector<Node*> nodes;
        if (loadedNodes.getMap(nodes).getStatus() == 0) {
            for (Node* node : nodes) {
                FP_LOG(3000, "reloadFPs: NodeStore::addNodeIfNew");
                bool isNew = false;
                Error added = store.addNodeIfNew(node, isNew);
                if (added.getStatus() != 0)
                    FP_CONTROL::diagError(&added, "FPControl addNodeIfNew() Error");
                if (isNew)
                    alerts.emplace_back(0, Alert::NodeArrival,
                                        std::vector<std::string>{node->getPath()},
                                        node->getNodeNumber(), "FPControl");
            }
        }
    }
    if (!alerts.empty()) {
        FP_LOG(3000, "reloadFPs: callback alerts");
        result = alertCB(alerts);
    }
    FP_LOG(3000, " reloadFPs: Done adding FPs");
    return result;
}

} // namespace IC
