#pragma once

// The bundle location URL: the fixed grammar it must follow, the parts taken
// from it, and the forms of it that may be shown or handed on without the
// password it may carry.
//
// Grammar (ECMAScript, case-sensitive, anchored at the start only):
//   ^(?:(http|https|smb|ftp))://(?:(.+):(.+)@)?(?:([^/]+))(?:(/.+))
// parseLocation gives exactly the groups a backtracking matcher gives, in
// time linear in the length of the text and with constant stack.

#include <cstddef>
#include <string>
#include <string_view>

namespace sorvik {

struct BundleLocation {
  std::string scheme;
  std::string user;      // empty unless the credentials group matched
  std::string password;  // likewise
  std::string host;      // includes a port, if any
  std::string path;      // from the first '/' after the host

  // Byte offsets into the parsed text, for rewriting it. Set only when the
  // credentials group matched: [credentialsBegin, passwordEnd] is
  // "user:password@" and [passwordBegin, passwordEnd) the password.
  size_t credentialsBegin = std::string::npos;
  size_t passwordBegin = std::string::npos;
  size_t passwordEnd = std::string::npos;

  bool hasCredentials() const { return credentialsBegin != std::string::npos; }
};

// False when `text` does not match the grammar; `out` is then unspecified.
bool parseLocation(std::string_view text, BundleLocation* out);

// `text` with any password it carries shown as "***": the one the grammar
// finds and the one a URL reader would find in the authority part.
std::string redactLocation(std::string_view text);

// A user as the grammar took it may hold a URL reader's "user:password@...";
// everything after its first ':' is shown as "***".
std::string redactUser(const std::string& user);

// The URL to fetch: `text` without the "user:password@" the grammar found
// (the credentials travel separately). Unchanged when there are none.
std::string locationWithoutCredentials(std::string_view text, const BundleLocation& parsed);

// The text after the last '/' of `path`, verbatim.
std::string bundleFileName(const std::string& path);

// False for names that could leave the download directory or name something
// other than a plain file in it: empty, "." or "..", or holding a path
// separator of either kind, a colon (drive or stream) or a NUL.
bool isPlainFileName(const std::string& name);

}  // namespace sorvik
