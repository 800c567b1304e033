// Names of the node sensor types (0..73) for printing and for parsing
// --sensor, and of the alert classes, severities and statuses.
#pragma once

#include <IC/Alert.h>
#include <IC/Node.h>

#include <string>

namespace ictools {

// "Temperature Sensor"; "type N" for a number outside the table.
std::string sensorName(unsigned int type);

// A sensor type from its name, matched without regard to case, blanks, '-'
// and '_' ("Temperature Sensor", "temperature-sensor", "TemperatureSensor"),
// or from its number. Throws UsageError for anything else.
IC::Node::SensorType parseSensor(std::string const& text);

// "threshold"; "class N" for classes without a name.
std::string className(unsigned int cls);
// A class from its name ("threshold", "node-arrival"...) or its number
// (0..255). Throws UsageError for anything else.
IC::Alert::ClassType parseClass(std::string const& text);

// "information", "warning", "critical", "fatal"; "severity N" otherwise.
std::string severityName(unsigned int severity);
// "normal", "warning", "critical"; "status N" otherwise.
std::string statusName(unsigned int status);

} // namespace ictools
