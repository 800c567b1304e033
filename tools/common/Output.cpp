#include "Output.h"

#include "Escape.h"
#include "SensorNames.h"

#include <algorithm>
#include <ostream>

namespace ictools {
namespace {

std::string printable(IC::InstrumentationControl& ic, std::string const& path)
{
    return path.empty() ? std::string() : ic.pathToPrintablePath(path);
}

// The node at a binary path, or null.
IC::Node* lookup(IC::InstrumentationControl& ic, std::string const& path)
{
    IC::Node* node = nullptr;
    if (ic.getNode(path, &node).getStatus() != 0)
        return nullptr;
    return node;
}

} // namespace

std::string readingText(IC::Node const& node)
{
    IC::Node::Property p;
    if (!node.getProperty("reading", &p))
        return std::string();
    return p.unit.empty() ? p.value : p.value + " " + p.unit;
}

std::string stateText(IC::Node const& node)
{
    IC::Node::Property p;
    return node.getProperty("state", &p) ? p.value : std::string();
}

std::string nodeSummary(IC::Node const& node)
{
    std::string line = sensorName(node.getSensor()) + " " + std::to_string(node.getInstance()) +
                       ": " + escapeText(node.getDescription());
    std::string const reading = readingText(node);
    if (!reading.empty())
        line += " = " + escapeText(reading);
    std::string const state = stateText(node);
    if (!state.empty())
        line += " (" + escapeText(state) + ")";
    return line;
}

Json nodeJson(IC::InstrumentationControl& ic, IC::Node const& node)
{
    Json j;
    j["path"] = printable(ic, node.getPath());
    std::string const parent = printable(ic, node.getLinkedPath());
    j["parent"] = parent.empty() ? Json(nullptr) : Json(parent);
    j["type"] = static_cast<unsigned int>(node.getSensor());
    j["typeName"] = sensorName(node.getSensor());
    j["instance"] = node.getInstance();
    j["nodeId"] = node.getNodeId();
    j["nodeNumber"] = node.getNodeNumber();
    j["description"] = node.getDescription();
    IC::Node::Property p;
    if (node.getProperty("reading", &p))
        j["reading"] = Json{{"value", p.value}, {"unit", p.unit}};
    else
        j["reading"] = nullptr;
    j["state"] = node.getProperty("state", &p) ? Json(p.value) : Json(nullptr);
    Json props = Json::array();
    for (IC::Node::Property const& prop : node.getProperties())
        props.push_back(Json{{"name", prop.name}, {"value", prop.value}, {"unit", prop.unit}});
    j["properties"] = props;
    return j;
}

Json alertJson(IC::InstrumentationControl& ic, IC::Alert const& alert)
{
    Json j;
    j["time"] = alert.getTimeStamp().toIso8601();
    j["severity"] = static_cast<unsigned int>(alert.getSeverity());
    j["severityName"] = severityName(alert.getSeverity());
    j["class"] = static_cast<unsigned int>(alert.getClass());
    j["className"] = className(alert.getClass());
    j["status"] = alert.getStatus();
    j["statusName"] = statusName(alert.getStatus());
    Json paths = Json::array();
    Json nodes = Json::array();
    for (std::string const& path : alert.nodePaths()) {
        paths.push_back(printable(ic, path));
        if (IC::Node* node = lookup(ic, path))
            nodes.push_back(Json{{"type", static_cast<unsigned int>(node->getSensor())},
                                 {"typeName", sensorName(node->getSensor())},
                                 {"instance", node->getInstance()},
                                 {"description", node->getDescription()}});
        else
            nodes.push_back(nullptr); // gone, or never known to the library
    }
    j["paths"] = paths;
    j["nodes"] = nodes;
    j["message"] = alert.getMessage();
    return j;
}

std::string alertLine(IC::InstrumentationControl& ic, IC::Alert const& alert)
{
    std::string line = alert.getTimeStamp().toIso8601() + " " + severityName(alert.getSeverity()) +
                       " " + className(alert.getClass()) + " " + statusName(alert.getStatus());
    for (std::string const& path : alert.nodePaths()) {
        line += " [" + printable(ic, path);
        if (IC::Node* node = lookup(ic, path))
            line += " " + sensorName(node->getSensor()) + " " +
                    std::to_string(node->getInstance()) + ": " +
                    escapeText(node->getDescription());
        line += "]";
    }
    line += " " + escapeText(alert.getMessage());
    return line;
}

void printTable(std::ostream& os, std::vector<std::string> const& header,
                std::vector<std::vector<std::string>> const& rawRows)
{
    std::vector<std::vector<std::string>> rows;
    rows.reserve(rawRows.size());
    for (auto const& raw : rawRows) {
        rows.emplace_back();
        for (std::string const& cell : raw)
            rows.back().push_back(escapeText(cell));
    }
    std::vector<std::size_t> widths(header.size(), 0);
    auto measure = [&widths](std::vector<std::string> const& row) {
        for (std::size_t i = 0; i < row.size() && i < widths.size(); ++i)
            widths[i] = std::max(widths[i], row[i].size());
    };
    measure(header);
    for (auto const& row : rows)
        measure(row);
    auto print = [&os, &widths](std::vector<std::string> const& row) {
        std::string line;
        for (std::size_t i = 0; i < row.size() && i < widths.size(); ++i) {
            line += row[i];
            if (i + 1 < row.size())
                line += std::string(widths[i] - row[i].size() + 2, ' ');
        }
        while (!line.empty() && line.back() == ' ')
            line.pop_back();
        os << line << '\n';
    };
    print(header);
    for (auto const& row : rows)
        print(row);
}

void printJson(std::ostream& os, Json const& doc)
{
    std::string text = doc.dump(2, ' ', false, Json::error_handler_t::replace);
    escapeJsonControls(text);
    os << text << '\n';
}

std::string jsonLine(Json const& doc)
{
    std::string text = doc.dump(-1, ' ', false, Json::error_handler_t::replace);
    escapeJsonControls(text);
    return text;
}

Json alertListJson(IC::InstrumentationControl& ic, std::vector<IC::Alert> const& alerts)
{
    Json list = Json::array();
    for (IC::Alert const& a : alerts)
        list.push_back(alertJson(ic, a));
    return Json{{"count", alerts.size()}, {"alerts", list}};
}

Json showJson(IC::InstrumentationControl& ic, IC::Node& node,
              std::vector<IC::Node*> const& children, std::vector<IC::Alert> const& asserted)
{
    Json j = nodeJson(ic, node);
    j["hierarchy"] = ic.getNodeHierarchy(&node);
    Json kids = Json::array();
    for (IC::Node* c : children)
        kids.push_back(ic.pathToPrintablePath(c->getPath()));
    j["children"] = kids;
    Json alerts = Json::array();
    for (IC::Alert const& a : asserted)
        for (std::string const& p : a.nodePaths())
            if (p == node.getPath()) {
                alerts.push_back(alertJson(ic, a));
                break;
            }
    j["alerts"] = alerts;
    return j;
}

} // namespace ictools
