// Names and texts that come from hardware (DMI strings, sensor labels, chip,
// interface and supply names) are hostile: a control character in one could
// change the operator's terminal or forge an extra line. The library keeps
// the raw bytes; every output escapes them here.
#pragma once

#include <string>
#include <string_view>

namespace ictools {

// One line of text for a terminal: C0 controls, DEL and bytes that are not
// UTF-8 become \xNN, C1 controls \u00NN, a backslash \\; everything else
// passes unchanged.
std::string escapeText(std::string_view raw);

// A Prometheus label value: the text of escapeText, with backslash and
// double quote escaped as the exposition format requires.
std::string escapeLabel(std::string_view raw);

// A dumped JSON document (already valid UTF-8, C0 controls already \u-escaped)
// with DEL and C1 controls also written as \u escapes, in place.
void escapeJsonControls(std::string& dumped);

} // namespace ictools
