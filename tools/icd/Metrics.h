// GET /metrics: the Prometheus text exposition format 0.0.4. A node's
// printable path is its stable identity: every node family carries it as the
// `path` label, and no label depends on probe order or on the kernel's
// numbering of devices.
#pragma once

#include "AlertFeed.h"

#include <IC/InstrumentationControl.h>

#include <string>

namespace icd {

// Renders every family; the caller holds the library's load lock, so that
// no plug-in goes away while its nodes are read.
std::string renderMetrics(IC::InstrumentationControl& ic, AlertFeed const& feed);

// A reading as a number in base units (0.001 V as volts, C as celsius...):
// false when the text is not wholly a finite number.
bool numericValue(std::string const& text, double* value);

} // namespace icd
