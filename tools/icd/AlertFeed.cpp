#include "AlertFeed.h"

#include "Log.h"
#include "Output.h"

#include <IC/InstCtrl.h>

namespace icd {

AlertFeed::AlertFeed(IC::InstrumentationControl& ic, EventRing& ring) : ic_(ic), ring_(ring)
{
    for (unsigned int t = 0; t < IC::Node::invalid; ++t)
        if (ic_.registerForAlerts(onAlerts, static_cast<IC::Node::SensorType>(t), this)
                .getStatus() != 0)
            ICD_LOG(6000, "cannot register for alerts of sensor type ", t);
    // Removals reach sensor registrations only while the node is still known;
    // by class they always arrive.
    if (IC::InstCtrl::registerForAlerts(onAlerts, IC::Alert::NodeRemoval, this).getStatus() != 0)
        ICD_LOG(6000, "cannot register for node removals");
}

IC::Error AlertFeed::onAlerts(std::vector<IC::Alert> const& alerts, void const* context)
{
    auto* self = static_cast<AlertFeed*>(const_cast<void*>(context));
    for (IC::Alert const& a : alerts) {
        self->received_[a.getClass()].fetch_add(1, std::memory_order_relaxed);
        try {
            self->ring_.push(ictools::jsonLine(ictools::alertJson(self->ic_, a)));
        } catch (std::exception const& e) {
            ICD_LOG(6000, "cannot render an alert: ", e.what());
        }
    }
    return IC::Error(0, IC::Number(IC::Number::Generic), std::string());
}

} // namespace icd
