// b12String and uniqueid2topovec on any bytes. The input is a stop type (4
// bytes, little-endian) followed by the path; shorter inputs are all path,
// read to the end.
//
// uniqueid2topovec is compared with a decoder written from the rule: nibbles
// high first; 0 ends a pair, 1..12 are base-12 digits (of the instance, or of
// the type after a 15), 13 and 14 are skipped; a path whose last nibble is
// not 0 is ended as if it were; decoding stops after the first pair whose
// type is the stop type. Whatever it decodes encodes to a path that decodes
// to the same pairs again.
#include "FuzzSupport.h"

#include <algorithm>
#include <optional>
#include <stdexcept>
#include <vector>

namespace {

using TopoVec = IC::NodeStore::TopoVec;

TopoVec reference(std::string const& uid, std::optional<std::uint32_t> stop)
{
    std::vector<unsigned int> nibbles;
    for (unsigned char c : uid) {
        nibbles.push_back(c >> 4);
        nibbles.push_back(c & 15);
    }
    if (!nibbles.empty() && nibbles.back() != 0)
        nibbles.push_back(0);
    TopoVec pairs;
    std::uint32_t digits[2] = {0, 0}; // instance, type
    int field = 0;
    for (unsigned int n : nibbles) {
        if (n == 0) {
            pairs.emplace_back(digits[1], digits[0]);
            if (stop && digits[1] == *stop)
                break;
            digits[0] = digits[1] = 0;
            field = 0;
        } else if (n == 15) {
            field = 1;
        } else if (n <= 12) {
            digits[field] = digits[field] * 12u + (n - 1);
        }
    }
    return pairs;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size)
{
    std::uint32_t stop = IC::Node::invalid;
    if (size >= 4) {
        stop = fuzz::read32(data);
        data += 4;
        size -= 4;
    }
    std::string const uid(reinterpret_cast<char const*>(data), size);
    IC::NodeStore const& store = fuzz::store();

    std::string const letters = store.b12String(uid);
    FUZZ_CHECK(letters.size() == 2 * size);
    for (std::size_t i = 0; i < size; ++i) {
        FUZZ_CHECK(letters[2 * i] == 'A' + (data[i] >> 4));
        FUZZ_CHECK(letters[2 * i + 1] == 'A' + (data[i] & 15));
    }

    // Appends only: what the vector held stays in front.
    TopoVec decoded{{12345u, 67890u}};
    store.uniqueid2topovec(uid, stop, decoded);
    FUZZ_CHECK(!decoded.empty() && decoded.front() == std::make_pair(12345u, 67890u));
    decoded.erase(decoded.begin());
    FUZZ_CHECK(decoded == reference(uid, stop));

    TopoVec all;
    store.uniqueid2topovec(uid, fuzz::absentType(reference(uid, std::nullopt)), all);
    FUZZ_CHECK(all == reference(uid, std::nullopt));
    if (all.empty())
        return 0;
    std::string const code = store.nodecode(all);
    TopoVec again;
    store.uniqueid2topovec(code, fuzz::absentType(all), again);
    FUZZ_CHECK(again == all);
    return 0;
}
