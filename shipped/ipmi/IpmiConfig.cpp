#include "IpmiConfig.h"

#include "Log.h"

#include <ipmi_monitoring.h>
#include <sys/stat.h>

#include <algorithm>
#include <cctype>
#include <fstream>
#include <map>
#include <optional>
#include <sstream>

namespace ipmi {

namespace {

std::string trim(std::string const& s)
{
    auto const b = s.find_first_not_of(" \t\r");
    if (b == std::string::npos)
        return std::string();
    return s.substr(b, s.find_last_not_of(" \t\r") - b + 1);
}

std::optional<unsigned long> number(std::string const& s, unsigned long max)
{
    if (s.empty() || s.size() > 9 || s.find_first_not_of("0123456789") != std::string::npos)
        return std::nullopt;
    unsigned long const n = std::stoul(s);
    return n <= max ? std::optional<unsigned long>(n) : std::nullopt;
}

// Reads the password file; the error text when it cannot be used.
std::string readPassword(std::string const& file, std::string& password)
{
    struct stat st {};
    if (::stat(file.c_str(), &st) != 0)
        return "password_file " + file + " does not exist";
    if ((st.st_mode & (S_IRWXG | S_IRWXO)) != 0)
        return "password_file " + file + " is readable by group or others (chmod 600 it)";
    std::ifstream in(file);
    if (!in || !std::getline(in, password))
        return "password_file " + file + " cannot be read";
    if (!password.empty() && password.back() == '\r')
        password.pop_back();
    if (password.size() > 20)
        return "password in " + file + " is longer than 20 characters";
    return std::string();
}

// The value of one key into b; the error text when the value is bad.
std::string apply(BmcConfig& b, std::string const& key, std::string const& value, std::string& passwordFile)
{
    if (key == "host") {
        std::string host = value;
        auto const colon = value.rfind(':');
        if (colon != std::string::npos && value.find(':') == colon) {
            host = value.substr(0, colon);
            auto const port = number(value.substr(colon + 1), 65535);
            if (!port || *port == 0)
                return "bad port in '" + value + "'";
            b.port = static_cast<unsigned int>(*port);
        }
        if (host.empty())
            return "empty host";
        b.host = host;
    } else if (key == "user") {
        if (value.size() > 16)
            return "user is longer than 16 characters";
        b.user = value;
    } else if (key == "password_file") {
        passwordFile = value;
    } else if (key == "privilege") {
        static std::map<std::string, int> const levels{{"user", IPMI_MONITORING_PRIVILEGE_LEVEL_USER},
                                                       {"operator", IPMI_MONITORING_PRIVILEGE_LEVEL_OPERATOR},
                                                       {"admin", IPMI_MONITORING_PRIVILEGE_LEVEL_ADMIN}};
        auto const it = levels.find(value);
        if (it == levels.end())
            return "privilege must be user, operator or admin, not '" + value + "'";
        b.privilege = it->second;
    } else if (key == "cipher_suite") {
        auto const n = number(value, 17);
        if (!n)
            return "cipher_suite must be 0..17, not '" + value + "'";
        b.cipherSuite = static_cast<int>(*n);
    } else if (key == "workarounds") {
        static std::map<std::string, unsigned int> const names{
            {"authcap", IPMI_MONITORING_WORKAROUND_FLAGS_PROTOCOL_VERSION_2_0_AUTHENTICATION_CAPABILITIES},
            {"intel20", IPMI_MONITORING_WORKAROUND_FLAGS_PROTOCOL_VERSION_2_0_INTEL_2_0_SESSION},
            {"supermicro20", IPMI_MONITORING_WORKAROUND_FLAGS_PROTOCOL_VERSION_2_0_SUPERMICRO_2_0_SESSION},
            {"sun20", IPMI_MONITORING_WORKAROUND_FLAGS_PROTOCOL_VERSION_2_0_SUN_2_0_SESSION},
            {"opensesspriv", IPMI_MONITORING_WORKAROUND_FLAGS_PROTOCOL_VERSION_2_0_OPEN_SESSION_PRIVILEGE},
            {"integritycheckvalue", IPMI_MONITORING_WORKAROUND_FLAGS_PROTOCOL_VERSION_2_0_NON_EMPTY_INTEGRITY_CHECK_VALUE},
            {"nochecksumcheck", IPMI_MONITORING_WORKAROUND_FLAGS_PROTOCOL_VERSION_2_0_NO_CHECKSUM_CHECK}};
        std::stringstream list(value);
        std::string name;
        while (std::getline(list, name, ',')) {
            auto const it = names.find(trim(name));
            if (it == names.end())
                return "unknown workaround '" + trim(name) + "'";
            b.workarounds |= it->second;
        }
    } else {
        return "unknown key '" + key + "'";
    }
    return std::string();
}

} // namespace

std::vector<BmcConfig> readConfig(std::string const& path)
{
    std::vector<BmcConfig> out;
    std::ifstream in(path);
    if (!in)
        return out;
    std::optional<BmcConfig> current;
    std::string passwordFile;
    bool bad = false;
    unsigned int sectionLine = 0;
    auto finish = [&]() {
        if (current && !bad) {
            std::string why;
            if (current->host.empty())
                why = "no host";
            else if (passwordFile.empty())
                why = "no password_file";
            else
                why = readPassword(passwordFile, current->password);
            if (why.empty())
                out.push_back(*current);
            else
                IPMI_LOG(kError, path, ":", sectionLine, ": BMC ", current->name, " left out: ", why);
        }
        current.reset();
        passwordFile.clear();
        bad = false;
    };
    std::string line;
    for (unsigned int n = 1; std::getline(in, line); ++n) {
        line = trim(line.substr(0, line.find('#')));
        if (line.empty())
            continue;
        if (line.front() == '[') {
            finish();
            sectionLine = n;
            std::string const inner = line.back() == ']' ? trim(line.substr(1, line.size() - 2)) : "";
            if (inner.compare(0, 4, "bmc ") != 0 || trim(inner.substr(4)).empty()) {
                IPMI_LOG(kError, path, ":", n, ": expected [bmc NAME], found '", line, "'");
                current = BmcConfig();
                bad = true;
                continue;
            }
            current = BmcConfig();
            current->name = trim(inner.substr(4));
            continue;
        }
        auto const eq = line.find('=');
        std::string const why = !current ? "a setting outside a [bmc NAME] section"
                                : eq == std::string::npos
                                    ? "expected 'key = value', found '" + line + "'"
                                    : apply(*current, trim(line.substr(0, eq)), trim(line.substr(eq + 1)), passwordFile);
        if (!why.empty() && !bad) {
            IPMI_LOG(kError, path, ":", n, ": ", why, current ? "; BMC " + current->name + " left out" : "");
            bad = current.has_value();
        }
    }
    finish();
    return out;
}

} // namespace ipmi
