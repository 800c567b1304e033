// tree, nodes, show, alerts and sensors: one look at the library's state.
#include "Commands.h"

#include "Errors.h"
#include "Escape.h"
#include "Forest.h"
#include "Output.h"
#include "SensorNames.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <iomanip>
#include <iostream>
#include <map>
#include <set>
#include <stdexcept>
#include <thread>

namespace icctl {
namespace {

std::vector<IC::Node*> allNodes(IC::InstrumentationControl& ic)
{
    std::vector<IC::Node*> nodes;
    if (ic.getAllNodes(nodes).getStatus() != 0)
        throw Failure("the library could not list its nodes");
    return nodes;
}

void printTree(std::ostream& os, IC::InstrumentationControl& ic, Forest const& f, IC::Node* n,
               int depth, std::set<IC::Node const*>& done)
{
    if (!done.insert(n).second)
        return;
    os << std::string(static_cast<std::size_t>(depth) * 2, ' ') << nodeSummary(*n) << "  ["
       << ic.pathToPrintablePath(n->getPath()) << "]\n";
    for (IC::Node* c : f.children(n))
        printTree(os, ic, f, c, depth + 1, done);
}

// A printable path from the command line as the library's binary path.
std::string binaryPath(IC::InstrumentationControl& ic, std::string const& text)
{
    if (text.empty())
        throw UsageError("empty node path");
    try {
        return ic.printablePathToPath(text);
    } catch (std::invalid_argument const& e) {
        throw UsageError("invalid node path '" + text + "': " + e.what() +
                         " (give the hexadecimal form that 'icctl nodes' shows)");
    }
}

std::vector<IC::Alert> assertedAlerts(IC::InstrumentationControl& ic)
{
    std::vector<IC::Alert> alerts;
    if (ic.getAssertedAlerts(alerts).getStatus() != 0)
        throw Failure("the library could not list the asserted alerts");
    return alerts;
}

std::string joinedPaths(IC::InstrumentationControl& ic, IC::Alert const& a)
{
    std::string out;
    for (std::string const& p : a.nodePaths())
        out += (out.empty() ? "" : ",") + ic.pathToPrintablePath(p);
    return out;
}

} // namespace

int runTree(GlobalOptions const& g)
{
    Library lib(g);
    IC::InstrumentationControl& ic = lib.ic();
    std::vector<IC::Node*> const nodes = allNodes(ic);
    Forest const f(nodes);
    std::set<IC::Node const*> done;
    if (g.json) {
        // Node by node: a very large tree is never one document in memory.
        f.writeJson(ic, [](std::string const& piece) { std::cout << piece; });
    } else if (nodes.empty()) {
        std::cout << "No nodes: no management interface reported any hardware.\n";
    } else {
        for (IC::Node* r : f.roots())
            printTree(std::cout, ic, f, r, 0, done);
    }
    return kExitOk;
}

int runNodes(GlobalOptions const& g, NodesOptions const& o)
{
    // The name is checked before the plug-ins are loaded.
    bool const filtered = !o.sensor.empty();
    IC::Node::SensorType const sensor = filtered ? parseSensor(o.sensor) : IC::Node::invalid;
    Library lib(g);
    IC::InstrumentationControl& ic = lib.ic();
    std::vector<IC::Node*> nodes;
    for (IC::Node* n : allNodes(ic))
        if (!filtered || n->getSensor() == sensor)
            nodes.push_back(n);
    if (g.json) {
        Json list = Json::array();
        for (IC::Node* n : nodes)
            list.push_back(nodeJson(ic, *n));
        printJson(std::cout, Json{{"count", nodes.size()}, {"nodes", list}});
        return kExitOk;
    }
    if (nodes.empty()) {
        std::cout << (filtered ? "No nodes of type " + sensorName(sensor) + ".\n" : "No nodes.\n");
        return kExitOk;
    }
    std::vector<std::vector<std::string>> rows;
    for (IC::Node* n : nodes)
        rows.push_back({ic.pathToPrintablePath(n->getPath()), sensorName(n->getSensor()),
                        std::to_string(n->getInstance()), n->getDescription(), readingText(*n),
                        stateText(*n)});
    printTable(std::cout, {"PATH", "TYPE", "INSTANCE", "DESCRIPTION", "READING", "STATE"}, rows);
    return kExitOk;
}

int runShow(GlobalOptions const& g, std::string const& printablePath)
{
    Library lib(g);
    IC::InstrumentationControl& ic = lib.ic();
    std::string const path = binaryPath(ic, printablePath);
    IC::Node* node = nullptr;
    if (ic.getNode(path, &node).getStatus() != 0 || !node)
        throw Failure("no node at path " + ic.pathToPrintablePath(path));

    std::vector<IC::Node*> const nodes = allNodes(ic);
    Forest const f(nodes);
    std::vector<IC::Node*> const& kids = f.children(node);
    std::vector<IC::Alert> const asserted = assertedAlerts(ic);
    if (g.json) {
        printJson(std::cout, showJson(ic, *node, kids, asserted));
        return kExitOk;
    }
    std::vector<IC::Alert> mine;
    for (IC::Alert const& a : asserted)
        for (std::string const& p : a.nodePaths())
            if (p == path) {
                mine.push_back(a);
                break;
            }
    std::string const hierarchy = ic.getNodeHierarchy(node);

    char id[16];
    std::snprintf(id, sizeof id, "0x%08x", node->getNodeId());
    auto field = [](std::string const& name, std::string const& value) {
        std::cout << std::left << std::setw(13) << name << escapeText(value) << '\n';
    };
    field("path", ic.pathToPrintablePath(path));
    field("type", sensorName(node->getSensor()) + " (" + std::to_string(node->getSensor()) + ")");
    field("instance", std::to_string(node->getInstance()));
    field("description", node->getDescription());
    field("node id", id);
    field("node number", std::to_string(node->getNodeNumber()));
    field("parent", node->getLinkedPath().empty() ? "-"
                                                  : ic.pathToPrintablePath(node->getLinkedPath()));
    field("hierarchy", hierarchy);
    if (kids.empty())
        field("children", "-");
    for (std::size_t i = 0; i < kids.size(); ++i)
        field(i == 0 ? "children" : "", ic.pathToPrintablePath(kids[i]->getPath()) + " " +
                                            sensorName(kids[i]->getSensor()) + " " +
                                            std::to_string(kids[i]->getInstance()));
    if (mine.empty())
        field("alert", "-");
    for (IC::Alert const& a : mine)
        field("alert", severityName(a.getSeverity()) + " " + className(a.getClass()) + " " +
                           statusName(a.getStatus()) + ": " + a.getMessage());
    std::vector<IC::Node::Property> const props = node->getProperties();
    if (props.empty())
        field("properties", "-");
    else
        std::cout << "properties\n";
    for (IC::Node::Property const& p : props)
        std::cout << "  " << escapeText(p.name) << " = " << escapeText(p.value)
                  << (p.unit.empty() ? "" : " " + escapeText(p.unit)) << '\n';
    return kExitOk;
}

int runAlerts(GlobalOptions const& g, AlertsOptions const& o)
{
    Library lib(g);
    IC::InstrumentationControl& ic = lib.ic();
    if (o.waitSeconds > 0)
        std::this_thread::sleep_for(std::chrono::duration<double>(o.waitSeconds));
    std::vector<IC::Alert> const alerts = assertedAlerts(ic);
    if (g.json) {
        printJson(std::cout, alertListJson(ic, alerts));
        return kExitOk;
    }
    if (alerts.empty()) {
        std::cout << "No asserted alerts.\n";
        return kExitOk;
    }
    std::vector<std::vector<std::string>> rows;
    for (IC::Alert const& a : alerts) {
        std::string node;
        if (!a.nodePaths().empty()) {
            IC::Node* n = nullptr;
            if (ic.getNode(a.nodePaths().front(), &n).getStatus() == 0 && n)
                node = sensorName(n->getSensor()) + " " + std::to_string(n->getInstance());
        }
        rows.push_back({joinedPaths(ic, a), node, severityName(a.getSeverity()),
                        className(a.getClass()), statusName(a.getStatus()),
                        a.getTimeStamp().toIso8601(), a.getMessage()});
    }
    printTable(std::cout, {"PATH", "NODE", "SEVERITY", "CLASS", "STATUS", "TIME", "MESSAGE"},
               rows);
    return kExitOk;
}

int runSensors(GlobalOptions const& g)
{
    unsigned int const count = IC::Node::invalid;
    if (g.json) {
        Json list = Json::array();
        for (unsigned int t = 0; t < count; ++t)
            list.push_back(Json{{"type", t}, {"name", sensorName(t)}});
        printJson(std::cout, Json{{"sensors", list}});
        return kExitOk;
    }
    std::vector<std::vector<std::string>> rows;
    for (unsigned int t = 0; t < count; ++t)
        rows.push_back({std::to_string(t), sensorName(t)});
    printTable(std::cout, {"TYPE", "NAME"}, rows);
    return kExitOk;
}

} // namespace icctl
