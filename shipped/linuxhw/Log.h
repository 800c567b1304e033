// The plug-in's logger and its levels.
#pragma once

#include <HGLog/HGLogger.h>

#include <string>

namespace linuxhw {

inline std::string const& logger()
{
    static std::string const name = "Helmgard.Plugins.LinuxHW";
    return name;
}

constexpr int kProgress = HGLog::HGLogger::LEVEL_PROGRESS;
constexpr int kWarning = HGLog::HGLogger::LEVEL_WARNING;
constexpr int kError = HGLog::HGLogger::LEVEL_ERROR;

} // namespace linuxhw

#define LHW_LOG(level, ...) HGLOG_EVENT("linuxhw", ::linuxhw::logger(), level, __VA_ARGS__)
