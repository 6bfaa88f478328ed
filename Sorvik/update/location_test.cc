#include "Sorvik/update/location.h"

#include <gtest/gtest.h>

#include <random>
#include <regex>
#include <string>
#include <tuple>

namespace sorvik {
namespace {

using Groups = std::tuple<bool, std::string, std::string, std::string, std::string, std::string>;

Groups byRegex(const std::string& text) {
  static const std::regex pattern("^(?:(http|https|smb|ftp))://(?:(.+):(.+)@)?(?:([^/]+))(?:(/.+))");
  std::smatch m;
  if (!std::regex_search(text, m, pattern)) return {};
  return {true, m[1].str(), m[2].str(), m[3].str(), m[4].str(), m[5].str()};
}

Groups byParser(const std::string& text) {
  BundleLocation loc;
  if (!parseLocation(text, &loc)) return {};
  return {true, loc.scheme, loc.user, loc.password, loc.host, loc.path};
}

TEST(LocationTest, GroupsEqualBacktrackingRegexOnGeneratedLocations) {
  // Texts dense in the characters the grammar turns on, behind prefixes that
  // pass or nearly pass the scheme; half of them shaped like credentials.
  static const char* const kPrefixes[] = {"http://", "https://", "smb://", "ftp://", "HTTP://", "http:/", "x"};
  static const char kAlphabet[] = {':', '@', '/', 'a', '.', '\n', '\r', '\0', '\\', ':', '@', '/'};
  std::mt19937 rng(20261207);
  auto randomRun = [&](size_t maxLength) {
    std::string run;
    for (size_t n = rng() % (maxLength + 1); n > 0; --n) run += kAlphabet[rng() % sizeof kAlphabet];
    return run;
  };
  int withCredentials = 0;
  for (int i = 0; i < 20000; ++i) {
    std::string text = kPrefixes[rng() % std::size(kPrefixes)];
    text += i % 2 == 0 ? randomRun(14) : randomRun(3) + ":" + randomRun(3) + "@" + randomRun(3) + "/" + randomRun(4);
    const Groups expected = byRegex(text);
    ASSERT_EQ(byParser(text), expected) << "location: " << ::testing::PrintToString(text);
    withCredentials += !std::get<2>(expected).empty();
  }
  EXPECT_GT(withCredentials, 500);  // both branches of the optional group were exercised
}

TEST(LocationTest, HugeLocationsParseWithoutBacktracking) {
  const size_t kMiB = 1 << 20;
  BundleLocation loc;
  // Every '@' ends a candidate credentials group; none is followed by a host.
  EXPECT_FALSE(parseLocation("http://" + std::string(kMiB, ':') + "@", &loc));
  EXPECT_FALSE(parseLocation("ftp://" + std::string(kMiB, '/'), &loc));
  const std::string manyAtSigns = "http://u:" + std::string(kMiB, '@') + "h/f";
  ASSERT_TRUE(parseLocation(manyAtSigns, &loc));
  EXPECT_EQ(loc.password.size(), kMiB - 1);
  EXPECT_EQ(loc.host, "h");
  EXPECT_EQ(redactLocation(manyAtSigns), "http://u:***@h/f");
}

TEST(LocationTest, PasswordsAreMaskedAndLeftOutOfTheUrl) {
  EXPECT_EQ(redactLocation("https://bob:s3cr\"t@h/f.zip"), "https://bob:***@h/f.zip");
  EXPECT_EQ(redactLocation("http://bob@h:8080/f"), "http://bob@h:8080/f");
  // Outside the grammar (no path), yet a URL reader sees a password.
  EXPECT_EQ(redactLocation("http://bob:pw@h"), "http://bob:***@h");
  // The grammar takes "bob:pw@h/d" as the user and "x" as the password; a
  // URL reader takes "pw". Neither is shown.
  EXPECT_EQ(redactLocation("http://bob:pw@h/d:x@y/f"), "http://bob:***@h/d:***@y/f");
  EXPECT_EQ(redactUser("bob:pw@h/d"), "bob:***");

  BundleLocation loc;
  const std::string text = "https://bob:p@ss@updates.example/d/f.zip?x=1";
  ASSERT_TRUE(parseLocation(text, &loc));
  EXPECT_EQ(loc.password, "p@ss");
  EXPECT_EQ(locationWithoutCredentials(text, loc), "https://updates.example/d/f.zip?x=1");
  EXPECT_EQ(bundleFileName(loc.path), "f.zip?x=1");
}

}  // namespace
}  // namespace sorvik
