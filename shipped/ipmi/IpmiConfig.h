// IpmiConfig: the out-of-band BMCs of the configuration file, one section
// per BMC:
//   [bmc rack12-node3]            # the name shown on its chassis node
//   host = 10.1.2.3:623           # port optional, default 623
//   user = monitor
//   password_file = /etc/instrumentationcontrol/rack12-node3.pw
//   privilege = operator          # user | operator | admin
//   cipher_suite = 3
//   workarounds = opensesspriv    # FreeIPMI workaround names, comma separated
// A section with an error is left out with one error line naming the file
// and line; the others load. Passwords come only from a file that is not
// group or world readable.
#pragma once

#include <string>
#include <vector>

namespace ipmi {

struct BmcConfig {
    std::string name;  // empty: the in-band BMC
    std::string host;
    unsigned int port = 623;
    std::string user;
    std::string password;
    int privilege = 1; // operator
    int cipherSuite = 3;
    unsigned int workarounds = 0;
};

// The BMCs of the file at path; a file that does not exist has none.
std::vector<BmcConfig> readConfig(std::string const& path);

} // namespace ipmi
