// stringhex on any text, against a plain reading of its rule: digits of
// either case, two to a byte, high nibble first; an odd length ends with a
// low nibble of 0; the first bad digit or zero byte in text order decides
// which error is thrown. What it accepts prints back as the same text in
// lower case.
#include "FuzzSupport.h"

#include <stdexcept>

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size)
{
    std::string const text(reinterpret_cast<char const*>(data), size);

    enum class Outcome { Bytes, BadDigit, NullByte } expected = Outcome::Bytes;
    std::string bytes;
    for (std::size_t i = 0; i < size && expected == Outcome::Bytes; i += 2) {
        unsigned char const high = data[i];
        unsigned char const low = i + 1 < size ? data[i + 1] : '0';
        if (!fuzz::isHexDigit(high) || !fuzz::isHexDigit(low))
            expected = Outcome::BadDigit;
        else if ((fuzz::hexValue(high) << 4 | fuzz::hexValue(low)) == 0)
            expected = Outcome::NullByte;
        else
            bytes += static_cast<char>(fuzz::hexValue(high) << 4 | fuzz::hexValue(low));
    }

    std::string result;
    try {
        result = fuzz::store().stringhex(text);
    } catch (std::invalid_argument const& e) {
        FUZZ_CHECK(expected != Outcome::Bytes);
        if (expected == Outcome::BadDigit)
            FUZZ_CHECK(std::strcmp(e.what(), "Invalid hexadecimal digit") == 0);
        else
            FUZZ_CHECK(std::strcmp(e.what(), "Invalid null byte") == 0);
        return 0;
    }
    FUZZ_CHECK(expected == Outcome::Bytes);
    FUZZ_CHECK(result == bytes);

    std::string lower = text;
    for (char& c : lower)
        if (c >= 'A' && c <= 'F')
            c = static_cast<char>(c - 'A' + 'a');
    if (size % 2 != 0)
        lower += '0';
    FUZZ_CHECK(fuzz::store().hexstring(result) == lower);
    return 0;
}
