// Globals of namespace IC::InstCtrl that stay inside the library.
#pragma once

#include <IC/Error.h>
#include <IC/InstrumentationControl.h>

#include <HGLog/HGLogger.h>

#include <string>

namespace IC {
namespace InstCtrl {

extern std::string loggerIC;
extern InstrumentationControl ic;
extern Error myice;
extern Error lderr;

} // namespace InstCtrl
} // namespace IC

// One log event of this module, from the enclosing function.
#define IC_LOG(level, ...) \
    HGLOG_EVENT("InstrumentationControl", ::IC::InstCtrl::loggerIC, level, __VA_ARGS__)
