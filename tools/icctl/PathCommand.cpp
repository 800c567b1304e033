// path: node paths between their printable (hexadecimal) and binary forms,
// and the chain of (sensor type, instance) pairs they encode. It needs no
// plug-in: the library's node store does the coding without any node.
#include "Commands.h"

#include "Errors.h"
#include "Output.h"
#include "SensorNames.h"

#include <IC/NodeStore.h>

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <iostream>
#include <iterator>
#include <stdexcept>

namespace icctl {
namespace {

using TopoVec = IC::NodeStore::TopoVec;

std::string trim(std::string const& s)
{
    std::size_t b = 0;
    std::size_t e = s.size();
    while (b < e && std::isspace(static_cast<unsigned char>(s[b])))
        ++b;
    while (e > b && std::isspace(static_cast<unsigned char>(s[e - 1])))
        --e;
    return s.substr(b, e - b);
}

// An instance as written in a chain: decimal, 0x-prefixed hexadecimal, or
// eight hexadecimal digits as the library's hierarchy text writes them.
unsigned int parseInstance(std::string const& text, std::string const& element)
{
    std::string digits = text;
    int base = 10;
    if (digits.size() > 2 && digits[0] == '0' && (digits[1] == 'x' || digits[1] == 'X')) {
        digits = digits.substr(2);
        base = 16;
    } else if (digits.size() == 8) {
        base = 16;
    }
    bool const good = !digits.empty() && digits.size() <= 8 &&
                      std::all_of(digits.begin(), digits.end(), [base](char c) {
                          return base == 16 ? std::isxdigit(static_cast<unsigned char>(c)) != 0
                                            : std::isdigit(static_cast<unsigned char>(c)) != 0;
                      });
    if (!good)
        throw UsageError("bad instance '" + text + "' in '" + element + "'");
    unsigned long const value = std::stoul(digits, nullptr, base);
    if (value > 0xFFFFFFFFul)
        throw UsageError("instance '" + text + "' in '" + element + "' is too large");
    return static_cast<unsigned int>(value);
}

// "ROOT:0 -> Chassis:0 -> CPU:1" (or '/' between the elements), from the
// root down, into the library's order: the node first, the root last.
TopoVec parseChain(std::string const& text)
{
    std::string s = text;
    for (std::size_t at; (at = s.find("->")) != std::string::npos;)
        s.replace(at, 2, "/");
    TopoVec topo;
    std::size_t start = 0;
    while (start <= s.size()) {
        std::size_t const end = std::min(s.find('/', start), s.size());
        std::string const element = trim(s.substr(start, end - start));
        start = end + 1;
        if (element.empty())
            throw UsageError("empty element in the chain '" + text + "'");
        std::size_t const colon = element.rfind(':');
        if (colon == std::string::npos)
            throw UsageError("'" + element + "' is not TYPE:INSTANCE");
        IC::Node::SensorType const type = parseSensor(trim(element.substr(0, colon)));
        unsigned int const instance = parseInstance(trim(element.substr(colon + 1)), element);
        topo.emplace_back(type, instance);
    }
    std::reverse(topo.begin(), topo.end());
    return topo;
}

std::string escaped(std::string const& bytes)
{
    std::string out;
    char buf[8];
    for (unsigned char c : bytes) {
        std::snprintf(buf, sizeof buf, "\\x%02x", c);
        out += buf;
    }
    return out;
}

std::string hierarchyText(TopoVec const& topo)
{
    std::string out;
    char buf[16];
    for (auto it = topo.rbegin(); it != topo.rend(); ++it) {
        std::snprintf(buf, sizeof buf, "%08x", it->second);
        if (!out.empty())
            out += "->";
        out += sensorName(it->first) + ":" + buf;
    }
    return out;
}

} // namespace

int runPath(GlobalOptions const& g, PathOptions const& o)
{
    int const sources = (o.printable.empty() ? 0 : 1) + (o.encode.empty() ? 0 : 1) +
                        (o.fromBinary ? 1 : 0);
    if (sources != 1)
        throw UsageError("give one of: a printable path, --encode CHAIN, --from-binary");

    IC::NodeStore codec;
    std::string binary;
    std::string const shown = !o.printable.empty() ? "'" + o.printable + "'"
                              : !o.encode.empty()  ? "the chain"
                                                   : "the input";
    if (!o.encode.empty()) {
        TopoVec const topo = parseChain(o.encode);
        try {
            binary = codec.nodecode(topo);
        } catch (std::invalid_argument const& e) {
            throw UsageError("cannot encode '" + o.encode + "': " + e.what());
        }
    } else if (o.fromBinary) {
        binary.assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
        if (binary.empty())
            throw UsageError("no bytes on standard input");
    } else {
        try {
            binary = codec.stringhex(o.printable);
        } catch (std::invalid_argument const& e) {
            throw UsageError("invalid node path '" + o.printable + "': " + e.what());
        }
    }

    // Bytes that decode to a chain which encodes back to other bytes (or to
    // an impossible type) are not a node path.
    TopoVec topo;
    codec.uniqueid2topovec(binary, IC::Node::invalid, topo);
    bool valid = !topo.empty() && !binary.empty();
    for (auto const& pair : topo)
        valid = valid && pair.first < IC::Node::invalid;
    if (valid) {
        try {
            valid = codec.nodecode(topo) == binary;
        } catch (std::invalid_argument const&) {
            valid = false;
        }
    }
    if (!valid)
        throw UsageError(shown + " is not a node path");

    if (o.toBinary) {
        std::cout.write(binary.data(), static_cast<std::streamsize>(binary.size()));
        std::cout.flush();
        return kExitOk;
    }

    std::string const printable = codec.hexstring(binary);
    if (g.json) {
        Json chain = Json::array();
        for (auto it = topo.rbegin(); it != topo.rend(); ++it)
            chain.push_back(
                Json{{"type", it->first}, {"typeName", sensorName(it->first)}, {"instance", it->second}});
        Json bytes = Json::array();
        for (unsigned char c : binary)
            bytes.push_back(static_cast<unsigned int>(c));
        printJson(std::cout, Json{{"printable", printable},
                                  {"length", binary.size()},
                                  {"binary", escaped(binary)},
                                  {"bytes", bytes},
                                  {"chain", chain},
                                  {"hierarchy", hierarchyText(topo)}});
        return kExitOk;
    }
    std::string chain;
    for (auto it = topo.rbegin(); it != topo.rend(); ++it)
        chain += (chain.empty() ? "" : " -> ") + sensorName(it->first) + " " +
                 std::to_string(it->second);
    std::cout << "printable    " << printable << '\n'
              << "length       " << binary.size() << (binary.size() == 1 ? " byte" : " bytes") << '\n'
              << "binary       " << escaped(binary) << '\n'
              << "chain        " << chain << '\n'
              << "hierarchy    " << hierarchyText(topo) << '\n';
    return kExitOk;
}

} // namespace icctl
