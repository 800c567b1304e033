// What every command shares: the global options, the environment they set
// for the library, the logging, and an opened library.
#pragma once

#include <IC/InstrumentationControl.h>

#include <string>

namespace ictools {

struct GlobalOptions {
    std::string miDir;     // --mi-dir, else IC_MI_DIR, else the built-in default
    std::string fpDir;     // --fp-dir, else IC_FP_DIR, else the built-in default
    std::string sysfsRoot; // --sysfs-root, else IC_SYSFS_ROOT
    bool json = false;
    int verbose = 0;
};

// Quiet by default (errors only), the library's progress with -v, all of it
// with -vv. A configuration named by HGLOG_CONFIG is kept unless -v is given.
// ownLogger, when given, logs its progress and warnings even when quiet.
void configureLogging(int verbose, std::string const& ownLogger = std::string());

// The library, opened with the options' directories; unloaded when the
// object goes. Throws UsageError for a directory that does not exist and
// OpenError when the library refuses to open.
class Library {
public:
    explicit Library(GlobalOptions const& options);
    ~Library();
    Library(Library const&) = delete;
    Library& operator=(Library const&) = delete;

    IC::InstrumentationControl& ic() { return *ic_; }

private:
    IC::InstrumentationControl* ic_ = nullptr;
};

// Meaning of a load code returned by the library's open.
std::string loadCodeText(unsigned int code);

} // namespace ictools
