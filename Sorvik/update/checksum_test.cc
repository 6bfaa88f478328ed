#include "Sorvik/update/checksum.h"

#include <gtest/gtest.h>

#include <boost/filesystem.hpp>
#include <string>
#include <vector>

#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/update/file_digest.h"
#include "Sorvik/update/update_test_env.h"

namespace sorvik {
namespace {

namespace fs = boost::filesystem;
using namespace ko::core;

// RFC 1321's test suite.
TEST(Md5Test, MatchesReferenceDigests) {
  EXPECT_EQ(md5Hex("", 0), "d41d8cd98f00b204e9800998ecf8427e");
  EXPECT_EQ(md5Hex("abc", 3), "900150983cd24fb0d6963f7d28e17f72");
  const std::string digits =
      "12345678901234567890123456789012345678901234567890123456789012345678901234567890";
  EXPECT_EQ(md5Hex(digits.data(), digits.size()), "57edf4a22be3c955ac49da2e2107b67a");
}

class ChecksumTest : public testing::UpdateStepTest {
 protected:
  void SetUp() override {
    UpdateStepTest::SetUp();
    bundle_ = (dir() / "downloads" / "f.zip").string();
    writeFile(bundle_, "abc");
  }
  std::string bundle_;
};

TEST_F(ChecksumTest, AcceptsTheDigestInEitherCase) {
  EXPECT_TRUE(VerifyBundleChecksum(service(), bundle_, "900150983cd24fb0d6963f7d28e17f72"));
  EXPECT_TRUE(VerifyBundleChecksum(service(), bundle_, "900150983CD24FB0D6963F7D28E17F72"));
  const auto accepted = logsWith("Received checksum (900150983cd24fb0d6963f7d28e17f72).");
  ASSERT_EQ(accepted.size(), 2u);
  EXPECT_EQ(accepted[0].level, 25);
  EXPECT_TRUE(statuses().empty());  // a match leaves the status alone
  EXPECT_EQ(readFile(bundle_), "abc");
}

TEST_F(ChecksumTest, RefusesAnythingButTheExactDigest) {
  for (const std::string wrong : {"900150983cd24fb0d6963f7d28e17f72 ", "900150983cd24fb0d6963f7d28e17f72\n",
                                  "900150983cd24fb0d6963f7d28e17f7", "900150983cd24fb0d6963f7d28e17f722",
                                  "d41d8cd98f00b204e9800998ecf8427e"}) {
    host().clearRecords();
    EXPECT_FALSE(VerifyBundleChecksum(service(), bundle_, wrong)) << wrong;
    EXPECT_EQ(statuses(), std::vector<int32_t>{CHECKSUM_FAILED});
    const auto refused =
        logsWith("Invalid checksum, received (" + wrong + ") expected (900150983cd24fb0d6963f7d28e17f72).");
    ASSERT_EQ(refused.size(), 1u) << wrong;
    EXPECT_EQ(refused[0].level, 75);
  }
  EXPECT_TRUE(fs::exists(bundle_));  // the bundle stays for inspection
}

TEST_F(ChecksumTest, UnmappableBundlesAreRefused) {
  writeFile(dir() / "downloads" / "empty.zip", "");
  const std::vector<std::string> unmappable = {(dir() / "downloads" / "empty.zip").string(),
                                               (dir() / "downloads" / "missing.zip").string(),
                                               (dir() / "downloads").string()};
  for (const std::string& path : unmappable) {
    host().clearRecords();
    EXPECT_FALSE(VerifyBundleChecksum(service(), path, "d41d8cd98f00b204e9800998ecf8427e")) << path;
    EXPECT_EQ(statuses(), std::vector<int32_t>{CHECKSUM_FAILED}) << path;
    const auto refused = logsWith("Unable to map file (" + path + ") for checksum. Error: ");
    ASSERT_EQ(refused.size(), 1u) << path;
    EXPECT_EQ(refused[0].level, 75);
    EXPECT_TRUE(logsWith("Will attempt update anyway").empty());
  }
}

}  // namespace
}  // namespace sorvik
