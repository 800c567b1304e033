// IC::Number: the numeric code carried by an IC::Error, and the form in which
// versions are exchanged. A Number remembers how it was made (a kind, a plain
// unsigned value or a version); two Numbers are equal when they were made the
// same way from equal values.
#pragma once

#include <IC/CommonExport.h>
#include <IC/Version2.h>

#include <cstdint>
#include <iosfwd>
#include <string>

namespace IC {

class ICCOMMON_API Number {
public:
    // Kinds of code that carry no value of their own. Generic (0) is the code
    // of every plain success and failure result.
    enum KindType : std::uint8_t { Generic = 0 };

    // How the number was made.
    enum class Form : std::uint8_t { Kind, Unsigned, Version };

    explicit Number(Version2 const& version);
    explicit Number(KindType const& kind);
    explicit Number(unsigned int const& value);

    Form getForm() const { return form_; }
    // The kind (Form::Kind), the value (Form::Unsigned), or major << 8 | minor
    // (Form::Version).
    unsigned int getValue() const { return value_; }
    // Meaningful for Form::Version only; {0, 0} otherwise.
    Version2 getVersion() const;

    // "kind 0", "42" or "1.0".
    std::string toString() const;

    bool operator==(Number const& other) const
    {
        return form_ == other.form_ && value_ == other.value_;
    }
    bool operator!=(Number const& other) const { return !(*this == other); }

private:
    Form form_;
    unsigned int value_;
};

ICCOMMON_API std::ostream& operator<<(std::ostream& os, Number const& n);

} // namespace IC
