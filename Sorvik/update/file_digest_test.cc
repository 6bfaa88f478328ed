#include "Sorvik/update/file_digest.h"

#include <gtest/gtest.h>

#include <string>

namespace sorvik {
namespace {

// RFC 1321's test suite: digest bytes in order, two lower-case digits each.
TEST(FileDigestTest, Md5MatchesReferenceDigests) {
  EXPECT_EQ(md5Hex("", 0), "d41d8cd98f00b204e9800998ecf8427e");
  const std::string digits = "12345678901234567890123456789012345678901234567890123456789012345678901234567890";
  EXPECT_EQ(md5Hex(digits.data(), digits.size()), "57edf4a22be3c955ac49da2e2107b67a");
}

}  // namespace
}  // namespace sorvik
