#include "WebConfig.h"

#include <crypt.h>
#include <openssl/crypto.h>
#include <openssl/evp.h>

#include <fstream>
#include <memory>
#include <vector>

namespace icd {
namespace {

std::string trim(std::string s)
{
    auto const comment = s.find(" #");
    if (comment != std::string::npos)
        s.erase(comment);
    if (!s.empty() && s[0] == '#')
        s.clear();
    while (!s.empty() && (s.back() == ' ' || s.back() == '\t' || s.back() == '\r'))
        s.pop_back();
    std::size_t i = 0;
    while (i < s.size() && (s[i] == ' ' || s[i] == '\t'))
        ++i;
    s.erase(0, i);
    if (s.size() >= 2 && (s[0] == '"' || s[0] == '\'') && s.back() == s[0])
        s = s.substr(1, s.size() - 2);
    return s;
}

// crypt_r of a password against a stored hash (or setting); "" on failure.
std::string cryptWith(std::string const& password, std::string const& setting)
{
    auto data = std::make_unique<crypt_data>();
    char const* out = crypt_r(password.c_str(), setting.c_str(), data.get());
    if (!out || out[0] == '*')
        return std::string();
    return out;
}

bool knownHash(std::string const& hash)
{
    for (char const* prefix : {"$2a$", "$2b$", "$2y$", "$5$", "$6$", "$y$"})
        if (hash.rfind(prefix, 0) == 0)
            return !cryptWith("", hash).empty();
    return false;
}

} // namespace

WebConfig WebConfig::load(std::string const& file)
{
    std::ifstream in(file);
    if (!in)
        throw WebConfigError("cannot read the web configuration '" + file + "'");
    WebConfig c;
    std::string section;
    int lineNo = 0;
    auto fail = [&](std::string const& what) {
        throw WebConfigError(file + ":" + std::to_string(lineNo) + ": " + what);
    };
    for (std::string raw; std::getline(in, raw);) {
        ++lineNo;
        bool const indented = !raw.empty() && (raw[0] == ' ' || raw[0] == '\t');
        std::string const line = trim(raw);
        if (line.empty())
            continue;
        auto const colon = line.find(':');
        if (colon == std::string::npos)
            fail("expected 'key: value'");
        std::string const key = trim(line.substr(0, colon));
        std::string const value = trim(line.substr(colon + 1));
        if (!indented) {
            if ((key != "tls_server_config" && key != "basic_auth_users") || !value.empty())
                fail("unknown section '" + key + "' (tls_server_config, basic_auth_users)");
            section = key;
        } else if (section == "tls_server_config") {
            if (key == "cert_file")
                c.certFile_ = value;
            else if (key == "key_file")
                c.keyFile_ = value;
            else
                fail("unknown TLS setting '" + key + "' (cert_file, key_file)");
        } else if (section == "basic_auth_users") {
            if (key.empty())
                fail("empty user name");
            if (!knownHash(value))
                fail("the password of '" + key +
                     "' is not a bcrypt or SHA-crypt hash (make one with mkpasswd -m bcrypt)");
            c.users_[key] = value;
        } else {
            fail("setting outside a section");
        }
    }
    if (c.certFile_.empty() != c.keyFile_.empty())
        throw WebConfigError(file + ": tls_server_config needs both cert_file and key_file");
    for (std::string const* f : {&c.certFile_, &c.keyFile_})
        if (!f->empty() && !std::ifstream(*f))
            throw WebConfigError(file + ": cannot read '" + *f + "'");
    return c;
}

bool WebConfig::authorized(std::string const& authorization) const
{
    std::string const scheme = "Basic ";
    if (authorization.rfind(scheme, 0) != 0)
        return false;
    std::string const encoded = authorization.substr(scheme.size());
    if (encoded.empty() || encoded.size() > 1024 || encoded.size() % 4 != 0)
        return false;
    std::vector<unsigned char> decoded(encoded.size());
    int const n = EVP_DecodeBlock(decoded.data(),
                                  reinterpret_cast<unsigned char const*>(encoded.data()),
                                  static_cast<int>(encoded.size()));
    if (n < 0)
        return false;
    std::size_t len = static_cast<std::size_t>(n);
    // EVP_DecodeBlock counts the padding as zero bytes.
    for (std::size_t i = encoded.size(); i > 0 && encoded[i - 1] == '=' && len > 0; --i)
        --len;
    std::string const pair(decoded.begin(), decoded.begin() + static_cast<std::ptrdiff_t>(len));
    auto const colon = pair.find(':');
    if (colon == std::string::npos)
        return false;
    auto const user = users_.find(pair.substr(0, colon));
    if (user == users_.end())
        return false;
    std::string const computed = cryptWith(pair.substr(colon + 1), user->second);
    return computed.size() == user->second.size() &&
           CRYPTO_memcmp(computed.data(), user->second.data(), computed.size()) == 0;
}

} // namespace icd
