// A version of two 8-bit numbers, major then minor.
#pragma once

#include <cstdint>

namespace IC {

// An aggregate on purpose: IC::Version2{1, 0}. The members are not
// initialised through a constructor because glibc's <sys/sysmacros.h>
// defines function-like macros named major() and minor().
struct Version2 {
    std::uint8_t major;
    std::uint8_t minor;
};

inline bool operator==(Version2 const& a, Version2 const& b)
{
    return a.major == b.major && a.minor == b.minor;
}
inline bool operator!=(Version2 const& a, Version2 const& b) { return !(a == b); }

} // namespace IC
