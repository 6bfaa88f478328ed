#include "Sorvik/update/location.h"

#include <algorithm>
#include <array>

namespace sorvik {
namespace {

constexpr size_t npos = std::string::npos;

// ECMAScript '.' matches everything but these.
bool isLineBreak(char c) { return c == '\n' || c == '\r'; }

size_t firstLineBreak(std::string_view s, size_t from) {
  const size_t at = s.find_first_of("\r\n", from);
  return at == npos ? s.size() : at;
}

// Length of "<scheme>://" at the front of `text`, 0 when there is none. At
// most one alternative can be followed by "://", so backtracking over the
// alternation cannot change the outcome.
size_t schemePrefixLength(std::string_view text) {
  static constexpr std::array<std::string_view, 4> kSchemes = {"http", "https", "smb", "ftp"};
  for (std::string_view scheme : kSchemes) {
    if (text.size() >= scheme.size() + 3 && text.substr(0, scheme.size()) == scheme &&
        text.substr(scheme.size(), 3) == "://") {
      return scheme.size() + 3;
    }
  }
  return 0;
}

// Whether "([^/]+)(/.+)" matches at `hostBegin`, given the first '/' at or
// after it (npos if none). [^/]+ can only stop at a '/', so the host is the
// whole run up to that slash and the match is decided without backtracking.
bool hostAndPathMatchAt(std::string_view s, size_t hostBegin, size_t slash) {
  return hostBegin < s.size() && s[hostBegin] != '/' && slash != npos && slash + 1 < s.size() &&
         !isLineBreak(s[slash + 1]);
}

}  // namespace

bool parseLocation(std::string_view text, BundleLocation* out) {
  const size_t restBegin = schemePrefixLength(text);
  if (restBegin == 0) return false;
  const std::string_view s = text.substr(restBegin);

  // The credentials group "(.+):(.+)@" cannot cross a line break. Trying the
  // user longest-first and then the password longest-first, the first success
  // is: the last '@' (before any line break) after which a host and path
  // match, and the last ':' that still leaves a non-empty password before it.
  const size_t credentialsLimit = firstLineBreak(s, 0);
  size_t at = npos;
  size_t slashAfter = npos;  // first '/' at or after i + 1
  for (size_t i = s.size(); i-- > 0;) {
    if (i < credentialsLimit && s[i] == '@' && hostAndPathMatchAt(s, i + 1, slashAfter)) {
      at = i;
      break;
    }
    if (s[i] == '/') slashAfter = i;
  }
  size_t colon = npos;
  if (at != npos && at >= 3) {
    colon = s.rfind(':', at - 2);
    if (colon == 0) colon = npos;
  }

  size_t hostBegin = 0;
  if (colon != npos) {
    out->user.assign(s.substr(0, colon));
    out->password.assign(s.substr(colon + 1, at - colon - 1));
    out->credentialsBegin = restBegin;
    out->passwordBegin = restBegin + colon + 1;
    out->passwordEnd = restBegin + at;
    hostBegin = at + 1;
  } else {
    out->user.clear();
    out->password.clear();
    out->credentialsBegin = out->passwordBegin = out->passwordEnd = npos;
  }
  const size_t slash = hostBegin < s.size() ? s.find('/', hostBegin) : npos;
  if (!hostAndPathMatchAt(s, hostBegin, slash)) return false;

  out->scheme.assign(text.substr(0, restBegin - 3));
  out->host.assign(s.substr(hostBegin, slash - hostBegin));
  out->path.assign(s.substr(slash, firstLineBreak(s, slash + 1) - slash));
  return true;
}

std::string redactLocation(std::string_view text) {
  // Two readings can disagree on where a password lies: the grammar's (which
  // may find credentials inside the path) and a URL reader's (the authority
  // part before the first '/'). Both are masked.
  struct Range {
    size_t begin = npos;
    size_t end = npos;
  };
  Range byGrammar;
  BundleLocation parsed;
  if (parseLocation(text, &parsed) && parsed.hasCredentials()) {
    byGrammar = {parsed.passwordBegin, parsed.passwordEnd};
  }
  Range byUrlReader;
  const size_t marker = text.find("://");
  if (marker != npos) {
    const size_t authorityBegin = marker + 3;
    const size_t authorityEnd = std::min(text.find('/', authorityBegin), text.size());
    const std::string_view authority = text.substr(authorityBegin, authorityEnd - authorityBegin);
    const size_t atSign = authority.rfind('@');
    const size_t colon = atSign == npos ? npos : authority.substr(0, atSign).find(':');
    if (colon != npos && colon + 1 < atSign) byUrlReader = {authorityBegin + colon + 1, authorityBegin + atSign};
  }

  Range first = byUrlReader.begin <= byGrammar.begin ? byUrlReader : byGrammar;
  Range second = byUrlReader.begin <= byGrammar.begin ? byGrammar : byUrlReader;
  if (second.begin != npos && second.begin <= first.end) {  // overlapping: one mask
    first.end = std::max(first.end, second.end);
    second = Range{};
  }
  std::string shown;
  size_t copied = 0;
  for (const Range& range : {first, second}) {
    if (range.begin == npos) continue;
    shown.append(text.substr(copied, range.begin - copied));
    shown += "***";
    copied = range.end;
  }
  shown.append(text.substr(copied));
  return shown;
}

std::string redactUser(const std::string& user) {
  const size_t colon = user.find(':');
  return colon == npos ? user : user.substr(0, colon + 1) + "***";
}

std::string locationWithoutCredentials(std::string_view text, const BundleLocation& parsed) {
  if (!parsed.hasCredentials()) return std::string(text);
  std::string url(text.substr(0, parsed.credentialsBegin));
  url += text.substr(parsed.passwordEnd + 1);
  return url;
}

std::string bundleFileName(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == npos ? path : path.substr(slash + 1);
}

bool isPlainFileName(const std::string& name) {
  if (name.empty() || name == "." || name == "..") return false;
  return name.find_first_of(std::string_view("/\\:\0", 4)) == npos;
}

}  // namespace sorvik
