// Exit statuses of icctl and icd and the exceptions that lead to them.
#pragma once

#include <stdexcept>
#include <string>

namespace ictools {

enum ExitCode : int {
    kExitOk = 0,
    kExitFailure = 1,   // the command could not do its work (a path with no node...)
    kExitUsage = 2,     // bad input: options, names, paths, directories
    kExitOpenFailed = 3 // the library did not open
};

// Bad input from the user; the message says what was wrong.
struct UsageError : std::runtime_error {
    using std::runtime_error::runtime_error;
};

// A well-formed request that could not be carried out.
struct Failure : std::runtime_error {
    using std::runtime_error::runtime_error;
};

// The library refused to open.
struct OpenError : std::runtime_error {
    using std::runtime_error::runtime_error;
};

} // namespace ictools
