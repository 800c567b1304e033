// Plug-in discovery: IC::LoadControl::findLibs opens every shared library of
// a directory and records it in an IC::libstruct.
#pragma once

#include <IC/Error.h>
#include <IC/Export.h>
#include <SD/PlatformUtilities.h>

#include <set>
#include <string>
#include <vector>

namespace IC {

// One discovered plug-in library.
struct IC_API libstruct {
    // Never null in a record that discovery made.
    SD::_LibraryHandle* handle = nullptr;
    // The directory, one separator and the file name.
    std::string path;
    // The bare file name: a library's identity across scans.
    std::string name;
    // The plug-in object once loaded: an IC::ManagementInterface* in an MI
    // record, an IC::FunctionalPlugIn* in an FP record; unset before.
    void* plugin = nullptr;
    // The plug-in's load number in the upper 16 bits once loaded; 0 before.
    unsigned int idbase = 0;
};

class IC_API LoadControl {
public:
    // Appends a record for every library of dir (files ending in ".so")
    // that can be opened, in the directory's order. names is not used.
    // Always success; failures are logged.
    Error findLibs(std::string dir, std::vector<libstruct>& libs, std::set<std::string>& names);
};

} // namespace IC
