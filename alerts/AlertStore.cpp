#include <IC/AlertStore.h>

#include <HGLog/HGLogger.h>

#include "../frame/HexText.h"

namespace IC {
namespace ALERT_STORE {

// Private to the library.
std::string loggerAlertStore = "Helmgard.IC.InstrumentationControl.AlertStore";

std::string hexstring(std::string s)
{
    return detail::hexText(s);
}

} // namespace ALERT_STORE

#define AS_LOG(level, ...) \
    HGLOG_EVENT("AlertStore", ALERT_STORE::loggerAlertStore, level, __VA_ARGS__)

namespace {
Error done()
{
    return Error(0, Number(Number::Generic), std::string());
}
} // namespace

AlertStore::AlertStore() = default;
AlertStore::~AlertStore() = default;

Error AlertStore::newAlerts(std::vector<Alert> const& alerts, unsigned int type)
{
    // Management-interface batches are not recorded.
    if (type != 0)
        return done();
    SD::MutexGuard guard(lock);
    for (Alert const& alert : alerts) {
        for (std::string const& path : alert.nodePaths()) {
            asserted.erase(path);
            if (alert.getStatus() != 1) {
                AS_LOG(4000, "newAlerts: Abnormal Status ", alert.getStatus(), "path =",
                       ALERT_STORE::hexstring(path));
                asserted.emplace(path, alert);
            }
        }
    }
    return done();
}

Error AlertStore::getAsserted(std::vector<Alert>& out)
{
    SD::MutexGuard guard(lock);
    out.clear();
    out.reserve(asserted.size());
    for (auto const& entry : asserted)
        out.push_back(entry.second);
    return done();
}

void AlertStore::clear()
{
    SD::MutexGuard guard(lock);
    asserted.clear();
}

} // namespace IC
