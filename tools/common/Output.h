// How nodes and alerts are shown: text lines and tables, or JSON. Every
// text from hardware is escaped on the way out (Escape.h).
#pragma once

#include <IC/Alert.h>
#include <IC/InstrumentationControl.h>
#include <IC/Node.h>

#include <nlohmann/json.hpp>

#include <iosfwd>
#include <string>
#include <vector>

namespace ictools {

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
// {"count": N, "alerts": [alert...]}
Json alertListJson(IC::InstrumentationControl& ic, std::vector<IC::Alert> const& alerts);
// A node with its "hierarchy", children's paths and the asserted alerts that
// name it.
Json showJson(IC::InstrumentationControl& ic, IC::Node& node,
              std::vector<IC::Node*> const& children, std::vector<IC::Alert> const& asserted);
// One line: time, severity, class, status, paths with their nodes, message.
std::string alertLine(IC::InstrumentationControl& ic, IC::Alert const& alert);

// Columns padded to their widest cell; the last column is not padded. Cells
// are escaped.
void printTable(std::ostream& os, std::vector<std::string> const& header,
                std::vector<std::vector<std::string>> const& rows);

// One document, indented; text that is not UTF-8 is replaced, not fatal,
// and DEL and C1 controls are escaped as well as C0.
void printJson(std::ostream& os, Json const& doc);
// One document on one line (JSON lines).
std::string jsonLine(Json const& doc);

} // namespace ictools
