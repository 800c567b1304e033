#include "SensorNames.h"

#include "Errors.h"
#include "ShippedAlerts.h"

#include <IC/SensorTypeNames.h>

#include <cctype>
#include <cstdlib>

namespace ictools {
namespace {

constexpr unsigned int kValidTypes = IC::Node::invalid; // 0..73

// Lower case, without blanks, '-' and '_'.
std::string squash(std::string const& s)
{
    std::string out;
    for (unsigned char c : s)
        if (!std::isspace(c) && c != '-' && c != '_')
            out += static_cast<char>(std::tolower(c));
    return out;
}

// Decimal digits only, and not too many to be a plausible number.
bool parseNumber(std::string const& s, unsigned long* value)
{
    if (s.empty() || s.size() > 9)
        return false;
    for (unsigned char c : s)
        if (!std::isdigit(c))
            return false;
    *value = std::strtoul(s.c_str(), nullptr, 10);
    return true;
}

} // namespace

std::string sensorName(unsigned int type)
{
    if (type < IC::sensorTypeCount)
        return IC::sensorTypeNames[type];
    return "type " + std::to_string(type);
}

IC::Node::SensorType parseSensor(std::string const& text)
{
    unsigned long number = 0;
    if (parseNumber(text, &number)) {
        if (number < kValidTypes)
            return static_cast<IC::Node::SensorType>(number);
        throw UsageError("sensor type " + text + " is out of range (0.." +
                         std::to_string(kValidTypes - 1) + ")");
    }
    std::string const wanted = squash(text);
    for (unsigned int t = 0; t < kValidTypes; ++t)
        if (!wanted.empty() && squash(IC::sensorTypeNames[t]) == wanted)
            return static_cast<IC::Node::SensorType>(t);
    throw UsageError("unknown sensor type '" + text +
                     "' (give a name such as \"Temperature Sensor\" or a number; "
                     "'icctl sensors' lists them)");
}

std::string className(unsigned int cls)
{
    if (char const* name = shipped::className(cls))
        return name;
    return "class " + std::to_string(cls);
}

IC::Alert::ClassType parseClass(std::string const& text)
{
    unsigned long number = 0;
    if (parseNumber(text, &number)) {
        if (number <= 255)
            return static_cast<IC::Alert::ClassType>(number);
        throw UsageError("alert class " + text + " is out of range (0..255)");
    }
    std::string const wanted = squash(text);
    for (unsigned int c = 0; c <= 255; ++c)
        if (char const* name = shipped::className(c))
            if (!wanted.empty() && squash(name) == wanted)
                return static_cast<IC::Alert::ClassType>(c);
    throw UsageError("unknown alert class '" + text +
                     "' (node-arrival, node-removal, threshold, memory-errors, link, "
                     "health-rollup, event-log, or a number)");
}

std::string severityName(unsigned int severity)
{
    switch (severity) {
    case shipped::kSeverityInfo: return "information";
    case shipped::kSeverityWarning: return "warning";
    case shipped::kSeverityCritical: return "critical";
    case shipped::kSeverityFatal: return "fatal";
    default: return "severity " + std::to_string(severity);
    }
}

std::string statusName(unsigned int status)
{
    switch (status) {
    case shipped::kStatusNormal: return "normal";
    case shipped::kStatusWarning: return "warning";
    case shipped::kStatusCritical: return "critical";
    default: return "status " + std::to_string(status);
    }
}

} // namespace ictools
