// nodecode on any list of (type, instance) pairs: 8 bytes per pair, type then
// instance, little-endian; a trailing part of a pair is ignored. Every
// non-empty list encodes, and decodes back to itself, or to the pairs up to
// and including the first of a given type when decoding stops there. The code
// has the documented length, holds no zero byte and survives its printable
// form. An empty list is refused.
#include "FuzzSupport.h"

#include <algorithm>
#include <stdexcept>

namespace {

using TopoVec = IC::NodeStore::TopoVec;

// Letters of n in base 12 (at least one).
std::size_t digitCount(std::uint32_t n)
{
    std::size_t count = 1;
    while (n >= 12) {
        n /= 12;
        ++count;
    }
    return count;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size)
{
    IC::NodeStore const& store = fuzz::store();
    TopoVec pairs;
    for (std::size_t i = 0; i + 8 <= size; i += 8)
        pairs.emplace_back(fuzz::read32(data + i), fuzz::read32(data + i + 4));

    if (pairs.empty()) {
        try {
            store.nodecode(pairs);
        } catch (std::invalid_argument const& e) {
            FUZZ_CHECK(std::strcmp(e.what(), "Damaged node string") == 0);
            return 0;
        }
        fuzz::fail(__FILE__, __LINE__, "an empty pair list was encoded");
    }

    std::string const code = store.nodecode(pairs);
    // Instance digits, 'p', type digits, 'a' per pair, two letters a byte; the
    // final 'a' of an odd count is left to the decoder.
    std::size_t letters = 0;
    for (auto const& p : pairs)
        letters += digitCount(p.second) + digitCount(p.first) + 2;
    FUZZ_CHECK(code.size() == letters / 2);
    FUZZ_CHECK(code.find('\0') == std::string::npos);

    TopoVec decoded;
    store.uniqueid2topovec(code, fuzz::absentType(pairs), decoded);
    FUZZ_CHECK(decoded == pairs);

    // Stopping at a type that occurs: the pairs up to its first occurrence.
    std::uint32_t const stop = pairs[pairs.size() / 2].first;
    auto const first = std::find_if(pairs.begin(), pairs.end(),
                                    [stop](auto const& p) { return p.first == stop; });
    TopoVec partial;
    store.uniqueid2topovec(code, stop, partial);
    FUZZ_CHECK(partial == TopoVec(pairs.begin(), first + 1));

    FUZZ_CHECK(store.stringhex(store.hexstring(code)) == code);
    return 0;
}
