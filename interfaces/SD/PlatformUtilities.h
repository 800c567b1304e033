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
    // A file or directory of the installation found the way the directories
    // above are: relative to the installed library's own directory
    // (fromLibraryDirectory, "../etc/x.conf") when it runs installed, so that
    // a moved installation keeps it; configured in the build tree, or when
    // fromLibraryDirectory is empty (a path outside the prefix).
    static std::string getInstalledPath(char const* fromLibraryDirectory, char const* configured);

    // Opens a shared library with all its symbols resolved now and kept
    // local to it (RTLD_NOW | RTLD_LOCAL). Returns null, after one log line
    // naming the file and the reason, when it cannot be opened or is not
    // trusted.
    //
    // Opening a library runs its code, so only a trusted file is opened.
    // After links are resolved, the file must be a regular file owned by
    // root or the effective user and not writable by group or others; every
    // directory from the file's own up to "/" must be owned by root or the
    // effective user and not writable by group or others, except that such a
    // directory with the sticky bit (like /tmp) is accepted when the entry
    // below it is owned by root or the effective user.
    //
    // The path is checked one component at a time, each opened relative to
    // the directory checked before it without following links. The library
    // is then loaded by its resolved path, so that the loader, debuggers and
    // $ORIGIN know it by its own name; nobody but root or the effective user
    // can have replaced it in between. It is kept only when the loader
    // mapped the inode that was checked. Not covered: the libraries it
    // depends on are found and loaded by the system loader without these
    // checks.
    //
    // IC_PLUGIN_TRUST=off (read on every call) switches the owner and
    // permission checks off for development; each load then logs a warning
    // saying so. Non-regular files are refused either way.
    //
    // While a Scan lives on the calling thread, the chain of directories
    // down to a file's own directory is walked once and reused for the next
    // files of that directory; each file is still checked on its own.
    static _LibraryHandle* loadLibrary(char const* path);

    // Scope of one pass over a plug-in directory: the directories above the
    // files are judged once, as they are when the first file is loaded, not
    // again for every file. Scopes nest; each sees only its own verdicts.
    // Not copyable; belongs to the thread that made it.
    class ICCOMMON_API Scan {
    public:
        Scan();
        ~Scan();
        Scan(Scan const&) = delete;
        Scan& operator=(Scan const&) = delete;

        struct State; // what the scan remembers; opaque

    private:
        State* state_;
        Scan* outer_;
        friend class PlatformUtilities;
    };

    // The address of a symbol of the library; null when it is missing.
    static void* loadSymbol(_LibraryHandle* handle, char* name);
    // Closes the library and frees the handle. Null is ignored.
    static void unloadLibrary(_LibraryHandle* handle);
};

} // namespace SD
