// IC::Alert: one alert raised by a plug-in.
//
// Classes with a meaning to the library: 3 announces a node (NodeArrival),
// 4 says that the nodes at the alert's paths were removed (NodeRemoval);
// simple-alert subscribers also see class 5 as an event of its own.
// Status 1 means normal (the condition cleared); every other status asserts.
// Node paths are binary node paths, not their printable hexadecimal form.
#pragma once

#include <IC/CommonExport.h>
#include <IC/Error.h>
#include <SD/DateTime.h>

#include <cstdint>
#include <iosfwd>
#include <string>
#include <vector>

namespace IC {

class ICCOMMON_API Alert {
public:
    enum ClassType : std::uint8_t { NodeArrival = 3, NodeRemoval = 4 };

    // The time stamp is now.
    Alert(unsigned char severity, ClassType cls, std::vector<std::string> nodePaths,
          unsigned int status, std::string message);

    SD::DateTime getTimeStamp() const { return timeStamp_; }
    unsigned char getSeverity() const { return severity_; }
    ClassType getClass() const { return class_; }
    unsigned int getStatus() const { return status_; }
    std::vector<std::string> getNodePaths() const { return nodePaths_; }
    // The same paths without a copy.
    std::vector<std::string> const& nodePaths() const { return nodePaths_; }
    std::string getMessage() const { return message_; }

    // One line for logs: time, severity, class, status, the paths in
    // hexadecimal and the message.
    operator std::string() const;

private:
    SD::DateTime timeStamp_;
    unsigned char severity_;
    ClassType class_;
    unsigned int status_;
    std::vector<std::string> nodePaths_;
    std::string message_;
};

// Writes the one-line rendering.
ICCOMMON_API std::ostream& operator<<(std::ostream& os, Alert const& alert);

// The callback through which alerts are delivered: the alerts and the context
// given when registering. The library ignores its result.
using AlertCallBack = Error (*)(std::vector<Alert> const& alerts, void const* context);

} // namespace IC
