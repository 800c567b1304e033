// --web-config FILE: TLS and basic authentication, in the YAML subset the
// Prometheus exporters' web configuration uses:
//
//   tls_server_config:
//     cert_file: /etc/icd/icd.crt
//     key_file: /etc/icd/icd.key
//   basic_auth_users:
//     prometheus: $2y$10$...        # bcrypt, or $5$/$6$ SHA-crypt
//
// Passwords are checked with libcrypt (crypt_r); nothing here is crypto of
// its own.
#pragma once

#include <map>
#include <stdexcept>
#include <string>

namespace icd {

struct WebConfigError : std::runtime_error {
    using std::runtime_error::runtime_error;
};

class WebConfig {
public:
    WebConfig() = default;
    // Throws WebConfigError naming the file and line of what is wrong.
    static WebConfig load(std::string const& file);

    bool tls() const { return !certFile_.empty(); }
    std::string const& certFile() const { return certFile_; }
    std::string const& keyFile() const { return keyFile_; }
    bool authRequired() const { return !users_.empty(); }

    // The value of an Authorization header names a user whose password
    // matches its hash.
    bool authorized(std::string const& authorization) const;

private:
    std::string certFile_, keyFile_;
    std::map<std::string, std::string> users_; // name -> crypt hash
};

} // namespace icd
