// IC::InstrumentationControl: the facade a client receives from the library.
// The object has no data of its own; all state is the library's.
#pragma once

#include <IC/Error.h>
#include <IC/Export.h>
#include <IC/Number.h>

namespace IC {

class IC_API InstrumentationControl {
public:
    // Version of this library, 1.0.
    Number getModuleVersion() const;
    // Version of the plug-in interface, 1.0.
    Number getInterfaceVersion() const;
};

} // namespace IC
