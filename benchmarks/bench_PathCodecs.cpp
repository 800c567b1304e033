// The path codecs of the node store against plain, straightforward versions
// of the same encodings written here.
#include <IC/NodeStore.h>

#include <benchmark/benchmark.h>

#include <string>
#include <utility>
#include <vector>

namespace {

using TopoVec = IC::NodeStore::TopoVec;

// A sensor in a six-level tree: (type, instance) from the node up to the root.
TopoVec const kSixPairs = {{22, 13}, {42, 7}, {4, 1}, {41, 0}, {1, 0}, {59, 0}};

// ---- plain versions ----

std::string plainBase12(unsigned int n)
{
    if (n == 0)
        return "b";
    std::string digits;
    while (n != 0) {
        digits.insert(digits.begin(), static_cast<char>('b' + n % 12));
        n /= 12;
    }
    return digits;
}

std::string plainNodecode(TopoVec const& v)
{
    std::string letters;
    for (auto const& p : v)
        letters += plainBase12(p.second) + "p" + plainBase12(p.first) + "a";
    std::string out;
    for (std::size_t i = 0; i + 1 < letters.size(); i += 2)
        out += static_cast<char>((letters[i] - 'a') * 16 + (letters[i + 1] - 'a'));
    return out;
}

void plainDecode(std::string const& path, TopoVec& out)
{
    std::string letters;
    for (unsigned char c : path) {
        letters += static_cast<char>('a' + (c >> 4));
        letters += static_cast<char>('a' + (c & 15));
    }
    if (letters.empty())
        return;
    if (letters.back() != 'a')
        letters += 'a';
    unsigned int first = 0, second = 0;
    bool inType = false;
    for (char c : letters) {
        if (c == 'a') {
            out.emplace_back(first, second);
            first = second = 0;
            inType = false;
        } else if (c == 'p') {
            inType = true;
        } else if (c >= 'b' && c <= 'm') {
            unsigned int& t = inType ? first : second;
            t = t * 12 + static_cast<unsigned int>(c - 'b');
        }
    }
}

std::string plainHex(std::string const& s)
{
    static char const digits[] = "0123456789abcdef";
    std::string out;
    for (unsigned char c : s) {
        out += digits[c >> 4];
        out += digits[c & 15];
    }
    return out;
}

unsigned int plainNibble(char c)
{
    if (c >= '0' && c <= '9')
        return static_cast<unsigned int>(c - '0');
    if (c >= 'a' && c <= 'f')
        return static_cast<unsigned int>(c - 'a' + 10);
    return static_cast<unsigned int>(c - 'A' + 10);
}

std::string plainUnhex(std::string const& s)
{
    std::string out;
    for (std::size_t i = 0; i + 1 < s.size(); i += 2)
        out += static_cast<char>(plainNibble(s[i]) * 16 + plainNibble(s[i + 1]));
    return out;
}

IC::NodeStore& store()
{
    static IC::NodeStore s;
    return s;
}

std::string const& twelveBytePath()
{
    static std::string const path = [] {
        std::string p = store().nodecode(kSixPairs);
        p.resize(12, '\x11');
        return p;
    }();
    return path;
}

// ---- benchmarks ----

void BM_Nodecode(benchmark::State& state)
{
    for (auto _ : state)
        benchmark::DoNotOptimize(store().nodecode(kSixPairs));
}
BENCHMARK(BM_Nodecode);

void BM_NodecodePlain(benchmark::State& state)
{
    for (auto _ : state)
        benchmark::DoNotOptimize(plainNodecode(kSixPairs));
}
BENCHMARK(BM_NodecodePlain);

void BM_Uniqueid2topovec(benchmark::State& state)
{
    std::string const path = store().nodecode(kSixPairs);
    TopoVec v;
    v.reserve(8);
    for (auto _ : state) {
        v.clear();
        store().uniqueid2topovec(path, IC::Node::invalid, v);
        benchmark::DoNotOptimize(v.data());
    }
}
BENCHMARK(BM_Uniqueid2topovec);

void BM_Uniqueid2topovecPlain(benchmark::State& state)
{
    std::string const path = store().nodecode(kSixPairs);
    TopoVec v;
    v.reserve(8);
    for (auto _ : state) {
        v.clear();
        plainDecode(path, v);
        benchmark::DoNotOptimize(v.data());
    }
}
BENCHMARK(BM_Uniqueid2topovecPlain);

void BM_Hexstring(benchmark::State& state)
{
    for (auto _ : state)
        benchmark::DoNotOptimize(store().hexstring(twelveBytePath()));
}
BENCHMARK(BM_Hexstring);

void BM_HexstringPlain(benchmark::State& state)
{
    for (auto _ : state)
        benchmark::DoNotOptimize(plainHex(twelveBytePath()));
}
BENCHMARK(BM_HexstringPlain);

void BM_Stringhex(benchmark::State& state)
{
    std::string const text = plainHex(twelveBytePath());
    for (auto _ : state)
        benchmark::DoNotOptimize(store().stringhex(text));
}
BENCHMARK(BM_Stringhex);

void BM_StringhexPlain(benchmark::State& state)
{
    std::string const text = plainHex(twelveBytePath());
    for (auto _ : state)
        benchmark::DoNotOptimize(plainUnhex(text));
}
BENCHMARK(BM_StringhexPlain);

} // namespace

BENCHMARK_MAIN();
