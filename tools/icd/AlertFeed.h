// icd's registration for alerts: every sensor type and node removals, as
// `icctl watch` takes them. The callback renders each alert once, counts it
// by class and pushes it into the event ring; it never waits on a client.
#pragma once

#include "EventRing.h"

#include <IC/InstrumentationControl.h>

#include <array>
#include <atomic>
#include <cstdint>

namespace icd {

class AlertFeed {
public:
    // Registers. The last Unloadlib removes the registration; a delivery
    // may run until then, so the feed must outlive the library's unload.
    AlertFeed(IC::InstrumentationControl& ic, EventRing& ring);
    AlertFeed(AlertFeed const&) = delete;
    AlertFeed& operator=(AlertFeed const&) = delete;

    // Alerts received so far of one class (0..255).
    std::uint64_t received(unsigned int cls) const { return received_[cls & 0xff].load(); }

private:
    static IC::Error onAlerts(std::vector<IC::Alert> const& alerts, void const* context);

    IC::InstrumentationControl& ic_;
    EventRing& ring_;
    std::array<std::atomic<std::uint64_t>, 256> received_{};
};

} // namespace icd
