#include "Sorvik/update/download.h"

#include <gtest/gtest.h>

#include <boost/filesystem.hpp>
#include <string>
#include <vector>

#include "Sorvik/platform/platform.h"
#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/update/curl_command.h"
#include "Sorvik/update/update_test_env.h"

namespace sorvik {
namespace {

namespace fs = boost::filesystem;
using namespace ko::core;
using testing::ChildScript;

class DownloadTest : public testing::UpdateStepTest {
 protected:
  void setDownloadDir(const std::string& path) {
    MutexLock lock(&service().stateMutex);
    service().DownloadDir = path;
  }
  // Everything that left the plug-in except children's standard input, the
  // one place credentials are meant to go.
  std::string everythingShown() const {
    std::string all;
    for (const auto& record : host_->logs()) all += record.text + "\n";
    for (const auto& start : host_->starts()) {
      for (const std::string& arg : start.args) all += arg + "\n";
    }
    return all;
  }
  void expectOneLog(const std::string& text, int32_t level) {
    const auto found = logsWith(text);
    ASSERT_EQ(found.size(), 1u) << text;
    EXPECT_EQ(found[0].level, level) << text;
  }
};

TEST_F(DownloadTest, FetchesWithCurlAndReportsEachProgressPiece) {
  writeFile(dir() / "downloads" / "old.zip", "old");
  fs::create_directories(dir() / "downloads" / "sub" / "deeper");
  // The meter's header, then updates between carriage returns; the text after
  // the last one is a piece too. 250 is no percentage.
  host().setScript("./curl", ChildScript::exitsOnStdinClose(
                                 0, "", "  % Total    % Received\n  0  1k\r 45  1k\r 45  1k\r250\r0x1F\r100  1k"));
  std::string bundlePath;
  ASSERT_TRUE(DownloadBundle(service(), "http://h:8080/d/f.zip?x=1", bundlePath));

  EXPECT_EQ(bundlePath, (dir() / "downloads").string() + platform::pathSeparator() + "f.zip?x=1");
  EXPECT_TRUE(fs::is_empty(dir() / "downloads"));
  EXPECT_TRUE(fs::is_directory(dir() / "data"));
  const auto starts = host().starts();
  ASSERT_EQ(starts.size(), 1u);
  EXPECT_EQ(starts[0].flags, 2u);
  EXPECT_EQ(starts[0].args, (std::vector<std::string>{"./curl", "-f", "-L", "-o", bundlePath, "--config", "-",
                                                      "--insecure", "http://h:8080/d/f.zip?x=1"}));
  EXPECT_EQ(host().stdinOf(starts[0].id), "user = \"guest:mirbelkastoun\"");
  EXPECT_TRUE(host().stdinClosed(starts[0].id));
  EXPECT_EQ(updateReports(), (std::vector<std::pair<int, int>>{{1, 0}, {1, 45}, {1, 45}, {1, 31}, {1, 100}}));
  expectOneLog("Download succeeded.", 25);
}

TEST_F(DownloadTest, CredentialsTravelOnlyOnCurlsStandardInput) {
  host().setScript("./curl", ChildScript::exitsOnStdinClose(0));
  std::string bundlePath;
  ASSERT_TRUE(DownloadBundle(service(), "https://bob:pa\"ss\\word@h/d/f.zip", bundlePath));
  const auto start = host().starts().at(0);
  EXPECT_EQ(start.args.back(), "https://h/d/f.zip");
  EXPECT_EQ(host().stdinOf(start.id), "user = \"bob:pa\\\"ss\\\\word\"");
  expectOneLog("Location string: https://bob:***@h/d/f.zip", 0);
  expectOneLog("scheme(https) user:pass(bob:***) host(h) path(/d/f.zip)", 0);
  expectOneLog("Downloading https://bob:***@h/d/f.zip", 25);

  EXPECT_FALSE(DownloadBundle(service(), "http://bob:hunter2@h", bundlePath));
  expectOneLog("Not a valid URL: http://bob:***@h", 75);
  const std::string shown = everythingShown();
  EXPECT_EQ(shown.find("pa\"ss"), std::string::npos) << shown;
  EXPECT_EQ(shown.find("hunter2"), std::string::npos) << shown;
}

TEST_F(DownloadTest, CurlFailuresAreMappedAndExplained) {
  for (const auto& [exitCode, status] : std::vector<std::pair<int32_t, int32_t>>{{22, DOWNLOAD_HOST_ERROR},
                                                                                 {60, CURL_CERTIFICATE_ERROR},
                                                                                 {23, DOWNLOAD_FILE_IO_ERROR},
                                                                                 {2, DOWNLOAD_ERROR}}) {
    host().clearRecords();
    host().setScript("./curl", ChildScript::exitsOnStdinClose(exitCode, "", " 10 1k\rcurl: (22) error: 404\n"));
    std::string bundlePath;
    EXPECT_FALSE(DownloadBundle(service(), "http://h/f.zip", bundlePath));
    EXPECT_EQ(statuses(), (std::vector<int32_t>{1, 1, status})) << exitCode;
    expectOneLog("Download failed (status " + std::to_string(exitCode) + "): curl: (22) error: 404\n", 50);
    expectOneLog(" ./curl -f -L -o " + bundlePath + " --config - --insecure", 50);
  }

  host().clearRecords();
  host().setScript("./curl", ChildScript::failsToStart(2));
  std::string bundlePath;
  EXPECT_FALSE(DownloadBundle(service(), "http://h/f.zip", bundlePath));
  EXPECT_EQ(statuses(), (std::vector<int32_t>{1, DOWNLOAD_ERROR}));
  EXPECT_EQ(host().logs().back().text, "Download failed (failed to locate or execute curl).");
}

TEST_F(DownloadTest, RejectedLocationsStartNothingAndKeepTheDownloads) {
  writeFile(dir() / "downloads" / "old.zip", "old");
  const std::string invalid = "Not a valid URL: ";
  const std::string unsafe = "is not a plain file name, ignore request.";
  const std::vector<std::tuple<std::string, int32_t, std::string>> cases = {
      {"HTTP://h/f.zip", INVALID_URI_LOCATION, invalid},
      {"http:///f.zip", INVALID_URI_LOCATION, invalid},
      {"http://" + std::string(1 << 20, '@'), INVALID_URI_LOCATION, invalid},
      // A NUL would split the URL into extra curl arguments.
      {std::string("http://h/f.zip\0--output\0/etc/passwd", 35), INVALID_URI_LOCATION, invalid},
      {"http://h/dir/", NO_BUNDLE_NAME, "Could not parse a filename, ignore request."},
      // Names that would leave the download directory.
      {"http://h/d/..", NO_BUNDLE_NAME, unsafe},
      {"http://h/.", NO_BUNDLE_NAME, unsafe},
      {"http://h/..\\..\\sorvik.dll", NO_BUNDLE_NAME, unsafe},
      {"http://h/C:sorvik.dll", NO_BUNDLE_NAME, unsafe},
  };
  for (const auto& [location, status, log] : cases) {
    host().clearRecords();
    std::string bundlePath;
    EXPECT_FALSE(DownloadBundle(service(), location, bundlePath));
    EXPECT_EQ(statuses(), (std::vector<int32_t>{1, status})) << location.substr(0, 40);
    expectOneLog(log, 75);
  }
  EXPECT_TRUE(host().starts().empty());
  EXPECT_TRUE(fs::exists(dir() / "downloads" / "old.zip"));
}

TEST_F(DownloadTest, RefusesToEmptyDirectoriesHoldingTheServersFiles) {
  writeFile(dir() / "server.dll", "keep me");
  for (const std::string& downloadDir : {std::string("."), dir().parent_path().string()}) {
    host().clearRecords();
    setDownloadDir(downloadDir);
    std::string bundlePath;
    EXPECT_FALSE(DownloadBundle(service(), "http://h/f.zip", bundlePath)) << downloadDir;
    EXPECT_EQ(statuses(), (std::vector<int32_t>{1, DOWNLOAD_FILE_IO_ERROR})) << downloadDir;
    expectOneLog("Refusing to clear download directory", 75);
  }
  EXPECT_TRUE(host().starts().empty());
  EXPECT_EQ(readFile(dir() / "server.dll"), "keep me");
}

TEST_F(DownloadTest, DirectoryProblemsEndOrContinueTheDownload) {
  host().setScript("./curl", ChildScript::exitsOnStdinClose(0));
  // A missing download directory cannot be cleared; curl still runs and
  // reports its own failure to write.
  setDownloadDir((dir() / "missing").string() + "/");
  std::string bundlePath;
  EXPECT_TRUE(DownloadBundle(service(), "http://h/f.zip", bundlePath));
  EXPECT_EQ(bundlePath, (dir() / "missing").string() + "/f.zip");
  expectOneLog("Failed to clear download directory", 50);

  // "./data" blocked by a file: the status must not stay BUNDLE_DOWNLOAD,
  // which would lock out every later command.
  host().clearRecords();
  fs::remove(dir() / "data");
  writeFile(dir() / "data", "not a directory");
  EXPECT_FALSE(DownloadBundle(service(), "http://h/f.zip", bundlePath));
  EXPECT_EQ(statuses(), (std::vector<int32_t>{1, DOWNLOAD_FILE_IO_ERROR}));
  expectOneLog("Unable to create data directory.", 50);
  EXPECT_TRUE(host().starts().empty());
}

TEST_F(DownloadTest, CaBundleIsUsedForTheTrustedDomain) {
  writeFile(dir() / "curl-ca-bundle.crt", "certificates");
  host().setScript("./curl", ChildScript::exitsOnStdinClose(0));
  std::string bundlePath;
  ASSERT_TRUE(DownloadBundle(service(), "https://dl." + std::string(trustedUpdateDomain()) + "/f.zip", bundlePath));
  EXPECT_EQ(host().starts().back().args.at(7), "--cacert");
  EXPECT_EQ(host().starts().back().args.at(8), "curl-ca-bundle.crt");
}

}  // namespace
}  // namespace sorvik
