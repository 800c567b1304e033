// The plug-in's logger and its levels.
#pragma once

#include <HGLog/HGLogger.h>

#include <string>

namespace ipmi {

inline std::string const& logger()
{
    static std::string const name = "Helmgard.Plugins.IPMI";
    return name;
}

constexpr int kDebug = HGLog::HGLogger::LEVEL_DEBUG;
constexpr int kProgress = HGLog::HGLogger::LEVEL_PROGRESS;
constexpr int kWarning = HGLog::HGLogger::LEVEL_WARNING;
constexpr int kError = HGLog::HGLogger::LEVEL_ERROR;

} // namespace ipmi

#define IPMI_LOG(level, ...) HGLOG_EVENT("ipmi", ::ipmi::logger(), level, __VA_ARGS__)
