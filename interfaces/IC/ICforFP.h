// IC::ICforFP: the services the library offers a functional plug-in, handed to
// its Initialize(). The object lives only during that call: a plug-in copies
// whatever it keeps (all values are plain copies and may be copied freely).
#pragma once

#include <IC/Alert.h>
#include <IC/CommonExport.h>
#include <IC/Error.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <string>
#include <vector>

namespace IC {

class InstrumentationControl;
class ManagementInterface;

// Registers (or deregisters) callback with context for alerts on node paths.
using PathAlertRegistration = Error (*)(AlertCallBack callback,
                                        std::vector<std::string> const& paths,
                                        void const* context);
// Registers (or deregisters) callback with context for a sensor type.
using SensorAlertRegistration = Error (*)(AlertCallBack callback, Node::SensorType sensor,
                                          void const* context);
// Raises a batch of alerts (delivery), or records it as asserted (no delivery).
using AlertSink = Error (*)(std::vector<Alert> const& alerts);
// Announces a node of the plug-in's own.
using NodeAnnouncement = Error (*)(Node* const& node);

class ICCOMMON_API ICforFP {
public:
    ICforFP(std::vector<ManagementInterface*> const& mis, PathAlertRegistration regFPAlerts,
            PathAlertRegistration deRegFPAlerts, AlertSink alertCallBackFP,
            AlertSink assertCallBackFP, Number const& interfaceVersion,
            Number const& moduleVersion, NodeAnnouncement const& mapNewFPNode,
            InstrumentationControl* instrumentationControl,
            SensorAlertRegistration regFPsensorAlerts,
            SensorAlertRegistration deRegFPsensorAlerts);

    // The management interfaces loaded when the plug-in was initialised.
    std::vector<ManagementInterface*> const& getMIs() const { return mis_; }
    PathAlertRegistration getRegFPAlerts() const { return regFPAlerts_; }
    PathAlertRegistration getDeRegFPAlerts() const { return deRegFPAlerts_; }
    AlertSink getAlertCallBackFP() const { return alertCallBackFP_; }
    AlertSink getAssertCallBackFP() const { return assertCallBackFP_; }
    Number const& getInterfaceVersion() const { return interfaceVersion_; }
    Number const& getModuleVersion() const { return moduleVersion_; }
    NodeAnnouncement getMapNewFPNode() const { return mapNewFPNode_; }
    InstrumentationControl* getInstrumentationControl() const { return ic_; }
    SensorAlertRegistration getRegFPsensorAlerts() const { return regFPsensorAlerts_; }
    SensorAlertRegistration getDeRegFPsensorAlerts() const { return deRegFPsensorAlerts_; }

private:
    std::vector<ManagementInterface*> mis_;
    PathAlertRegistration regFPAlerts_;
    PathAlertRegistration deRegFPAlerts_;
    AlertSink alertCallBackFP_;
    AlertSink assertCallBackFP_;
    Number interfaceVersion_;
    Number moduleVersion_;
    NodeAnnouncement mapNewFPNode_;
    InstrumentationControl* ic_;
    SensorAlertRegistration regFPsensorAlerts_;
    SensorAlertRegistration deRegFPsensorAlerts_;
};

} // namespace IC
