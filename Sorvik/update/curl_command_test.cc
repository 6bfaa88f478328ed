#include "Sorvik/update/curl_command.h"

#include <gtest/gtest.h>

#include <map>
#include <string>
#include <vector>

#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/update/download.h"

namespace sorvik {
namespace {

using namespace ko::core;

TEST(CurlCommandTest, ExitCodesMapToStatusCodes) {
  const std::map<int32_t, int32_t> mapped = {
      {1, DOWNLOAD_PROTOCOL_ERROR},  {33, DOWNLOAD_PROTOCOL_ERROR}, {34, DOWNLOAD_PROTOCOL_ERROR},
      {3, DOWNLOAD_PARSER_ERROR},    {4, DOWNLOAD_PARSER_ERROR},    {24, DOWNLOAD_PARSER_ERROR},
      {5, DOWNLOAD_NETWORK_ERROR},   {6, DOWNLOAD_NETWORK_ERROR},   {7, DOWNLOAD_NETWORK_ERROR},
      {28, DOWNLOAD_NETWORK_ERROR},  {9, DOWNLOAD_AUTH_ERROR},      {10, DOWNLOAD_AUTH_ERROR},
      {11, DOWNLOAD_AUTH_ERROR},     {12, DOWNLOAD_AUTH_ERROR},     {46, DOWNLOAD_AUTH_ERROR},
      {67, DOWNLOAD_AUTH_ERROR},     {74, DOWNLOAD_AUTH_ERROR},     {22, DOWNLOAD_HOST_ERROR},
      {23, DOWNLOAD_FILE_IO_ERROR},  {35, DOWNLOAD_SSL_ERROR},      {53, DOWNLOAD_SSL_ERROR},
      {54, DOWNLOAD_SSL_ERROR},      {59, DOWNLOAD_SSL_ERROR},      {64, DOWNLOAD_SSL_ERROR},
      {66, DOWNLOAD_SSL_ERROR},      {51, CURL_CERTIFICATE_ERROR},  {60, CURL_CERTIFICATE_ERROR},
      {77, CURL_CERTIFICATE_ERROR},
  };
  for (int32_t code = -300; code <= 300; ++code) {
    const auto it = mapped.find(code);
    EXPECT_EQ(mapCurlExitCode(code), it == mapped.end() ? DOWNLOAD_ERROR : it->second) << code;
  }
  EXPECT_EQ(mapCurlExitCode(INT32_MIN), DOWNLOAD_ERROR);
}

TEST(CurlCommandTest, ConfigurationLineQuotesCredentials) {
  EXPECT_EQ(quoteEscaped("", "\"\\"), "\"\"");
  EXPECT_EQ(quoteEscaped("a\"b\\c'", "\"\\"), "\"a\\\"b\\\\c'\"");
  EXPECT_EQ(curlConfigLine("bob", "p\"w"), "user = \"bob:p\\\"w\"");
  EXPECT_EQ(curlConfigLine("", ""), "user = \"guest:mirbelkastoun\"");
  EXPECT_EQ(curlConfigLine("bob", ""), "user = \"guest:mirbelkastoun\"");
}

TEST(CurlCommandTest, CertificateChecksOnlyForTrustedHostsWithCaBundle) {
  const std::vector<std::string> base = {"./curl", "-f", "-L", "-o", "d/f.zip", "--config", "-"};
  auto with = [&](std::vector<std::string> tail) {
    std::vector<std::string> args = base;
    args.insert(args.end(), tail.begin(), tail.end());
    return args;
  };
  EXPECT_EQ(curlArguments("d/f.zip", "dl.maker.example:443", "maker.example", true),
            with({"--cacert", "curl-ca-bundle.crt"}));
  EXPECT_EQ(curlArguments("d/f.zip", "dl.maker.example", "maker.example", false), with({"--insecure"}));
  EXPECT_EQ(curlArguments("d/f.zip", "dl.Maker.example", "maker.example", true), with({"--insecure"}));
  EXPECT_EQ(commandLineText({"./curl", "-f"}), " ./curl -f");
}

TEST(CurlCommandTest, ProgressFollowsStrtoulBaseZero) {
  EXPECT_EQ(progressPercent("100  512M  100  512M"), 100u);
  EXPECT_EQ(progressPercent("  7 512M"), 7u);
  EXPECT_EQ(progressPercent("  % Total    % Received"), 0u);
  EXPECT_EQ(progressPercent("0x1F"), 31u);
  EXPECT_EQ(progressPercent("010"), 8u);
  EXPECT_EQ(progressPercent("09"), 0u);  // octal: stops at the 9
  EXPECT_EQ(progressPercent(""), 0u);
  // Not a percentage: garbage would otherwise wrap into a negative Progress.
  EXPECT_EQ(progressPercent("101"), 0u);
  EXPECT_EQ(progressPercent("-5"), 0u);
  EXPECT_EQ(progressPercent("99999999999999999999999"), 0u);
}

}  // namespace
}  // namespace sorvik
