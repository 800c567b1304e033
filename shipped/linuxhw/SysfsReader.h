// SysfsReader: the plug-in's only access to the machine. It reads the small
// text files of sysfs and procfs below a root directory ("/" on a real
// machine, an imitation tree in tests and demos).
//
// A file that is missing gives "no value" quietly: optional attributes are
// missing all the time. A file that exists but cannot be read, or whose
// contents are not what they should be, gives "no value" and one warning
// line; the line is not repeated on every poll, only after the file has
// read well again. Every member is safe to call from several threads.
#pragma once

#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace linuxhw {

class SysfsReader {
public:
    explicit SysfsReader(std::string root);

    std::string const& root() const { return root_; }
    // The file system path of rel (a path relative to the root).
    std::string full(std::string const& rel) const;

    // First line of the file, trimmed.
    std::optional<std::string> text(std::string const& rel);
    // A decimal integer.
    std::optional<long long> integer(std::string const& rel);
    // One that cannot be negative (a size, a count, a speed); a negative
    // value is as bad as garbage.
    std::optional<long long> count(std::string const& rel);
    // The same without any log line, for attributes the kernel refuses to
    // read in ordinary states (the speed of a port without link).
    std::optional<std::string> quietText(std::string const& rel);
    std::optional<long long> quietInteger(std::string const& rel);
    // The whole file (procfs tables), at most limit bytes.
    std::optional<std::string> contents(std::string const& rel, std::size_t limit = 1 << 20);

    // Names in a directory, sorted; none when it is missing or unreadable.
    std::vector<std::string> list(std::string const& rel);
    // True when the entry exists (a dangling link counts).
    bool exists(std::string const& rel) const;
    bool isDirectory(std::string const& rel) const;
    // Last component of a symbolic link's target; "" when rel is no link.
    std::string linkName(std::string const& rel) const;

    // One warning line for rel, unless one was written since it last read well.
    void complain(std::string const& rel, std::string const& why);

private:
    enum class Result { Ok, Missing, Unreadable };
    // With firstLine it stops once a newline has been read.
    Result read(std::string const& rel, std::string& out, std::size_t limit, std::string& why,
                bool firstLine) const;
    std::optional<std::string> line(std::string const& rel, bool quiet, bool settle);
    void settled(std::string const& rel);

    std::string root_;
    std::mutex m_; // guards complained_
    std::set<std::string> complained_;
};

// Whitespace off both ends.
std::string trim(std::string const& s);
// A whole decimal integer that fits in 64 bits ("42", "-1"); nothing for
// anything else (signs other than '-', spaces, exponents, embedded NULs).
std::optional<long long> parseInteger(std::string const& s);
// The number after prefix in name ("cpu12", "cpu" -> 12); nothing when the
// rest is not all digits.
std::optional<unsigned int> numberAfter(std::string const& name, std::string const& prefix);
// A thousandth-based value as decimal text with the given decimals
// (45500, 1 -> "45.5"), rounded half away from zero.
std::string milliToText(long long milli, int decimals);
// A 16-bit digest of a name (FNV-1a folded), for instances that must not
// depend on what else is installed.
unsigned int stableHash16(std::string const& text);

} // namespace linuxhw
