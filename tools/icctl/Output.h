// How icctl shows nodes and alerts: text lines and tables, or JSON.
#pragma once

#include <IC/Alert.h>
#include <IC/InstrumentationControl.h>
#include <IC/Node.h>

#include <nlohmann/json.hpp>

#include <iosfwd>
#include <string>
#include <vector>

namespace icctl {

using Json = nlohmann::ordered_json;

// The node's "reading" property with its unit ("45 C"); "" when it has none.
std::string readingText(IC::Node const& node);
// The node's "state" property; "" when it has none.
std::string stateText(IC::Node const& node);
// "Temperature Sensor 0: CPU temperature = 45 C (ok)"
std::string nodeSummary(IC::Node const& node);

// A node's identity, description, reading, state, properties and parent.
Json nodeJson(IC::InstrumentationControl& ic, IC::Node const& node);

// An alert with names for its numbers and, for each path, the node if known.
Json alertJson(IC::InstrumentationControl& ic, IC::Alert const& alert);
// One line: time, severity, class, status, paths with their nodes, message.
std::string alertLine(IC::InstrumentationControl& ic, IC::Alert const& alert);

// Columns padded to their widest cell; the last column is not padded.
void printTable(std::ostream& os, std::vector<std::string> const& header,
                std::vector<std::vector<std::string>> const& rows);

// One document, indented; text that is not UTF-8 is replaced, not fatal.
void printJson(std::ostream& os, Json const& doc);
// One document on one line (JSON lines).
std::string jsonLine(Json const& doc);

} // namespace icctl
