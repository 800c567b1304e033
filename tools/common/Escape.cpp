#include "Escape.h"

#include <cstdint>

namespace ictools {
namespace {

char const kHex[] = "0123456789abcdef";

void appendByteEscape(std::string& out, unsigned char c, char const* prefix)
{
    out += prefix;
    out += kHex[c >> 4];
    out += kHex[c & 0xf];
}

// Length of the well-formed UTF-8 sequence at s[i] (2..4), or 0.
std::size_t sequenceLength(std::string_view s, std::size_t i)
{
    auto const b = [&s](std::size_t k) { return static_cast<unsigned char>(s[k]); };
    unsigned char const c = b(i);
    std::size_t len = 0;
    unsigned char lo = 0x80, hi = 0xbf;
    if (c >= 0xc2 && c <= 0xdf) {
        len = 2;
    } else if (c >= 0xe0 && c <= 0xef) {
        len = 3;
        if (c == 0xe0)
            lo = 0xa0; // overlong
        else if (c == 0xed)
            hi = 0x9f; // surrogates
    } else if (c >= 0xf0 && c <= 0xf4) {
        len = 4;
        if (c == 0xf0)
            lo = 0x90;
        else if (c == 0xf4)
            hi = 0x8f;
    } else {
        return 0;
    }
    if (i + len > s.size())
        return 0;
    if (b(i + 1) < lo || b(i + 1) > hi)
        return 0;
    for (std::size_t k = 2; k < len; ++k)
        if ((b(i + k) & 0xc0) != 0x80)
            return 0;
    return len;
}

} // namespace

std::string escapeText(std::string_view raw)
{
    std::string out;
    out.reserve(raw.size());
    for (std::size_t i = 0; i < raw.size();) {
        auto const c = static_cast<unsigned char>(raw[i]);
        if (c < 0x80) {
            if (c < 0x20 || c == 0x7f)
                appendByteEscape(out, c, "\\x");
            else if (c == '\\')
                out += "\\\\";
            else
                out += static_cast<char>(c);
            ++i;
            continue;
        }
        std::size_t const len = sequenceLength(raw, i);
        if (len == 0) {
            appendByteEscape(out, c, "\\x");
            ++i;
        } else if (c == 0xc2 && static_cast<unsigned char>(raw[i + 1]) <= 0x9f) {
            appendByteEscape(out, static_cast<unsigned char>(raw[i + 1]), "\\u00");
            i += 2;
        } else {
            out.append(raw.substr(i, len));
            i += len;
        }
    }
    return out;
}

std::string escapeLabel(std::string_view raw)
{
    std::string const text = escapeText(raw);
    std::string out;
    out.reserve(text.size());
    for (char c : text) {
        if (c == '\\' || c == '"')
            out += '\\';
        out += c;
    }
    return out;
}

void escapeJsonControls(std::string& dumped)
{
    std::size_t i = 0;
    for (; i < dumped.size(); ++i) {
        auto const c = static_cast<unsigned char>(dumped[i]);
        if (c == 0x7f || c == 0xc2)
            break;
    }
    if (i == dumped.size())
        return; // the usual case: nothing to do, nothing copied
    std::string out(dumped, 0, i);
    for (; i < dumped.size(); ++i) {
        auto const c = static_cast<unsigned char>(dumped[i]);
        auto const next = i + 1 < dumped.size() ? static_cast<unsigned char>(dumped[i + 1]) : 0;
        if (c == 0x7f) {
            out += "\\u007f";
        } else if (c == 0xc2 && next >= 0x80 && next <= 0x9f) {
            appendByteEscape(out, next, "\\u00");
            ++i;
        } else {
            out += static_cast<char>(c);
        }
    }
    dumped.swap(out);
}

} // namespace ictools
