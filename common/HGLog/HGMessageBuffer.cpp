#include <HGLog/HGMessageBuffer.h>

namespace HGLog {

HGMessageBuffer::HGMessageBuffer() = default;
HGMessageBuffer::~HGMessageBuffer() = default;

// Once the stream exists everything goes through it, so that the parts stay
// in the order they were appended.
HGMessageBuffer& HGMessageBuffer::operator<<(char const* s)
{
    if (!s)
        s = "(null)";
    if (stream_)
        *stream_ << s;
    else
        text_ += s;
    return *this;
}

HGMessageBuffer& HGMessageBuffer::operator<<(std::string const& s)
{
    if (stream_)
        *stream_ << s;
    else
        text_ += s;
    return *this;
}

HGMessageBuffer& HGMessageBuffer::operator<<(int v)
{
    if (stream_)
        *stream_ << v;
    else
        text_ += std::to_string(v);
    return *this;
}

HGMessageBuffer& HGMessageBuffer::operator<<(unsigned int v)
{
    if (stream_)
        *stream_ << v;
    else
        text_ += std::to_string(v);
    return *this;
}

HGMessageBuffer& HGMessageBuffer::operator<<(unsigned long v)
{
    if (stream_)
        *stream_ << v;
    else
        text_ += std::to_string(v);
    return *this;
}

HGMessageBuffer::operator std::ostream&()
{
    if (!stream_) {
        stream_ = std::make_unique<std::ostringstream>();
        *stream_ << text_;
        text_.clear();
    }
    return *stream_;
}

std::string HGMessageBuffer::take()
{
    std::string out;
    if (stream_) {
        out = stream_->str();
        stream_.reset();
    } else {
        out.swap(text_);
    }
    text_.clear();
    return out;
}

std::string HGMessageBuffer::str(HGMessageBuffer&)
{
    return take();
}

std::string HGMessageBuffer::str(std::ostream&)
{
    return take();
}

} // namespace HGLog
