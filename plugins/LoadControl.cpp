#include <IC/LoadControl.h>

#include <HGLog/HGLogger.h>
#include <SD/DirectoryReader.h>

#include <cstdint>
#include <exception>
#include <typeinfo>

namespace IC {
namespace LOAD_CONTROL {

// Private to the library. Discovery logs directly under "Helmgard.IC", not
// under the library's own logger; configurations select by these names.
std::string loggerLoadControl = "Helmgard.IC.LoadControl";

} // namespace LOAD_CONTROL

#define LC_LOG(level, ...) \
    HGLOG_EVENT("LoadControl", LOAD_CONTROL::loggerLoadControl, level, __VA_ARGS__)

Error LoadControl::findLibs(std::string dir, std::vector<libstruct>& libs, std::set<std::string>&)
{
    LC_LOG(3000, "findLibs: Looking for directory ", dir);
    auto const dirLength = static_cast<std::uint16_t>(dir.size());
    SD::DirectoryReader reader(dir.c_str(), ".so");
    int const count = reader.getNumberOfFiles();
    // The directories above the plug-ins are judged once per pass.
    SD::PlatformUtilities::Scan const scan;
    for (int i = 0; i < count; ++i) {
        char const* const entry = reader.getFileName(i);
        std::string const path = entry ? entry : "";
        // The reader writes directory, one separator, name.
        std::string const name = path.size() > dirLength ? path.substr(dirLength + 1u) : path;
        try {
            SD::_LibraryHandle* const handle = SD::PlatformUtilities::loadLibrary(path.c_str());
            if (handle) {
                libstruct record;
                record.handle = handle;
                record.path = path;
                record.name = name;
                libs.push_back(record);
            }
            LC_LOG(3000, "findLibs: Opened Lib Opened with filehandle ", handle, " for file ", path);
        } catch (std::exception const& e) {
            LC_LOG(6000, "findLibs: Load Exception ", e.what(), " Type=", typeid(e).name(), " for ",
                   path);
        } catch (...) {
            LC_LOG(6000, "findLibs: Load failed for ", path);
        }
    }
    return Error(0, Number(Number::Generic), std::string());
}

} // namespace IC
