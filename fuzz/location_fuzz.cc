// libFuzzer target for the bundle location grammar: the hand-written parser
// must never crash, must stay consistent with its own rewrites, and on short
// inputs must give exactly the groups of the backtracking regex it replaces.

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <regex>
#include <string>

#include "Sorvik/update/location.h"

namespace {

constexpr size_t kRegexLimit = 200;  // std::regex recurses per character

void check(bool condition) {
  if (!condition) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string text(reinterpret_cast<const char*>(data), size);
  sorvik::BundleLocation loc;
  const bool parsed = sorvik::parseLocation(text, &loc);
  const std::string shown = sorvik::redactLocation(text);

  if (parsed) {
    check(text.compare(0, loc.scheme.size() + 3, loc.scheme + "://") == 0);
    check(!loc.host.empty() && loc.host.find('/') == std::string::npos);
    check(loc.path.size() >= 2 && loc.path[0] == '/');
    check(loc.user.empty() == loc.password.empty());
    const std::string url = sorvik::locationWithoutCredentials(text, loc);
    if (loc.hasCredentials()) {
      check(url.size() + loc.user.size() + loc.password.size() + 2 == text.size());
      check(shown.find("***") != std::string::npos && shown.size() <= text.size() + 6 - loc.password.size());
    } else {
      check(url == text);
    }
    const std::string name = sorvik::bundleFileName(loc.path);
    check(name.find('/') == std::string::npos);
    if (sorvik::isPlainFileName(name)) check(name != "." && name != ".." && name.find('\\') == std::string::npos);
  }

  if (size <= kRegexLimit) {
    static const std::regex pattern("^(?:(http|https|smb|ftp))://(?:(.+):(.+)@)?(?:([^/]+))(?:(/.+))");
    std::smatch m;
    const bool matched = std::regex_search(text, m, pattern);
    check(matched == parsed);
    if (matched) {
      check(m[1].str() == loc.scheme && m[2].str() == loc.user && m[3].str() == loc.password &&
            m[4].str() == loc.host && m[5].str() == loc.path);
    }
  }
  return 0;
}
