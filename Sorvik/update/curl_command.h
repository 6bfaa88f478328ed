#pragma once

// What the download hands curl (its argument vector and the configuration
// line on its standard input) and how it reads curl's answers (progress meter
// pieces and exit codes).

#include <cstdint>
#include <string>
#include <vector>

namespace sorvik {

inline constexpr const char kCurlProgram[] = "./curl";
inline constexpr const char kCaBundleFile[] = "curl-ca-bundle.crt";
inline constexpr const char kDefaultUpdateUser[] = "guest";

// The maker's update domain this build trusts (may be empty).
const char* trustedUpdateDomain();

// "user = " and the quoted credentials; the location's own when it carries
// both a user and a password, else the default guest account. No line end.
std::string curlConfigLine(const std::string& user, const std::string& password);

// The argument vector without the URL: certificate checks against the CA
// bundle when `host` lies in `trustedDomain` and the bundle file exists,
// "--insecure" otherwise.
std::vector<std::string> curlArguments(const std::string& bundlePath, const std::string& host,
                                       const std::string& trustedDomain, bool caBundlePresent);

// Every element preceded by one space, for the failure log.
std::string commandLineText(const std::vector<std::string>& args);

// The percentage at the front of one progress-meter piece, by strtoul's base-0
// rules; 0 when there is none or it is no percentage (above 100).
uint32_t progressPercent(const std::string& piece);

}  // namespace sorvik
