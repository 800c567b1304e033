// The subcommands. Each returns the exit status and throws UsageError,
// Failure or OpenError for the messages main() prints.
#pragma once

#include "Session.h"

#include <string>
#include <vector>

namespace icctl {

// The pieces icctl shares with icd.
using namespace ictools;

int runTree(GlobalOptions const& g);

struct NodesOptions {
    std::string sensor; // empty: every node
};
int runNodes(GlobalOptions const& g, NodesOptions const& o);

int runShow(GlobalOptions const& g, std::string const& printablePath);

struct AlertsOptions {
    double waitSeconds = 0; // let the interfaces' first readings arrive
};
int runAlerts(GlobalOptions const& g, AlertsOptions const& o);

int runSensors(GlobalOptions const& g);

struct WatchOptions {
    std::vector<std::string> sensors;
    std::vector<std::string> classes;
    std::vector<std::string> paths;
    bool simple = false;
    unsigned int reloadSeconds = 10; // 0: no loader thread
    double forSeconds = 0;           // 0: until interrupted
};
int runWatch(GlobalOptions const& g, WatchOptions const& o);

struct PathOptions {
    std::string printable;  // the path to decode
    std::string encode;     // a chain to encode instead
    bool toBinary = false;  // write the bytes themselves
    bool fromBinary = false; // read the bytes from standard input
};
int runPath(GlobalOptions const& g, PathOptions const& o);

} // namespace icctl
