// The body of the three diagError functions (the library's own and the two
// loaders'): one error event, "<context>: <error text>", on the module's
// logger, reported as diagError's.
#pragma once

#include <IC/Error.h>

#include <HGLog/HGLogger.h>

#include <string>

namespace IC {
namespace detail {

inline void reportError(char const* source, std::string const& logger, Error const* error,
                        std::string const& context)
{
    if (error)
        HGLog::logEvent("diagError", source, __LINE__, logger, 6000, context, ": ", *error);
    else
        HGLog::logEvent("diagError", source, __LINE__, logger, 6000, context, ": ", "(no error)");
}

} // namespace detail
} // namespace IC
