// What loading and reloading share between both plug-in kinds: the scan of
// a directory matched against the loaded libraries, and the load loop.
#pragma once

#include <IC/LoadControl.h>
#include <SD/PlatformUtilities.h>

#include <algorithm>
#include <exception>
#include <set>
#include <string>
#include <vector>

namespace IC {
namespace detail {

// On return, loaded holds the loaded records whose file disappeared and
// fresh the scanned records that are new; every other scanned library is
// closed again (the loaded instance keeps its own handle).
template <class Less>
void scanAndMatch(std::string const& dir, std::vector<libstruct> const& libs,
                  std::set<std::string>& names, Less less, std::vector<libstruct>& loaded,
                  std::vector<libstruct>& fresh)
{
    loaded = libs;
    LoadControl().findLibs(dir, fresh, names);
    std::sort(fresh.begin(), fresh.end(), less);
    std::sort(loaded.begin(), loaded.end(), less);
    for (auto n = fresh.begin(); n != fresh.end();) {
        auto o = std::find_if(loaded.begin(), loaded.end(),
                              [&n](libstruct const& l) { return l.name == n->name; });
        if (o == loaded.end()) {
            ++n;
            continue;
        }
        loaded.erase(o);
        SD::PlatformUtilities::unloadLibrary(n->handle);
        n = fresh.erase(n);
    }
}

// Loads every record of toLoad with loadOne(record), which says whether it
// succeeded. A record that fails or throws (thrown(record, exception), with
// null for anything not derived from std::exception, reports it) is closed
// and dropped from toLoad; the object its library handed out, if any, is
// abandoned with it. Returns how many failed.
template <class LoadOne, class Thrown>
unsigned int loadEach(std::vector<libstruct>& toLoad, LoadOne loadOne, Thrown thrown)
{
    unsigned int failed = 0;
    for (auto it = toLoad.begin(); it != toLoad.end();) {
        bool loaded = false;
        try {
            loaded = loadOne(*it);
        } catch (std::exception const& e) {
            thrown(*it, &e);
        } catch (...) {
            thrown(*it, nullptr);
        }
        if (loaded) {
            ++it;
            continue;
        }
        SD::PlatformUtilities::unloadLibrary(it->handle);
        it = toLoad.erase(it);
        ++failed;
    }
    return failed;
}

} // namespace detail
} // namespace IC
