#include <HGLog/HGLogger.h>

#include <log4cxx/consoleappender.h>
#include <log4cxx/helpers/fileinputstream.h>
#include <log4cxx/helpers/properties.h>
#include <log4cxx/logger.h>
#include <log4cxx/logmanager.h>
#include <log4cxx/patternlayout.h>
#include <log4cxx/propertyconfigurator.h>
#include <log4cxx/spi/loggerrepository.h>

#include <atomic>
#include <climits>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <mutex>
#include <shared_mutex>
#include <thread>
#include <unordered_map>

namespace HGLog {

namespace {

using log4cxx::LevelPtr;
using log4cxx::LoggerPtr;

char const* const kTraceRoot = "HGTrace";

// log4cxx creates its levels lazily and without synchronisation, so they
// are fetched once, under the guard of the State's construction.
struct Levels {
    LevelPtr fatal = log4cxx::Level::getFatal();
    LevelPtr error = log4cxx::Level::getError();
    LevelPtr warn = log4cxx::Level::getWarn();
    LevelPtr info = log4cxx::Level::getInfo();
    LevelPtr debug = log4cxx::Level::getDebug();
    LevelPtr trace = log4cxx::Level::getTrace();
    LevelPtr off = log4cxx::Level::getOff();

    LevelPtr const& of(int level) const
    {
        if (level >= 7000)
            return fatal;
        if (level >= HGLogger::LEVEL_ERROR)
            return error;
        if (level >= HGLogger::LEVEL_WARNING)
            return warn;
        if (level >= HGLogger::LEVEL_PROGRESS)
            return info;
        if (level >= HGLogger::LEVEL_DEBUG)
            return debug;
        return trace;
    }
};

// The log4cxx loggers of one HGLog logger name, looked up once.
struct Channels {
    LoggerPtr log;
    LoggerPtr trace;
};

class State {
public:
    State()
    {
        char const* path = std::getenv("HGLOG_CONFIG");
        if (!(path && *path && configure(path)))
            configureDefault();
    }

    bool configure(std::string const& path)
    {
        std::ifstream probe(path);
        if (!probe)
            return false;
        log4cxx::helpers::Properties props;
        try {
            props.load(std::make_shared<log4cxx::helpers::FileInputStream>(path));
        } catch (std::exception const&) {
            return false;
        }
        // The trace channel stays off and apart from the log channel's
        // appenders unless the configuration says otherwise.
        std::string const traceKey = std::string("log4j.logger.") + kTraceRoot;
        std::string const additivityKey = std::string("log4j.additivity.") + kTraceRoot;
        if (props.getProperty(traceKey).empty())
            props.setProperty(traceKey, "OFF");
        if (props.getProperty(additivityKey).empty())
            props.setProperty(additivityKey, "false");
        std::lock_guard<std::mutex> g(configLock_);
        log4cxx::LogManager::resetConfiguration();
        log4cxx::PropertyConfigurator::configure(props);
        log4cxx::LogManager::getLoggerRepository()->setConfigured(true);
        recomputeThreshold();
        return true;
    }

    void configureDefault()
    {
        std::lock_guard<std::mutex> g(configLock_);
        log4cxx::LogManager::resetConfiguration();
        auto layout = std::make_shared<log4cxx::PatternLayout>("%d{ISO8601} %-5p %c %M: %m%n");
        auto appender = std::make_shared<log4cxx::ConsoleAppender>(
            layout, log4cxx::ConsoleAppender::getSystemErr());
        LoggerPtr root = log4cxx::Logger::getRootLogger();
        root->addAppender(appender);
        root->setLevel(levels_.warn);
        LoggerPtr trace = log4cxx::Logger::getLogger(kTraceRoot);
        trace->setLevel(levels_.off);
        trace->setAdditivity(false);
        log4cxx::LogManager::getLoggerRepository()->setConfigured(true);
        recomputeThreshold();
    }

    // True when the event could reach a channel; cheap below the lowest
    // level that any logger is configured with.
    bool enabled(std::string const& logger, int level)
    {
        LevelPtr const& l = levels_.of(level);
        if (l->toInt() < threshold_.load(std::memory_order_relaxed))
            return false;
        Channels const c = channels(logger);
        return c.log->isEnabledFor(l) || c.trace->isEnabledFor(l);
    }

    Channels channels(std::string const& logger)
    {
        {
            std::shared_lock<std::shared_mutex> g(cacheLock_);
            auto it = cache_.find(logger);
            if (it != cache_.end())
                return it->second;
        }
        Channels c{log4cxx::Logger::getLogger(logger),
                   log4cxx::Logger::getLogger(std::string(kTraceRoot) + "." + logger)};
        std::unique_lock<std::shared_mutex> g(cacheLock_);
        return cache_.emplace(logger, c).first->second;
    }

    void emit(Channel channel, char const* function, char const* file, int line,
              std::string const& logger, int level, std::string const& message)
    {
        if (hasListener_.load(std::memory_order_acquire)) {
            std::shared_ptr<Listener const> const l = std::atomic_load(&listener_);
            if (l && *l)
                (*l)(Record{channel, function ? function : "", file ? file : "", line, logger,
                            level, message});
        }
        LevelPtr const& l = levels_.of(level);
        if (l->toInt() < threshold_.load(std::memory_order_relaxed))
            return;
        Channels const c = channels(logger);
        LoggerPtr const& target = channel == Channel::Log ? c.log : c.trace;
        if (!target->isEnabledFor(l))
            return;
        char const* const f = file ? file : "";
        target->forcedLog(l, message,
                          log4cxx::spi::LocationInfo(f, f, function ? function : "", line));
    }

    void setListener(Listener listener)
    {
        std::shared_ptr<Listener const> next;
        if (listener)
            next = std::make_shared<Listener const>(std::move(listener));
        hasListener_.store(static_cast<bool>(next), std::memory_order_release);
        std::shared_ptr<Listener const> const previous = std::atomic_exchange(&listener_, next);
        // Whoever set the old listener may destroy what it captured once this
        // returns: wait for the calls still running it. No new call can take
        // it after the exchange, so its count only falls.
        while (previous && previous.use_count() > 1)
            std::this_thread::yield();
    }

    bool hasListener() const { return hasListener_.load(std::memory_order_acquire); }

private:
    // The lowest level any logger is configured with; nothing below it can
    // be enabled.
    void recomputeThreshold()
    {
        int lowest = INT_MAX;
        auto consider = [&lowest](LoggerPtr const& logger) {
            LevelPtr const l = logger->getLevel();
            if (l && l->toInt() < lowest)
                lowest = l->toInt();
        };
        consider(log4cxx::Logger::getRootLogger());
        for (LoggerPtr const& logger : log4cxx::LogManager::getCurrentLoggers())
            consider(logger);
        threshold_.store(lowest, std::memory_order_relaxed);
    }

    Levels const levels_;
    std::mutex configLock_;
    std::atomic<int> threshold_{INT_MAX};
    std::shared_mutex cacheLock_;
    std::unordered_map<std::string, Channels> cache_;
    std::atomic<bool> hasListener_{false};
    std::shared_ptr<Listener const> listener_;
};

State& state()
{
    static State s;
    return s;
}

} // namespace

void HGLogger::logLevelMessage(char const* function, char const* file, int line,
                               std::string const& logger, int level, char*, int, int,
                               std::string const& message)
{
    state().emit(Channel::Log, function, file, line, logger, level, message);
}

void HGLogger::traceLevelMessage(char const* function, char const* file, int line,
                                 std::string const& logger, int level, char*, int, int,
                                 std::string const& message)
{
    state().emit(Channel::Trace, function, file, line, logger, level, message);
}

bool HGLogger::isEnabled(std::string const& logger, int level)
{
    State& s = state();
    return s.hasListener() || s.enabled(logger, level);
}

void HGLogger::setListener(Listener listener)
{
    state().setListener(std::move(listener));
}

bool HGLogger::configure(std::string const& propertiesFile)
{
    return state().configure(propertiesFile);
}

void HGLogger::configureDefault()
{
    state().configureDefault();
}

} // namespace HGLog
