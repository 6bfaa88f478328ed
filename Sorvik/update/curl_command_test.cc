#include "Sorvik/update/curl_command.h"

#include <gtest/gtest.h>

#include "Sorvik/update/download.h"

namespace sorvik {
namespace {

TEST(CurlCommandTest, CertificateChecksOnlyForTrustedHostsWithCaBundle) {
  EXPECT_EQ(curlArguments("p", "dl.maker.example:443", "maker.example", true).at(7), "--cacert");
  EXPECT_EQ(curlArguments("p", "dl.maker.example:443", "maker.example", true).at(8), "curl-ca-bundle.crt");
  EXPECT_EQ(curlArguments("p", "dl.Maker.example", "maker.example", true).at(7), "--insecure");
  EXPECT_EQ(curlArguments("p", "dl.maker.example", "maker.example", false).at(7), "--insecure");
}

TEST(CurlCommandTest, ProgressIsAPercentageReadAsStrtoulBaseZero) {
  EXPECT_EQ(progressPercent("100  512M  100  512M"), 100u);
  EXPECT_EQ(progressPercent("  % Total    % Received"), 0u);
  EXPECT_EQ(progressPercent("010"), 8u);
  EXPECT_EQ(progressPercent("09"), 0u);
  // Garbage would otherwise wrap into a negative or huge Progress.
  EXPECT_EQ(progressPercent("-5"), 0u);
  EXPECT_EQ(progressPercent("99999999999999999999999"), 0u);
}

TEST(CurlCommandTest, QuotingEscapesOnlyTheGivenCharacters) {
  EXPECT_EQ(quoteEscaped("", "\"\\"), "\"\"");
  EXPECT_EQ(quoteEscaped("a\"b\\c'", "\"\\"), "\"a\\\"b\\\\c'\"");
}

}  // namespace
}  // namespace sorvik
