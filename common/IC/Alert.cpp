#include <IC/Alert.h>

#include <ostream>
#include <utility>

namespace IC {

Alert::Alert(unsigned char severity, ClassType cls, std::vector<std::string> nodePaths,
             unsigned int status, std::string message)
    : severity_(severity), class_(cls), status_(status), nodePaths_(std::move(nodePaths)),
      message_(std::move(message))
{
}

Alert::operator std::string() const
{
    static char const digits[] = "0123456789abcdef";
    std::string out = "time=" + timeStamp_.toIso8601() + " severity=" + std::to_string(severity_) +
                      " class=" + std::to_string(class_) + " status=" + std::to_string(status_) +
                      " paths={";
    for (std::size_t i = 0; i < nodePaths_.size(); ++i) {
        if (i)
            out += ',';
        for (unsigned char c : nodePaths_[i]) {
            out += digits[c >> 4];
            out += digits[c & 15];
        }
    }
    out += "} message=";
    out += message_;
    return out;
}

std::ostream& operator<<(std::ostream& os, Alert const& alert)
{
    return os << static_cast<std::string>(alert);
}

} // namespace IC
