#include <IC/ICforFP.h>

namespace IC {

ICforFP::ICforFP(std::vector<ManagementInterface*> const& mis, PathAlertRegistration regFPAlerts,
                 PathAlertRegistration deRegFPAlerts, AlertSink alertCallBackFP,
                 AlertSink assertCallBackFP, Number const& interfaceVersion,
                 Number const& moduleVersion, NodeAnnouncement const& mapNewFPNode,
                 InstrumentationControl* instrumentationControl,
                 SensorAlertRegistration regFPsensorAlerts,
                 SensorAlertRegistration deRegFPsensorAlerts)
    : mis_(mis), regFPAlerts_(regFPAlerts), deRegFPAlerts_(deRegFPAlerts),
      alertCallBackFP_(alertCallBackFP), assertCallBackFP_(assertCallBackFP),
      interfaceVersion_(interfaceVersion), moduleVersion_(moduleVersion),
      mapNewFPNode_(mapNewFPNode), ic_(instrumentationControl),
      regFPsensorAlerts_(regFPsensorAlerts), deRegFPsensorAlerts_(deRegFPsensorAlerts)
{
}

} // namespace IC
