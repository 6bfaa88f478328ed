#include "Sorvik/update/location.h"

#include <gtest/gtest.h>

#include <random>
#include <regex>
#include <string>

namespace sorvik {
namespace {

constexpr char kPattern[] = "^(?:(http|https|smb|ftp))://(?:(.+):(.+)@)?(?:([^/]+))(?:(/.+))";

struct Groups {
  bool matched = false;
  std::string scheme, user, password, host, path;
  bool operator==(const Groups& o) const {
    return matched == o.matched && (!matched || (scheme == o.scheme && user == o.user && password == o.password &&
                                                 host == o.host && path == o.path));
  }
};

std::ostream& operator<<(std::ostream& os, const Groups& g) {
  if (!g.matched) return os << "(no match)";
  return os << "[" << g.scheme << "|" << g.user << "|" << g.password << "|" << g.host << "|" << g.path << "]";
}

Groups byRegex(const std::string& text) {
  static const std::regex pattern(kPattern, std::regex::ECMAScript);
  std::smatch m;
  Groups g;
  if (!std::regex_search(text, m, pattern)) return g;
  g = {true, m[1].str(), m[2].str(), m[3].str(), m[4].str(), m[5].str()};
  return g;
}

Groups byParser(const std::string& text) {
  BundleLocation loc;
  Groups g;
  if (!parseLocation(text, &loc)) return g;
  g = {true, loc.scheme, loc.user, loc.password, loc.host, loc.path};
  return g;
}

std::string printable(const std::string& s) {
  std::string out;
  for (unsigned char c : s) {
    if (c < 0x20) {
      out += "\\x" + std::to_string(c);
    } else {
      out += static_cast<char>(c);
    }
  }
  return out;
}

TEST(LocationTest, GroupsEqualBacktrackingRegexOnGeneratedLocations) {
  // Texts dense in the characters the grammar turns on, behind prefixes that
  // pass or nearly pass the scheme.
  static const char* const kPrefixes[] = {"http://", "https://", "smb://", "ftp://", "HTTP://", "http:/",
                                          "ftps://", "http://", "https://", "", "x"};
  static const char kAlphabet[] = {':', '@', '/', 'a', 'b', '.', '\n', '\r', '\0', '?', '\\', ':', '@', '/'};
  std::mt19937 rng(20261207);
  std::uniform_int_distribution<size_t> prefix(0, std::size(kPrefixes) - 1);
  std::uniform_int_distribution<size_t> letter(0, std::size(kAlphabet) - 1);
  int matches = 0;
  int withCredentials = 0;
  auto randomRun = [&](size_t maxLength) {
    std::string run;
    for (size_t n = std::uniform_int_distribution<size_t>(0, maxLength)(rng); n > 0; --n) run += kAlphabet[letter(rng)];
    return run;
  };
  for (int i = 0; i < 20000; ++i) {
    std::string text = kPrefixes[prefix(rng)];
    if (i % 2 == 0) {
      text += randomRun(14);
    } else {
      // Shaped like "user:password@host/path", each part noisy.
      text += randomRun(3) + ":" + randomRun(3) + "@" + randomRun(3) + "/" + randomRun(4);
    }
    const Groups expected = byRegex(text);
    ASSERT_EQ(byParser(text), expected) << "location: " << printable(text);
    matches += expected.matched;
    withCredentials += !expected.user.empty();
  }
  // The generator must exercise both branches of the credentials group.
  EXPECT_GT(matches, 2000);
  EXPECT_GT(withCredentials, 500);
}

TEST(LocationTest, ReadsGroupsAsTheGrammarDoes) {
  EXPECT_EQ(byParser("http://h:8080/d/f.zip"), (Groups{true, "http", "", "", "h:8080", "/d/f.zip"}));
  // Both credential groups are greedy.
  EXPECT_EQ(byParser("ftp://a:b:c@h/f"), (Groups{true, "ftp", "a:b", "c", "h", "/f"}));
  EXPECT_EQ(byParser("ftp://a:p@q@h/f"), (Groups{true, "ftp", "a", "p@q", "h", "/f"}));
  // A colon and a later at sign inside the path read as credentials.
  EXPECT_EQ(byParser("http://h/d:x@y/f.zip"), (Groups{true, "http", "h/d", "x", "y", "/f.zip"}));
  // No colon before the at sign: no credentials, the user is part of the host.
  EXPECT_EQ(byParser("https://u@h/f"), (Groups{true, "https", "", "", "u@h", "/f"}));
  // The path stops at a line break; the match need not reach the end.
  EXPECT_EQ(byParser("smb://h/f\nrest"), (Groups{true, "smb", "", "", "h", "/f"}));
  for (const char* bad : {"HTTP://h/f.zip", "http://h", "http://h/", "http:///f.zip", "gopher://h/f", ""}) {
    EXPECT_FALSE(byParser(bad).matched) << bad;
  }
}

TEST(LocationTest, HugeLocationsParseInLinearTime) {
  const size_t kMiB = 1 << 20;
  const std::string credentialsEverywhere = "http://" + std::string(kMiB, ':') + "@";  // no host after any '@'
  const std::string manyAtSigns = "http://u:" + std::string(kMiB, '@') + "h/f";
  const std::string longPath = "https://user:pw@host/" + std::string(kMiB, 'a');
  const std::string slashes = "ftp://" + std::string(kMiB, '/');

  BundleLocation loc;
  EXPECT_FALSE(parseLocation(credentialsEverywhere, &loc));
  ASSERT_TRUE(parseLocation(manyAtSigns, &loc));
  EXPECT_EQ(loc.password.size(), kMiB - 1);
  EXPECT_EQ(loc.host, "h");
  ASSERT_TRUE(parseLocation(longPath, &loc));
  EXPECT_EQ(loc.path.size(), kMiB + 1);
  EXPECT_FALSE(parseLocation(slashes, &loc));
  EXPECT_EQ(redactLocation(manyAtSigns), "http://u:***@h/f");
}

TEST(LocationTest, PasswordIsMaskedAndLeftOutOfTheUrl) {
  EXPECT_EQ(redactLocation("https://bob:s3cr\"t@h/f.zip"), "https://bob:***@h/f.zip");
  EXPECT_EQ(redactLocation("http://h/f.zip"), "http://h/f.zip");
  // Not matching the grammar (no path), yet a URL reader sees a password.
  EXPECT_EQ(redactLocation("http://bob:pw@h"), "http://bob:***@h");
  // The port after the at sign is no password.
  EXPECT_EQ(redactLocation("http://bob@h:8080/f"), "http://bob@h:8080/f");
  // The grammar takes "bob:pw@h/d" as the user and "x" as the password; a
  // URL reader takes "pw" as the password. Neither is shown.
  EXPECT_EQ(redactLocation("http://bob:pw@h/d:x@y/f"), "http://bob:***@h/d:***@y/f");
  EXPECT_EQ(redactUser("bob:pw@h/d"), "bob:***");
  EXPECT_EQ(redactUser("bob"), "bob");
  // Both readings agree on a password holding an at sign.
  EXPECT_EQ(redactLocation("ftp://a:p@q@h/f"), "ftp://a:***@h/f");

  BundleLocation loc;
  const std::string text = "https://bob:pw@updates.example/d/f.zip?x=1";
  ASSERT_TRUE(parseLocation(text, &loc));
  EXPECT_EQ(locationWithoutCredentials(text, loc), "https://updates.example/d/f.zip?x=1");
  ASSERT_TRUE(parseLocation("http://h/f", &loc));
  EXPECT_EQ(locationWithoutCredentials("http://h/f", loc), "http://h/f");
}

TEST(LocationTest, OnlyPlainFileNamesAreBundleNames) {
  EXPECT_EQ(bundleFileName("/d/f.zip?x=1"), "f.zip?x=1");
  EXPECT_EQ(bundleFileName("/d/"), "");
  EXPECT_TRUE(isPlainFileName("f.zip?x=1"));
  EXPECT_TRUE(isPlainFileName("..f"));
  for (const std::string& bad : std::initializer_list<std::string>{"", ".", "..", "..\\..\\x.dll", "a\\b", "C:x", "f.zip:stream", std::string("f\0g", 3)}) {
    EXPECT_FALSE(isPlainFileName(bad)) << bad;
  }
}

}  // namespace
}  // namespace sorvik
