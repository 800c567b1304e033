// HGLog::HGMessageBuffer: composes one log message.
//
// Strings and integers are appended directly; anything else goes through the
// buffer's stream (operator std::ostream&), which is created on first use.
#pragma once

#include <IC/CommonExport.h>

#include <memory>
#include <ostream>
#include <sstream>
#include <string>

namespace HGLog {

class ICCOMMON_API HGMessageBuffer {
public:
    HGMessageBuffer();
    ~HGMessageBuffer();
    HGMessageBuffer(HGMessageBuffer const&) = delete;
    HGMessageBuffer& operator=(HGMessageBuffer const&) = delete;

    HGMessageBuffer& operator<<(char const* s);
    HGMessageBuffer& operator<<(std::string const& s);
    HGMessageBuffer& operator<<(int v);
    HGMessageBuffer& operator<<(unsigned int v);
    HGMessageBuffer& operator<<(unsigned long v);

    // The buffer's stream; what is written to it follows what was appended.
    operator std::ostream&();

    // The finished message; the buffer is left empty. The first form is for
    // a chain that ended on the buffer, the second for one that ended on its
    // stream.
    std::string str(HGMessageBuffer& buf);
    std::string str(std::ostream& os);

private:
    std::string take();
    std::string text_;
    std::unique_ptr<std::ostringstream> stream_;
};

// Values the buffer cannot append itself are written with the standard stream
// operator: pointers as untyped addresses, unsigned char as a character, and
// any type that has an operator<< for std::ostream (IC::Error, IC::Number...).
template <class T>
std::ostream& operator<<(HGMessageBuffer& buf, T const& value)
{
    std::ostream& os = buf;
    return os << value;
}

} // namespace HGLog
