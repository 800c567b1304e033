#include "Session.h"

#include "Errors.h"

#include <HGLog/HGLogger.h>
#include <SD/PlatformUtilities.h>

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <system_error>

namespace ictools {
namespace {

namespace fs = std::filesystem;

char const* env(char const* name)
{
    char const* v = std::getenv(name);
    return v && *v ? v : nullptr;
}

// Checks that the directory the library will use exists. option is the
// command-line value, variable the environment variable it sets.
void checkDirectory(std::string const& what, std::string const& dir, std::string const& option,
                    char const* variable, bool fromOption)
{
    std::string const source =
        fromOption ? "from " + option
                   : (env(variable) ? std::string("from ") + variable
                                    : "the built-in default; use " + option + " or " + variable);
    std::error_code ec;
    if (!fs::exists(dir, ec))
        throw UsageError(what + " directory '" + dir + "' does not exist (" + source + ")");
    if (!fs::is_directory(dir, ec))
        throw UsageError(what + " directory '" + dir + "' is not a directory (" + source + ")");
}

void setDirectory(std::string const& value, char const* variable)
{
    if (value.empty())
        return;
    // Absolute, so that the library's log lines name the real place.
    std::error_code ec;
    fs::path const full = fs::absolute(value, ec);
    setenv(variable, ec ? value.c_str() : full.c_str(), 1);
}

} // namespace

void configureLogging(int verbose, std::string const& ownLogger)
{
    if (verbose == 0 && env("HGLOG_CONFIG"))
        return;
    // The library warns about every asserted alert it stores; on a terminal
    // only errors are worth showing unless asked.
    char const* level = verbose >= 2 ? "ALL" : verbose == 1 ? "INFO" : "ERROR";
    std::string const config = std::string("log4j.rootLogger=") + (verbose ? "WARN" : "ERROR") +
                               ", err\n"
                               "log4j.logger.Helmgard=" + level + "\n" +
                               (ownLogger.empty() || verbose >= 2
                                    ? std::string()
                                    : "log4j.logger." + ownLogger + "=INFO\n") +
                               "log4j.appender.err=org.apache.log4j.ConsoleAppender\n"
                               "log4j.appender.err.Target=System.err\n"
                               "log4j.appender.err.layout=org.apache.log4j.PatternLayout\n"
                               "log4j.appender.err.layout.ConversionPattern="
                               "%d{HH:mm:ss.SSS} %-5p %c: %m%n\n";
    char name[] = "/tmp/ic-log-XXXXXX";
    int const fd = mkstemp(name);
    if (fd < 0)
        return; // logging stays as it was; nothing else depends on it
    close(fd);
    {
        std::ofstream out(name);
        out << config;
    }
    HGLog::HGLogger::configure(name);
    unlink(name);
}

Library::Library(GlobalOptions const& options)
{
    setDirectory(options.miDir, "IC_MI_DIR");
    setDirectory(options.fpDir, "IC_FP_DIR");
    setDirectory(options.sysfsRoot, "IC_SYSFS_ROOT");
    checkDirectory("management-interface", SD::PlatformUtilities::getBriscaMIDir(), "--mi-dir",
                   "IC_MI_DIR", !options.miDir.empty());
    checkDirectory("functional plug-in", SD::PlatformUtilities::getBriscaFPDir(), "--fp-dir",
                   "IC_FP_DIR", !options.fpDir.empty());
    if (char const* root = env("IC_SYSFS_ROOT")) {
        std::error_code ec;
        if (!fs::is_directory(root, ec))
            throw UsageError(std::string("sysfs root '") + root + "' is not a directory (from " +
                             (options.sysfsRoot.empty() ? "IC_SYSFS_ROOT" : "--sysfs-root") +
                             ")");
    }

    IC::Error* err = nullptr;
    unsigned char const code = Open(&ic_, &err);
    if (code != 0 || !ic_) {
        // A failed open has undone itself; the unload below is harmless.
        Unloadlib();
        throw OpenError("cannot open the library: load code " +
                        std::to_string(static_cast<unsigned int>(code)) + " (" +
                        loadCodeText(code) + ")");
    }
}

Library::~Library()
{
    Unloadlib();
}

std::string loadCodeText(unsigned int code)
{
    switch (code) {
    case 0: return "success";
    case 15: return "management interfaces failed to load";
    case 31: return "functional plug-ins failed to load";
    default: return "unknown load code";
    }
}

} // namespace ictools
