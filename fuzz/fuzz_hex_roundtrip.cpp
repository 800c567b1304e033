// hexstring on any bytes, then stringhex on what it wrote: two lower-case
// digits a byte, read back (in either case) to the same bytes; a zero byte
// prints but is refused on the way back.
#include "FuzzSupport.h"

#include <stdexcept>

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size)
{
    static char const digits[] = "0123456789abcdef";
    IC::NodeStore const& store = fuzz::store();
    std::string const bytes(reinterpret_cast<char const*>(data), size);

    std::string const text = store.hexstring(bytes);
    FUZZ_CHECK(text.size() == 2 * size);
    for (std::size_t i = 0; i < size; ++i) {
        FUZZ_CHECK(text[2 * i] == digits[data[i] >> 4]);
        FUZZ_CHECK(text[2 * i + 1] == digits[data[i] & 15]);
    }

    std::string upper = text;
    for (char& c : upper)
        if (c >= 'a' && c <= 'f')
            c = static_cast<char>(c - 'a' + 'A');

    bool const hasZero = bytes.find('\0') != std::string::npos;
    for (std::string const* form : {&text, static_cast<std::string const*>(&upper)}) {
        try {
            std::string const back = store.stringhex(*form);
            FUZZ_CHECK(!hasZero);
            FUZZ_CHECK(back == bytes);
        } catch (std::invalid_argument const& e) {
            FUZZ_CHECK(hasZero);
            FUZZ_CHECK(std::strcmp(e.what(), "Invalid null byte") == 0);
        }
    }
    return 0;
}
