// The library's exported global state and the functions of namespace
// IC::InstCtrl that it hands to plug-ins and hosts.
#pragma once

#include <IC/Error.h>
#include <IC/Export.h>
#include <IC/NodeStore.h>

#include <string>

namespace IC {
namespace InstCtrl {

// The shared success value of the alert functions.
IC_API extern Error donegood;
// The node registry.
IC_API extern NodeStore nodestore;

// Logs "<context>: <error text>" as an error on the library's logger.
IC_API void diagError(Error* error, std::string context);

} // namespace InstCtrl
} // namespace IC
