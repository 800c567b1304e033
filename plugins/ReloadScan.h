// The first half of a reload, shared by both plug-in kinds: scan the
// directory and match the scan against the loaded libraries by file name.
#pragma once

#include <IC/LoadControl.h>
#include <SD/PlatformUtilities.h>

#include <algorithm>
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

} // namespace detail
} // namespace IC
