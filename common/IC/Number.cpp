#include <IC/Number.h>

#include <ostream>

namespace IC {

Number::Number(Version2 const& version)
    : form_(Form::Version), value_((unsigned int)version.major << 8 | version.minor)
{
}

Number::Number(KindType const& kind) : form_(Form::Kind), value_(kind) {}

Number::Number(unsigned int const& value) : form_(Form::Unsigned), value_(value) {}

Version2 Number::getVersion() const
{
    if (form_ != Form::Version)
        return Version2{0, 0};
    return Version2{static_cast<std::uint8_t>(value_ >> 8), static_cast<std::uint8_t>(value_ & 0xFF)};
}

std::string Number::toString() const
{
    switch (form_) {
    case Form::Kind:
        return "kind " + std::to_string(value_);
    case Form::Version:
        return std::to_string(value_ >> 8) + "." + std::to_string(value_ & 0xFF);
    case Form::Unsigned:
        break;
    }
    return std::to_string(value_);
}

std::ostream& operator<<(std::ostream& os, Number const& n)
{
    return os << n.toString();
}

} // namespace IC
