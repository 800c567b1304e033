// The plug-ins in use, for the metrics: how many of each kind are loaded and
// how many plug-in files the passes so far could not load.
#pragma once

#include <cstdint>

namespace icd {

struct PluginCounts {
    std::size_t mi = 0;
    std::size_t fp = 0;
    std::uint64_t failures = 0; // summed over every load and reload pass
};

class Plugins {
public:
    // Counts the outcome of the open that has just happened.
    static void afterOpen();
    // One reload pass (the loader thread's function, and SIGHUP), counted.
    static void reload();
    static PluginCounts counts();
};

} // namespace icd
