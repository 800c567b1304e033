// Shared by the path-codec fuzz targets: the node store whose codecs they
// call, and a check that ends the run with a message when a property fails,
// for libFuzzer to record the input as a crash.
#pragma once

#include <IC/NodeStore.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

namespace fuzz {

inline IC::NodeStore const& store()
{
    static IC::NodeStore const instance;
    return instance;
}

[[noreturn]] inline void fail(char const* file, int line, char const* what)
{
    std::fprintf(stderr, "%s:%d: property failed: %s\n", file, line, what);
    std::abort();
}

// A sensor type that no pair has: a stop type that stops nothing.
inline std::uint32_t absentType(IC::NodeStore::TopoVec const& pairs)
{
    std::uint32_t t = 0xFFFFFFFFu;
    while (std::any_of(pairs.begin(), pairs.end(), [t](auto const& p) { return p.first == t; }))
        --t;
    return t;
}

// Little-endian 32-bit value at p.
inline std::uint32_t read32(std::uint8_t const* p)
{
    return static_cast<std::uint32_t>(p[0]) | static_cast<std::uint32_t>(p[1]) << 8 |
           static_cast<std::uint32_t>(p[2]) << 16 | static_cast<std::uint32_t>(p[3]) << 24;
}

inline bool isHexDigit(unsigned char c)
{
    return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F');
}

inline unsigned int hexValue(unsigned char c)
{
    if (c >= '0' && c <= '9')
        return c - '0';
    if (c >= 'a' && c <= 'f')
        return c - 'a' + 10;
    return c - 'A' + 10;
}

} // namespace fuzz

#define FUZZ_CHECK(condition)                               \
    do {                                                    \
        if (!(condition))                                   \
            ::fuzz::fail(__FILE__, __LINE__, #condition);   \
    } while (0)
