// IC::AlertStore: the alerts currently asserted, one per node path.
//
// A batch raised by a functional plug-in (type 0) updates the store: an
// alert of status 1 clears the entry of each of its paths, any other status
// replaces it. Batches of management interfaces (type 1) leave it alone.
// Safe to use from several threads.
#pragma once

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/Export.h>
#include <SD/Mutex.h>

#include <map>
#include <string>
#include <vector>

namespace IC {

class IC_API AlertStore {
public:
    AlertStore();
    ~AlertStore();
    AlertStore(AlertStore const&) = delete;
    AlertStore& operator=(AlertStore const&) = delete;

    // Applies a batch of the given alert type (IC::MyAlertType); always
    // success.
    Error newAlerts(std::vector<Alert> const& alerts, unsigned int type);
    // out := every stored alert, by ascending node path (an alert stored
    // under two paths comes twice); always success.
    Error getAsserted(std::vector<Alert>& out);
    void clear();

private:
    std::map<std::string, Alert> asserted;
    mutable SD::Mutex lock;
};

namespace ALERT_STORE {
// Lower-case hexadecimal of a binary path, for logs.
IC_API std::string hexstring(std::string s);
} // namespace ALERT_STORE

} // namespace IC
