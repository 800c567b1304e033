// For the soak and re-entry tests: keeps the library's output off standard
// error (the plug-ins' alerts are logged as warnings, thousands of them) and
// records what it logs as an error instead.
#pragma once

#include <HGLog/HGLogger.h>

#include <cstdio>
#include <fstream>
#include <mutex>
#include <string>
#include <vector>

#include <unistd.h>

namespace soak {

class ErrorLog {
public:
    ErrorLog() : file_("/tmp/ic-soak-" + std::to_string(getpid()) + ".properties")
    {
        std::ofstream(file_) << "log4j.rootLogger=OFF\n";
        HGLog::HGLogger::configure(file_);
        std::remove(file_.c_str());
        HGLog::HGLogger::setListener([this](HGLog::Record const& r) {
            if (r.channel != HGLog::Channel::Log || r.level < HGLog::HGLogger::LEVEL_ERROR)
                return;
            std::lock_guard<std::mutex> g(m_);
            if (errors_.size() < 10)
                errors_.push_back(r.logger + ": " + r.message);
            ++count_;
        });
    }
    ~ErrorLog()
    {
        HGLog::HGLogger::setListener(HGLog::Listener());
        HGLog::HGLogger::configureDefault();
    }
    ErrorLog(ErrorLog const&) = delete;
    ErrorLog& operator=(ErrorLog const&) = delete;

    unsigned long count() const
    {
        std::lock_guard<std::mutex> g(m_);
        return count_;
    }
    std::vector<std::string> first() const
    {
        std::lock_guard<std::mutex> g(m_);
        return errors_;
    }

private:
    std::string file_;
    mutable std::mutex m_;
    std::vector<std::string> errors_;
    unsigned long count_ = 0;
};

} // namespace soak
