#include "Sorvik/update/checksum.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/update/update_test_env.h"

namespace sorvik {
namespace {

using ko::core::CHECKSUM_FAILED;

class ChecksumTest : public testing::UpdateStepTest {
 protected:
  std::string bundle(const std::string& content) {
    const std::string path = (dir() / "downloads" / "f.zip").string();
    writeFile(path, content);
    return path;
  }
};

TEST_F(ChecksumTest, AcceptsOnlyTheExactDigestInEitherCase) {
  const std::string path = bundle("abc");
  EXPECT_TRUE(VerifyBundleChecksum(service(), path, "900150983cd24fb0d6963f7d28e17f72"));
  EXPECT_TRUE(VerifyBundleChecksum(service(), path, "900150983CD24FB0D6963F7D28E17F72"));
  EXPECT_EQ(logsWith("Received checksum (900150983cd24fb0d6963f7d28e17f72).").size(), 2u);
  EXPECT_TRUE(statuses().empty());  // a match leaves the status alone

  for (const std::string wrong : {"900150983cd24fb0d6963f7d28e17f72 ", "900150983cd24fb0d6963f7d28e17f7",
                                  "d41d8cd98f00b204e9800998ecf8427e"}) {
    host().clearRecords();
    EXPECT_FALSE(VerifyBundleChecksum(service(), path, wrong)) << wrong;
    EXPECT_EQ(statuses(), std::vector<int32_t>{CHECKSUM_FAILED});
    const auto refused =
        logsWith("Invalid checksum, received (" + wrong + ") expected (900150983cd24fb0d6963f7d28e17f72).");
    ASSERT_EQ(refused.size(), 1u) << wrong;
    EXPECT_EQ(refused[0].level, 75);
  }
}

TEST_F(ChecksumTest, UnmappableBundlesAreRefusedNotInstalled) {
  for (const std::string& path : {bundle(""), (dir() / "missing.zip").string(), dir().string()}) {
    host().clearRecords();
    EXPECT_FALSE(VerifyBundleChecksum(service(), path, "d41d8cd98f00b204e9800998ecf8427e")) << path;
    EXPECT_EQ(statuses(), std::vector<int32_t>{CHECKSUM_FAILED}) << path;
    const auto refused = logsWith("Unable to map file (" + path + ") for checksum. Error: ");
    ASSERT_EQ(refused.size(), 1u) << path;
    EXPECT_EQ(refused[0].level, 75);
  }
}

}  // namespace
}  // namespace sorvik
