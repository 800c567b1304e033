#include <SD/PlatformUtilities.h>

#include <HGLog/HGLogger.h>

#include <cerrno>
#include <cstdlib>
#include <new>
#include <system_error>

#include <dlfcn.h>
#include <sys/stat.h>

namespace {

std::string const sdLogger = "Helmgard.SD.PlatformUtilities";

} // namespace

#define SD_LOG(level, ...) HGLOG_EVENT("PlatformUtilities", sdLogger, level, __VA_ARGS__)

namespace SD {

struct _LibraryHandle {
    void* library;
    std::string path;
};

namespace {

constexpr int LEVEL_FAILURE = 6000;
constexpr int LEVEL_PROGRESS = 3000;

// An installation can be relocated without rebuilding: the environment wins
// when it says something, and is consulted on every call so that a host may
// change it while running.
std::string fromEnvironment(char const* variable, char const* fallback)
{
    char const* value = std::getenv(variable);
    return (value != nullptr && *value != '\0') ? std::string(value) : std::string(fallback);
}

} // namespace

char PlatformUtilities::getSeparator()
{
    return '/';
}

std::string PlatformUtilities::getBriscaDataDir()
{
    return fromEnvironment("IC_DATA_DIR", IC_DEFAULT_DATA_DIR);
}

std::string PlatformUtilities::getBriscaMIDir()
{
    return fromEnvironment("IC_MI_DIR", IC_DEFAULT_MI_DIR);
}

std::string PlatformUtilities::getBriscaFPDir()
{
    return fromEnvironment("IC_FP_DIR", IC_DEFAULT_FP_DIR);
}

_LibraryHandle* PlatformUtilities::loadLibrary(char const* path)
{
    if (path == nullptr) {
        SD_LOG(LEVEL_FAILURE, "Cannot load a library: no path given");
        return nullptr;
    }
    // Only regular files reach the loader: opening a FIFO would block, and a
    // directory or device is never a library. stat() follows links, so a link
    // to a library is accepted and a dangling one is not.
    struct stat st {};
    if (stat(path, &st) != 0) {
        int const error = errno;
        SD_LOG(LEVEL_FAILURE, "Cannot load library ", path, ": ",
               std::system_category().message(error));
        return nullptr;
    }
    if (!S_ISREG(st.st_mode)) {
        SD_LOG(LEVEL_FAILURE, "Cannot load library ", path, ": not a regular file");
        return nullptr;
    }
    dlerror();
    // RTLD_NOW: an unresolved symbol shows now, not as a crash at first call.
    // RTLD_LOCAL: plug-ins export the same names and must not see each other's.
    void* library = dlopen(path, RTLD_NOW | RTLD_LOCAL);
    if (library == nullptr) {
        char const* reason = dlerror();
        SD_LOG(LEVEL_FAILURE, "Cannot load library ", path, ": ",
               reason ? reason : "unknown loader error");
        return nullptr;
    }
    try {
        return new _LibraryHandle{library, path};
    } catch (std::bad_alloc const&) {
        dlclose(library);
        SD_LOG(LEVEL_FAILURE, "Cannot load library ", path, ": out of memory");
        return nullptr;
    }
}

void* PlatformUtilities::loadSymbol(_LibraryHandle* handle, char* name)
{
    if (handle == nullptr || handle->library == nullptr || name == nullptr)
        return nullptr;
    dlerror();
    void* symbol = dlsym(handle->library, name);
    if (symbol == nullptr) {
        char const* reason = dlerror();
        SD_LOG(LEVEL_PROGRESS, "No symbol ", static_cast<char const*>(name), " in ",
               handle->path, ": ", reason ? reason : "null address");
    }
    return symbol;
}

void PlatformUtilities::unloadLibrary(_LibraryHandle* handle)
{
    if (handle == nullptr)
        return;
    if (handle->library != nullptr)
        dlclose(handle->library);
    delete handle;
}

} // namespace SD
