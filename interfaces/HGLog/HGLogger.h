// HGLog::HGLogger: two-channel logging (log and trace) over Apache log4cxx.
//
// Logger names are hierarchical, dot-separated ("Helmgard.IC.NodeStore").
// Levels are integers: 6000 and above error, 4000 warning, 3000 progress,
// below 3000 debug. Configuration comes from the log4cxx properties file named
// by the environment variable HGLOG_CONFIG; without it, warnings and errors of
// the log channel go to standard error and the trace channel is off.
// The trace channel is the logger hierarchy below "HGTrace": an event of
// logger "A.B" on the trace channel goes to the log4cxx logger "HGTrace.A.B",
// so a configuration selects it separately ("log4j.logger.HGTrace=...").
//
// Every operation is thread-safe.
#pragma once

#include <IC/CommonExport.h>
#include <HGLog/HGMessageBuffer.h>

#include <functional>
#include <string>

namespace HGLog {

enum class Channel { Log, Trace };

// One event as a listener sees it.
struct Record {
    Channel channel;
    std::string function;
    std::string file;
    int line;
    std::string logger;
    int level;
    std::string message;
};

using Listener = std::function<void(Record const&)>;

class ICCOMMON_API HGLogger {
public:
    static constexpr int LEVEL_DEBUG = 2000;
    static constexpr int LEVEL_PROGRESS = 3000;
    static constexpr int LEVEL_WARNING = 4000;
    static constexpr int LEVEL_ERROR = 6000;

    // Emits the message to the named logger of the log channel. extra,
    // extra1 and extra2 are reserved and ignored.
    static void logLevelMessage(char const* function, char const* file, int line,
                                std::string const& logger, int level, char* extra,
                                int extra1, int extra2, std::string const& message);
    // The same event on the trace channel.
    static void traceLevelMessage(char const* function, char const* file, int line,
                                  std::string const& logger, int level, char* extra,
                                  int extra1, int extra2, std::string const& message);

    // True when an event of this logger and level would reach a channel or a
    // listener. Cheap when nothing below the warning level is configured.
    static bool isEnabled(std::string const& logger, int level);

    // While a listener is set, every event of both channels reaches it,
    // whatever the configured levels. An empty function removes it. The
    // listener is called on the logging thread and must not set a listener.
    // Returns once no thread runs the replaced listener any more, so that
    // its owner may go.
    static void setListener(Listener listener);

    // Replaces the configuration with a log4cxx properties file. Returns false
    // (and keeps the quiet default) when the file cannot be read.
    static bool configure(std::string const& propertiesFile);
    // Back to the quiet default.
    static void configureDefault();
};

// Composes one message from its parts and sends it to both channels, with
// nothing composed when neither a channel nor a listener would take it.
template <class... Parts>
void logEvent(char const* function, char const* file, int line, std::string const& logger,
              int level, Parts const&... parts)
{
    if (!HGLogger::isEnabled(logger, level))
        return;
    HGMessageBuffer buf;
    ((void)(buf << parts), ...);
    std::string const message = buf.str(buf);
    HGLogger::logLevelMessage(function, file, line, logger, level, nullptr, 0, 0, message);
    HGLogger::traceLevelMessage(function, file, line, logger, level, nullptr, 0, 0, message);
}

} // namespace HGLog

// One log event from the enclosing function: HGLOG_EVENT(source, logger,
// level, parts...). A module usually wraps it in a macro of its own that fixes
// source and logger.
#define HGLOG_EVENT(source, logger, level, ...) \
    ::HGLog::logEvent(__func__, source, __LINE__, logger, level, __VA_ARGS__)
