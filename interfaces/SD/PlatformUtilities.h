// SD::PlatformUtilities: path conventions, the installation's directories and
// the dynamic loader.
#pragma once

#include <IC/CommonExport.h>

#include <string>

namespace SD {

// Opaque handle of an opened shared library.
struct _LibraryHandle;

class ICCOMMON_API PlatformUtilities {
public:
    // The path separator, '/'.
    static char getSeparator();

    // Read on every call from IC_DATA_DIR, IC_MI_DIR and IC_FP_DIR; when a
    // variable is unset or empty, the directory chosen at install time.
    static std::string getBriscaDataDir();
    static std::string getBriscaMIDir();
    static std::string getBriscaFPDir();

    // Opens a shared library with all its symbols resolved now and kept
    // local to it. Only regular files (or links to them) are opened. Returns
    // null, after one log line naming the file and the reason, when it
    // cannot be opened.
    static _LibraryHandle* loadLibrary(char const* path);
    // The address of a symbol of the library; null when it is missing.
    static void* loadSymbol(_LibraryHandle* handle, char* name);
    // Closes the library and frees the handle. Null is ignored.
    static void unloadLibrary(_LibraryHandle* handle);
};

} // namespace SD
