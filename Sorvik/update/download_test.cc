#include "Sorvik/update/download.h"

#include <gtest/gtest.h>

#include <boost/filesystem.hpp>
#include <string>
#include <vector>

#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/update/curl_command.h"
#include "Sorvik/update/update_test_env.h"

namespace sorvik {
namespace {

namespace fs = boost::filesystem;
using namespace ko::core;
using testing::ChildScript;
using testing::StartRecord;

class DownloadTest : public testing::UpdateStepTest {
 protected:
  std::string downloads() const { return (dir() / "downloads").string(); }

  // Leaves something in the download directory for the step to clear.
  void litterDownloads() {
    writeFile(dir() / "downloads" / "old.zip", "old");
    fs::create_directories(dir() / "downloads" / "sub" / "deeper");
    writeFile(dir() / "downloads" / "sub" / "deeper" / "x", "x");
  }
  bool downloadsEmpty() const { return fs::is_empty(dir() / "downloads"); }
};

TEST_F(DownloadTest, FetchesWithCurlAndReportsEachProgressPiece) {
  litterDownloads();
  // curl's meter: header lines, then updates separated by carriage returns;
  // the final text after the last CR is one more piece.
  host().setScript("./curl", ChildScript::exitsOnStdinClose(
                                 0, "", "  % Total    % Received\n  0  1024\r 45  1024\r 45  1024\r0x1F\r100  1024"));
  std::string bundlePath;
  ASSERT_TRUE(DownloadBundle(service(), "http://h:8080/d/f.zip?x=1", bundlePath));

  EXPECT_EQ(bundlePath, downloads() + "/f.zip?x=1");
  EXPECT_TRUE(downloadsEmpty());
  EXPECT_TRUE(fs::is_directory(dir() / "data"));

  std::vector<StartRecord> starts = host().starts();
  ASSERT_EQ(starts.size(), 1u);
  EXPECT_EQ(starts[0].flags, 2u);
  const std::vector<std::string> expectedArgs = {"./curl", "-f",       "-L", "-o", bundlePath, "--config",
                                                 "-",      "--insecure", "http://h:8080/d/f.zip?x=1"};
  EXPECT_EQ(starts[0].args, expectedArgs);
  EXPECT_EQ(host().stdinOf(starts[0].id), "user = \"guest:mirbelkastoun\"");
  EXPECT_TRUE(host().stdinClosed(starts[0].id));

  // Progress 0 at the start, then every non-zero piece, repeats included.
  std::vector<std::pair<int32_t, int32_t>> reports;
  for (const auto& report : updateReports()) reports.emplace_back(report.status, report.progress);
  const std::vector<std::pair<int32_t, int32_t>> expected = {{1, 0}, {1, 45}, {1, 45}, {1, 31}, {1, 100}};
  EXPECT_EQ(reports, expected);
  ASSERT_EQ(logsWith("Download succeeded.").size(), 1u);
  EXPECT_EQ(logsWith("Download succeeded.")[0].level, 25);
}

TEST_F(DownloadTest, CredentialsTravelOnlyOnCurlsStandardInput) {
  host().setScript("./curl", ChildScript::exitsOnStdinClose(0));
  fs::create_directory(dir() / "data");  // an existing data directory is fine
  std::string bundlePath;
  ASSERT_TRUE(DownloadBundle(service(), "https://bob:pa\"ss\\word@h/d/f.zip", bundlePath));

  const std::vector<StartRecord> starts = host().starts();
  ASSERT_EQ(starts.size(), 1u);
  EXPECT_EQ(starts[0].args.back(), "https://h/d/f.zip");
  EXPECT_EQ(host().stdinOf(starts[0].id), "user = \"bob:pa\\\"ss\\\\word\"");

  const std::string shown = everythingShown();
  EXPECT_EQ(shown.find("pa\"ss"), std::string::npos) << shown;
  EXPECT_EQ(logsWith("Location string: https://bob:***@h/d/f.zip").size(), 1u);
  EXPECT_EQ(logsWith("scheme(https) user:pass(bob:***) host(h) path(/d/f.zip)").size(), 1u);
  EXPECT_EQ(logsWith("Downloading https://bob:***@h/d/f.zip").size(), 1u);

  // A location outside the grammar is logged masked too.
  host().clearRecords();
  EXPECT_FALSE(DownloadBundle(service(), "http://bob:hunter2@h", bundlePath));
  EXPECT_EQ(everythingShown().find("hunter2"), std::string::npos);
  EXPECT_EQ(logsWith("Not a valid URL: http://bob:***@h").size(), 1u);
}

TEST_F(DownloadTest, CurlFailuresAreMappedAndExplained) {
  struct Case {
    int32_t exitCode;
    int32_t status;
  };
  for (const Case c : {Case{22, DOWNLOAD_HOST_ERROR}, Case{60, CURL_CERTIFICATE_ERROR}, Case{2, DOWNLOAD_ERROR},
                       Case{-1, DOWNLOAD_ERROR}}) {
    host().clearRecords();
    host().setScript("./curl", ChildScript::exitsOnStdinClose(c.exitCode, "", " 10 1k\rcurl: (22) error: 404\n"));
    std::string bundlePath;
    EXPECT_FALSE(DownloadBundle(service(), "http://h/f.zip", bundlePath));
    EXPECT_EQ(statuses(), (std::vector<int32_t>{1, 1, c.status})) << c.exitCode;
    const auto failed = logsWith("Download failed (status " + std::to_string(c.exitCode) + "): curl: (22) error: 404\n");
    ASSERT_EQ(failed.size(), 1u);
    EXPECT_EQ(failed[0].level, 50);
    const auto command = logsWith(" ./curl -f -L -o " + bundlePath + " --config - ");
    ASSERT_EQ(command.size(), 1u);
    EXPECT_EQ(command[0].text.find(" ./curl"), 0u);
    EXPECT_EQ(command[0].text.find("http://"), std::string::npos);
  }

  host().clearRecords();
  host().setScript("./curl", ChildScript::failsToStart(2));
  std::string bundlePath;
  EXPECT_FALSE(DownloadBundle(service(), "http://h/f.zip", bundlePath));
  EXPECT_EQ(statuses(), (std::vector<int32_t>{1, DOWNLOAD_ERROR}));
  const auto logs = host().logs();
  ASSERT_FALSE(logs.empty());
  EXPECT_EQ(logs.back().text, "Download failed (failed to locate or execute curl).");
  EXPECT_EQ(logs.back().level, 75);
}

TEST_F(DownloadTest, RejectedLocationsStartNothingAndKeepTheDownloads) {
  litterDownloads();
  struct Case {
    std::string location;
    int32_t status;
    std::string log;
  };
  const std::string invalid = "Not a valid URL: ";
  const std::string unnamed = "Could not parse a filename, ignore request.";
  const std::string unsafe = "is not a plain file name, ignore request.";
  const std::vector<Case> cases = {
      {"HTTP://h/f.zip", INVALID_URI_LOCATION, invalid},
      {"http://h", INVALID_URI_LOCATION, invalid},
      {"http:///f.zip", INVALID_URI_LOCATION, invalid},
      // A NUL would split the URL into extra curl arguments.
      {std::string("http://h/f.zip\0--output\0/etc/passwd", 35), INVALID_URI_LOCATION, invalid},
      {"http://h/dir/", NO_BUNDLE_NAME, unnamed},
      // Names that would leave the download directory.
      {"http://h/d/..", NO_BUNDLE_NAME, unsafe},
      {"http://h/.", NO_BUNDLE_NAME, unsafe},
      {"http://h/..\\..\\sorvik.dll", NO_BUNDLE_NAME, unsafe},
      {"http://h/C:sorvik.dll", NO_BUNDLE_NAME, unsafe},
      {"http://h/f.zip:stream", NO_BUNDLE_NAME, unsafe},
  };
  for (const Case& c : cases) {
    host().clearRecords();
    std::string bundlePath;
    EXPECT_FALSE(DownloadBundle(service(), c.location, bundlePath)) << c.location;
    EXPECT_EQ(statuses(), (std::vector<int32_t>{1, c.status})) << c.location;
    const auto rejected = logsWith(c.log);
    ASSERT_EQ(rejected.size(), 1u) << c.location;
    EXPECT_EQ(rejected[0].level, 75) << c.location;
  }
  EXPECT_TRUE(host().starts().empty());
  EXPECT_TRUE(fs::exists(dir() / "downloads" / "old.zip"));
}

TEST_F(DownloadTest, HugeLocationsFailCleanly) {
  std::string bundlePath;
  const std::string garbage(1 << 20, '@');
  EXPECT_FALSE(DownloadBundle(service(), "http://" + garbage, bundlePath));
  EXPECT_EQ(statuses().back(), INVALID_URI_LOCATION);

  // Parses, but no start request can carry a URL that long.
  host().setScript("./curl", ChildScript::exitsOnStdinClose(0));
  EXPECT_FALSE(DownloadBundle(service(), "http://h/" + std::string(1 << 20, 'f'), bundlePath));
  EXPECT_EQ(statuses().back(), DOWNLOAD_ERROR);
}

TEST_F(DownloadTest, RefusesToEmptyDirectoriesHoldingTheServersFiles) {
  writeFile(dir() / "server.dll", "keep me");
  fs::create_symlink(dir(), dir() / "downloads" / "..link");
  host().setScript("./curl", ChildScript::exitsOnStdinClose(0));
  const std::vector<std::string> dangerous = {
      ".", "", dir().string(), dir().parent_path().string(), "/", (dir() / "downloads" / "..link").string()};
  for (const std::string& downloadDir : dangerous) {
    host().clearRecords();
    {
      MutexLock lock(&service().stateMutex);
      service().DownloadDir = downloadDir;
    }
    std::string bundlePath;
    EXPECT_FALSE(DownloadBundle(service(), "http://h/f.zip", bundlePath)) << downloadDir;
    EXPECT_EQ(statuses(), (std::vector<int32_t>{1, DOWNLOAD_FILE_IO_ERROR})) << downloadDir;
    ASSERT_EQ(logsWith("Refusing to clear download directory").size(), 1u) << downloadDir;
    EXPECT_EQ(logsWith("Refusing to clear download directory")[0].level, 75);
  }
  EXPECT_TRUE(host().starts().empty());
  EXPECT_EQ(readFile(dir() / "server.dll"), "keep me");
}

TEST_F(DownloadTest, DirectoryProblemsEndOrContinueTheDownload) {
  host().setScript("./curl", ChildScript::exitsOnStdinClose(0));
  // A missing download directory cannot be cleared; curl still runs and
  // will report its own failure to write.
  {
    MutexLock lock(&service().stateMutex);
    service().DownloadDir = (dir() / "missing").string() + "/";
  }
  std::string bundlePath;
  EXPECT_TRUE(DownloadBundle(service(), "http://h/f.zip", bundlePath));
  EXPECT_EQ(bundlePath, (dir() / "missing").string() + "/f.zip");
  ASSERT_EQ(logsWith("Failed to clear download directory").size(), 1u);
  EXPECT_EQ(logsWith("Failed to clear download directory")[0].level, 50);

  // "./data" blocked by a file: the step must not leave the status at
  // BUNDLE_DOWNLOAD, which would lock out every later command.
  host().clearRecords();
  fs::remove(dir() / "data");
  writeFile(dir() / "data", "not a directory");
  EXPECT_FALSE(DownloadBundle(service(), "http://h/f.zip", bundlePath));
  EXPECT_EQ(statuses(), (std::vector<int32_t>{1, DOWNLOAD_FILE_IO_ERROR}));
  ASSERT_EQ(logsWith("Unable to create data directory.").size(), 1u);
  EXPECT_EQ(logsWith("Unable to create data directory.")[0].level, 50);
  EXPECT_TRUE(host().starts().empty());
}

TEST_F(DownloadTest, CaBundleIsUsedOnlyForTheTrustedDomain) {
  const std::string trusted = trustedUpdateDomain();
  writeFile(dir() / "curl-ca-bundle.crt", "certificates");
  host().setScript("./curl", ChildScript::exitsOnStdinClose(0));
  std::string bundlePath;
  ASSERT_TRUE(DownloadBundle(service(), "https://dl." + trusted + "x/f.zip", bundlePath));
  std::vector<std::string> args = host().starts().back().args;
  ASSERT_GE(args.size(), 9u);
  EXPECT_EQ(std::vector<std::string>(args.begin() + 7, args.end() - 1),
            (std::vector<std::string>{"--cacert", "curl-ca-bundle.crt"}));
  if (trusted.empty()) return;  // every host contains the empty domain
  ASSERT_TRUE(DownloadBundle(service(), "https://elsewhere.example/f.zip", bundlePath));
  args = host().starts().back().args;
  EXPECT_EQ(args[7], "--insecure");
}

}  // namespace
}  // namespace sorvik
