#include "SysfsReader.h"

#include "Log.h"

#include <algorithm>
#include <charconv>
#include <cerrno>
#include <cstdlib>
#include <cstdint>
#include <cstring>

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace linuxhw {

namespace {

// Attribute files are tiny; a bound keeps an odd file (a device node placed
// in an imitation tree) from being read for ever.
constexpr std::size_t kLineLimit = 4096;

std::string normaliseRoot(std::string root)
{
    if (root.empty())
        return "/";
    while (root.size() > 1 && root.back() == '/')
        root.pop_back();
    return root;
}

} // namespace

SysfsReader::SysfsReader(std::string root) : root_(normaliseRoot(std::move(root))) {}

std::string SysfsReader::full(std::string const& rel) const
{
    return root_ == "/" ? "/" + rel : root_ + "/" + rel;
}

SysfsReader::Result SysfsReader::read(std::string const& rel, std::string& out, std::size_t limit,
                                      std::string& why, bool firstLine) const
{
    out.clear();
    // Non-blocking, so that a FIFO cannot hang the poll.
    int const fd = ::open(full(rel).c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0) {
        int const e = errno;
        if (e == ENOENT || e == ENOTDIR)
            return Result::Missing;
        why = std::strerror(e);
        return Result::Unreadable;
    }
    struct stat st {};
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        ::close(fd);
        why = "not a regular file";
        return Result::Unreadable;
    }
    char buf[4096];
    while (out.size() < limit) {
        ssize_t const n = ::read(fd, buf, std::min(sizeof buf, limit - out.size()));
        if (n < 0) {
            if (errno == EINTR)
                continue;
            why = std::strerror(errno);
            ::close(fd);
            return Result::Unreadable;
        }
        if (n == 0)
            break;
        out.append(buf, static_cast<std::size_t>(n));
        // A line's reader needs nothing past its end: no read for the end
        // of the file (a sysfs attribute comes whole in one read).
        if (firstLine && std::memchr(buf, '\n', static_cast<std::size_t>(n)))
            break;
    }
    ::close(fd);
    return Result::Ok;
}

std::optional<std::string> SysfsReader::line(std::string const& rel, bool quiet, bool settle)
{
    std::string raw;
    std::string why;
    switch (read(rel, raw, kLineLimit, why, true)) {
    case Result::Missing:
        return std::nullopt;
    case Result::Unreadable:
        if (!quiet)
            complain(rel, why);
        return std::nullopt;
    case Result::Ok:
        break;
    }
    if (settle && !quiet)
        settled(rel);
    std::size_t const nl = raw.find('\n');
    return trim(nl == std::string::npos ? raw : raw.substr(0, nl));
}

std::optional<std::string> SysfsReader::text(std::string const& rel)
{
    return line(rel, false, true);
}

std::optional<std::string> SysfsReader::quietText(std::string const& rel)
{
    return line(rel, true, false);
}

std::optional<long long> SysfsReader::integer(std::string const& rel)
{
    std::optional<std::string> const t = line(rel, false, false);
    if (!t)
        return std::nullopt;
    std::optional<long long> const v = parseInteger(*t);
    if (!v) {
        complain(rel, "not a number: '" + t->substr(0, 40) + "'");
        return std::nullopt;
    }
    settled(rel);
    return v;
}

std::optional<long long> SysfsReader::count(std::string const& rel)
{
    std::optional<long long> const v = integer(rel);
    if (v && *v < 0) {
        complain(rel, "negative: " + std::to_string(*v));
        return std::nullopt;
    }
    return v;
}

std::optional<long long> SysfsReader::quietInteger(std::string const& rel)
{
    std::optional<std::string> const t = quietText(rel);
    return t ? parseInteger(*t) : std::nullopt;
}

std::optional<std::string> SysfsReader::contents(std::string const& rel, std::size_t limit)
{
    std::string out;
    std::string why;
    switch (read(rel, out, limit, why, false)) {
    case Result::Missing:
        return std::nullopt;
    case Result::Unreadable:
        complain(rel, why);
        return std::nullopt;
    case Result::Ok:
        break;
    }
    settled(rel);
    return out;
}

std::vector<std::string> SysfsReader::list(std::string const& rel)
{
    std::vector<std::string> names;
    DIR* dir = ::opendir(full(rel).c_str());
    if (!dir) {
        if (errno != ENOENT && errno != ENOTDIR)
            complain(rel, std::strerror(errno));
        return names;
    }
    while (dirent* entry = ::readdir(dir)) {
        std::string const name = entry->d_name;
        if (name != "." && name != "..")
            names.push_back(name);
    }
    ::closedir(dir);
    std::sort(names.begin(), names.end());
    return names;
}

bool SysfsReader::exists(std::string const& rel) const
{
    struct stat st {};
    return ::lstat(full(rel).c_str(), &st) == 0;
}

bool SysfsReader::isDirectory(std::string const& rel) const
{
    struct stat st {};
    return ::stat(full(rel).c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

std::string SysfsReader::linkName(std::string const& rel) const
{
    char buf[4096];
    ssize_t const n = ::readlink(full(rel).c_str(), buf, sizeof buf - 1);
    if (n <= 0)
        return std::string();
    std::string target(buf, static_cast<std::size_t>(n));
    while (target.size() > 1 && target.back() == '/')
        target.pop_back();
    std::size_t const slash = target.rfind('/');
    return slash == std::string::npos ? target : target.substr(slash + 1);
}

void SysfsReader::complain(std::string const& rel, std::string const& why)
{
    {
        std::lock_guard<std::mutex> g(m_);
        if (!complained_.insert(rel).second)
            return;
    }
    LHW_LOG(kWarning, "skipping ", full(rel), ": ", why);
}

void SysfsReader::settled(std::string const& rel)
{
    std::lock_guard<std::mutex> g(m_);
    if (!complained_.empty())
        complained_.erase(rel);
}

std::string trim(std::string const& s)
{
    auto const space = [](char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; };
    std::size_t b = 0;
    std::size_t e = s.size();
    while (b < e && space(s[b]))
        ++b;
    while (e > b && space(s[e - 1]))
        --e;
    return s.substr(b, e - b);
}

std::optional<long long> parseInteger(std::string const& s)
{
    // The whole text or nothing: "4\0" "5000" is not 4, "1e3" not 1, and
    // what does not fit in 64 bits is no number.
    long long v = 0;
    char const* const end = s.data() + s.size();
    auto const r = std::from_chars(s.data(), end, v);
    if (s.empty() || r.ec != std::errc() || r.ptr != end)
        return std::nullopt;
    return v;
}

std::optional<unsigned int> numberAfter(std::string const& name, std::string const& prefix)
{
    if (name.size() <= prefix.size() || name.compare(0, prefix.size(), prefix) != 0)
        return std::nullopt;
    unsigned long long v = 0;
    for (std::size_t i = prefix.size(); i < name.size(); ++i) {
        char const c = name[i];
        if (c < '0' || c > '9' || v > 0xFFFFFFFull)
            return std::nullopt;
        v = v * 10 + static_cast<unsigned int>(c - '0');
    }
    return static_cast<unsigned int>(v);
}

std::string milliToText(long long milli, int decimals)
{
    long long div = 1;
    for (int i = decimals; i < 3; ++i)
        div *= 10;
    bool const negative = milli < 0;
    unsigned long long mag = negative ? 0ull - static_cast<unsigned long long>(milli)
                                      : static_cast<unsigned long long>(milli);
    mag = (mag + static_cast<unsigned long long>(div) / 2) / static_cast<unsigned long long>(div);
    unsigned long long scale = 1;
    for (int i = 0; i < decimals; ++i)
        scale *= 10;
    std::string out = std::to_string(mag / scale);
    if (decimals > 0) {
        std::string frac = std::to_string(mag % scale);
        out += '.' + std::string(static_cast<std::size_t>(decimals) - frac.size(), '0') + frac;
    }
    return negative && mag != 0 ? "-" + out : out;
}

unsigned int stableHash16(std::string const& text)
{
    std::uint32_t h = 2166136261u;
    for (unsigned char c : text) {
        h ^= c;
        h *= 16777619u;
    }
    return static_cast<unsigned int>((h >> 16) ^ (h & 0xFFFFu));
}

} // namespace linuxhw
