// IC::InstrumentationControl: the facade a client receives from the library.
// The object has no data of its own; all state is the library's.
#pragma once

#include <IC/Alert.h>
#include <IC/AlertRegister.h>
#include <IC/Error.h>
#include <IC/Export.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <vector>

namespace IC {

class IC_API InstrumentationControl {
public:
    // Version of this library, 1.0.
    Number getModuleVersion() const;
    // Version of the plug-in interface, 1.0.
    Number getInterfaceVersion() const;

    // Alerts raised by functional plug-ins on nodes of a sensor type reach
    // callback with context. One register per (callback, context) pair.
    Error registerForAlerts(AlertCallBack callback, Node::SensorType sensor, void const* context);
    Error deRegisterForAlerts(AlertCallBack callback, Node::SensorType sensor,
                              void const* context);

    // One call of callback per alert and node path, with an event code;
    // the callback runs under the registration lock and must not register
    // or deregister itself.
    Error registerForSimpleAlerts(SimpleAlertCallBack callback, unsigned int sensor,
                                  void const* context);
    Error deRegisterForSimpleAlerts(SimpleAlertCallBack callback, unsigned int sensor,
                                    void const* context);

    // alerts := the alerts currently asserted, by ascending node path.
    Error getAssertedAlerts(std::vector<Alert>& alerts) const;
};

} // namespace IC
