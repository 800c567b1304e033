// Lower-case hexadecimal of a byte string, two digits per byte, high nibble
// first: how binary node paths are shown to people.
#pragma once

#include <string>

namespace IC {
namespace detail {

inline std::string hexText(std::string const& s)
{
    static char const digits[] = "0123456789abcdef";
    std::string out(s.size() * 2, '\0');
    std::size_t i = 0;
    for (unsigned char c : s) {
        out[i++] = digits[c >> 4];
        out[i++] = digits[c & 15];
    }
    return out;
}

} // namespace detail
} // namespace IC
