#include <IC/Error.h>

#include <ostream>

namespace IC {

Error::Error(char const* text, unsigned char status)
    : status_(status), code_(Number::Generic), text_(text ? text : "")
{
}

Error::Error(unsigned char status, Number const& code, std::string const& text)
    : status_(status), code_(code), text_(text)
{
}

Error::operator std::string() const
{
    return "status=" + std::to_string(status_) + " code=" + code_.toString() + " text=" + text_;
}

std::ostream& operator<<(std::ostream& os, Error const& e)
{
    return os << static_cast<std::string>(e);
}

} // namespace IC
