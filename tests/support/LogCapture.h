// A log listener for tests: records every event of both channels while it
// lives, so that tests can assert on what was logged.
#pragma once

#include <HGLog/HGLogger.h>

#include <algorithm>
#include <mutex>
#include <string>
#include <vector>

namespace ictest {

class LogCapture {
public:
    LogCapture()
    {
        HGLog::HGLogger::setListener([this](HGLog::Record const& r) {
            std::lock_guard<std::mutex> g(m_);
            records_.push_back(r);
        });
    }
    ~LogCapture() { HGLog::HGLogger::setListener(HGLog::Listener()); }
    LogCapture(LogCapture const&) = delete;
    LogCapture& operator=(LogCapture const&) = delete;

    std::vector<HGLog::Record> records() const
    {
        std::lock_guard<std::mutex> g(m_);
        return records_;
    }
    // Events of the log channel only (every event is also on the trace one);
    // of one logger when one is named.
    std::vector<HGLog::Record> logs(std::string const& logger = std::string()) const
    {
        std::vector<HGLog::Record> out;
        for (auto const& r : records())
            if (r.channel == HGLog::Channel::Log && (logger.empty() || r.logger == logger))
                out.push_back(r);
        return out;
    }
    std::vector<std::string> messages(std::string const& logger = std::string()) const
    {
        std::vector<std::string> out;
        for (auto const& r : logs(logger))
            out.push_back(r.message);
        return out;
    }
    // Number of log-channel events whose message equals text.
    std::size_t count(std::string const& text) const
    {
        auto const m = messages();
        return static_cast<std::size_t>(std::count(m.begin(), m.end(), text));
    }
    // The same for one logger and level.
    std::size_t count(std::string const& logger, int level, std::string const& text) const
    {
        std::size_t n = 0;
        for (auto const& r : logs(logger))
            n += r.level == level && r.message == text;
        return n;
    }
    void clear()
    {
        std::lock_guard<std::mutex> g(m_);
        records_.clear();
    }

private:
    mutable std::mutex m_;
    std::vector<HGLog::Record> records_;
};

} // namespace ictest
