#include "Metrics.h"

#include "Escape.h"
#include "Plugins.h"
#include "SensorNames.h"

#include <IC/Node.h>

#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <set>

namespace icd {
namespace {

using ictools::escapeLabel;

// Units as the plug-ins write them, and the base unit Prometheus names.
struct Unit {
    char const* given;
    char const* base;
    double scale;
};
Unit const kUnits[] = {
    {"C", "celsius", 1},  {"V", "volts", 1},   {"mV", "volts", 1e-3}, {"W", "watts", 1},
    {"mW", "watts", 1e-3}, {"A", "amperes", 1}, {"mA", "amperes", 1e-3}, {"J", "joules", 1},
    {"RPM", "rpm", 1},    {"%", "ratio", 1e-2}, {"MB", "bytes", 1e6},   {"bytes", "bytes", 1},
};

Unit baseUnit(std::string const& unit)
{
    for (Unit const& u : kUnits)
        if (unit == u.given)
            return u;
    return Unit{nullptr, nullptr, 1};
}

char const* const kThresholds[] = {"lower_critical", "lower_warning", "upper_warning",
                                   "upper_critical"};

int stateValue(std::string const& state)
{
    // An unused port is no fault: nothing is asserted for it, so an alert
    // rule on 1 must not fire for it.
    if (state == "ok" || state == "no link")
        return 0;
    if (state == "warning")
        return 1;
    if (state == "critical" || state == "offline" || state == "absent")
        return 2;
    return -1;
}

std::string number(double v)
{
    char buf[40];
    std::snprintf(buf, sizeof buf, "%.10g", v);
    return buf;
}

void family(std::string& out, char const* name, char const* type, char const* help)
{
    out += "# HELP ";
    out += name;
    out += ' ';
    out += help;
    out += "\n# TYPE ";
    out += name;
    out += ' ';
    out += type;
    out += '\n';
}

// The labels every node family shares.
std::string nodeLabels(IC::InstrumentationControl& ic, IC::Node const& n)
{
    return "path=\"" + ic.pathToPrintablePath(n.getPath()) + "\",type=\"" +
           std::to_string(static_cast<unsigned int>(n.getSensor())) + "\",type_name=\"" +
           escapeLabel(ictools::sensorName(n.getSensor())) + "\",node_instance=\"" +
           std::to_string(n.getInstance()) + "\",description=\"" +
           escapeLabel(n.getDescription()) + "\"";
}

struct NodeRows {
    std::string values, thresholds, states, info;
};

void addNode(IC::InstrumentationControl& ic, IC::Node const& n, NodeRows& rows)
{
    std::string const labels = nodeLabels(ic, n);
    std::vector<IC::Node::Property> const props = n.getProperties();
    std::map<std::string, IC::Node::Property const*> byName;
    for (IC::Node::Property const& p : props)
        byName.emplace(p.name, &p);
    auto prop = [&byName](char const* name) -> IC::Node::Property const* {
        auto it = byName.find(name);
        return it == byName.end() ? nullptr : it->second;
    };

    double v = 0;
    if (auto const* r = prop("reading"); r && numericValue(r->value, &v)) {
        Unit const u = baseUnit(r->unit);
        std::string const unit = u.base ? u.base : escapeLabel(r->unit);
        rows.values += "ic_sensor_value{" + labels + ",unit=\"" + unit + "\"} " +
                       number(v * u.scale) + "\n";
        for (char const* kind : kThresholds)
            if (auto const* t = prop(kind); t && numericValue(t->value, &v)) {
                Unit const tu = baseUnit(t->unit.empty() ? r->unit : t->unit);
                rows.thresholds += "ic_sensor_threshold{" + labels + ",unit=\"" + unit +
                                   "\",kind=\"" + kind + "\"} " + number(v * tu.scale) + "\n";
            }
    }
    if (auto const* s = prop("state"))
        rows.states += "ic_node_state{" + labels + "} " + std::to_string(stateValue(s->value)) + "\n";

    std::string const parent =
        n.getLinkedPath().empty() ? std::string() : ic.pathToPrintablePath(n.getLinkedPath());
    rows.info += "ic_node_info{" + labels + ",parent=\"" + parent + "\"";
    for (char const* name : {"vendor", "model", "serial", "version"})
        if (auto const* p = prop(name))
            rows.info += std::string(",") + name + "=\"" + escapeLabel(p->value) + "\"";
    rows.info += "} 1\n";
}

} // namespace

bool numericValue(std::string const& text, double* value)
{
    if (text.empty() || text.size() > 64)
        return false;
    char* end = nullptr;
    double const v = std::strtod(text.c_str(), &end);
    if (end != text.c_str() + text.size() || !std::isfinite(v))
        return false;
    *value = v;
    return true;
}

std::string renderMetrics(IC::InstrumentationControl& ic, AlertFeed const& feed)
{
    auto const start = std::chrono::steady_clock::now();
    std::string out;
    out.reserve(64 * 1024);

    std::vector<IC::Node*> nodes;
    ic.getAllNodes(nodes);
    NodeRows rows;
    for (IC::Node* n : nodes)
        addNode(ic, *n, rows);
    family(out, "ic_sensor_value", "gauge",
           "Reading of a sensor node in base units (the unit label names it).");
    out += rows.values;
    family(out, "ic_sensor_threshold", "gauge",
           "Threshold of a sensor node, in the unit of its reading.");
    out += rows.thresholds;
    family(out, "ic_node_state", "gauge",
           "State of a node: 0 ok, 1 warning, 2 critical, -1 unknown.");
    out += rows.states;
    family(out, "ic_node_info", "gauge", "Identity of every node the library knows; always 1.");
    out += rows.info;

    // The alert store returns an alert once per path it is stored under, each
    // time with all its paths: one series per (path, class).
    std::vector<IC::Alert> alerts;
    ic.getAssertedAlerts(alerts);
    std::set<std::string> asserted;
    std::map<std::string, unsigned int> bySeverity;
    for (char const* s : {"information", "warning", "critical", "fatal"})
        bySeverity[s] = 0;
    unsigned int health = 1;
    for (IC::Alert const& a : alerts) {
        std::string const severity = ictools::severityName(a.getSeverity());
        if (a.getClass() == 8)
            health = a.getStatus();
        for (std::string const& p : a.nodePaths())
            if (asserted
                    .insert("ic_alert_asserted{path=\"" + ic.pathToPrintablePath(p) +
                            "\",class=\"" + escapeLabel(ictools::className(a.getClass())) +
                            "\",severity=\"" + escapeLabel(severity) + "\",status=\"" +
                            escapeLabel(ictools::statusName(a.getStatus())) + "\"} 1\n")
                    .second)
                ++bySeverity[severity];
    }
    family(out, "ic_alerts_asserted", "gauge", "Asserted alerts (one per node) by severity.");
    for (auto const& [severity, count] : bySeverity)
        out += "ic_alerts_asserted{severity=\"" + escapeLabel(severity) + "\"} " +
               std::to_string(count) + "\n";
    family(out, "ic_alert_asserted", "gauge", "An asserted alert on a node; always 1.");
    for (std::string const& line : asserted)
        out += line;
    family(out, "ic_health_status", "gauge",
           "Health roll-up of the server: 1 normal, 2 warning, 3 critical.");
    out += "ic_health_status " + std::to_string(health) + "\n";

    PluginCounts const plugins = Plugins::counts();
    family(out, "ic_plugins_loaded", "gauge", "Plug-ins loaded, by kind.");
    out += "ic_plugins_loaded{kind=\"mi\"} " + std::to_string(plugins.mi) + "\n";
    out += "ic_plugins_loaded{kind=\"fp\"} " + std::to_string(plugins.fp) + "\n";
    family(out, "ic_plugin_load_failures_total", "counter",
           "Plug-in files a load or reload pass could not load.");
    out += "ic_plugin_load_failures_total " + std::to_string(plugins.failures) + "\n";
    family(out, "ic_alerts_received_total", "counter", "Alerts received from the library, by class.");
    for (unsigned int c = 0; c < 256; ++c) {
        std::uint64_t const n = feed.received(c);
        if (n != 0 || (c >= 3 && c <= 8))
            out += "ic_alerts_received_total{class=\"" + escapeLabel(ictools::className(c)) +
                   "\"} " + std::to_string(n) + "\n";
    }
    family(out, "ic_build_info", "gauge", "Version of icd; always 1.");
    out += "ic_build_info{version=\"" ICD_VERSION "\"} 1\n";
    family(out, "ic_scrape_duration_seconds", "gauge", "Time this scrape took to render.");
    std::chrono::duration<double> const took = std::chrono::steady_clock::now() - start;
    out += "ic_scrape_duration_seconds " + number(took.count()) + "\n";
    return out;
}

} // namespace icd
