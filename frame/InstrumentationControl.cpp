#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include "InstCtrlPrivate.h"

namespace IC {
namespace InstCtrl {

// The library's state, constructed in this order when the library is loaded.
std::string loggerIC = "Helmgard.IC.InstrumentationControl";
InstrumentationControl ic;
Error myice(0, Number(0u), "");
Error lderr(5, Number(1u), "Load Library");
Error donegood(0, Number(Number::Generic), "");
NodeStore nodestore;

void diagError(Error* error, std::string context)
{
    if (error)
        IC_LOG(6000, context, ": ", *error);
    else
        IC_LOG(6000, context, ": ", "(no error)");
}

} // namespace InstCtrl

namespace {
Number const kVersion(Version2{1, 0});
} // namespace

Number InstrumentationControl::getModuleVersion() const
{
    IC_LOG(3000, "getModuleVersion:");
    return kVersion;
}

Number InstrumentationControl::getInterfaceVersion() const
{
    IC_LOG(3000, "getInterfaceVersion:");
    return kVersion;
}

} // namespace IC
