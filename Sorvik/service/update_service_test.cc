#include "Sorvik/service/update_service.h"

#include <gtest/gtest.h>

#include "Sorvik/platform/platform.h"
#include "Sorvik/service/service_test_support.h"

namespace sorvik {
namespace {

using testing::readFile;
using testing::writeFile;

class UpdateServiceTest : public ::testing::Test {
 protected:
  void SetUp() override { host_.install(); }

  static std::string stateFile(const std::string& attributes, const char* root = "Qora") {
    return std::string("<?xml ?>\n<") + root + " Delta=\"0\">\n    <Update ID=\"3670016\" " + attributes +
           " />\n</" + root + ">\n";
  }

  testing::ScopedTempCwd cwd_;
  testing::FakeHost host_;
};

TEST_F(UpdateServiceTest, DefaultsWithoutStateFile) {
  UpdateService service(nullptr);
  MutexLock lock(&service.stateMutex);
  EXPECT_FALSE(service.workerRunning);
  EXPECT_EQ(service.PackageType, platform::packageTypeName());
  EXPECT_EQ(service.DownloadDir, "");
  EXPECT_EQ(service.Status, 0);
  EXPECT_EQ(service.Timeout, 600);
  EXPECT_TRUE(service.HasFailover);
  EXPECT_EQ(service.FailoverReport.FailoverState, 100);
  EXPECT_EQ(service.FailoverReport.FailoverStatus, 0);
  EXPECT_EQ(service.FailbackReport.FailbackStatus, 200);
  EXPECT_EQ(service.SpareResetStatus, 200);
  EXPECT_EQ(service.AgentRequest.Port, 7066u);
  EXPECT_EQ(service.postedAction, action_none);
  EXPECT_TRUE(host_.logs().empty());
  EXPECT_TRUE(service.isKnownPlatform(service.PackageType));
  EXPECT_FALSE(service.isKnownPlatform("Linux-x64"));
}

TEST_F(UpdateServiceTest, RestoresPersistedFields) {
  writeFile("update.xml", stateFile("HasFailover=\"1\" FailoverState=\"104\" DownloadDir=\"/srv/dl\" Timeout=\"300\""));
  UpdateService service(nullptr);
  MutexLock lock(&service.stateMutex);
  EXPECT_EQ(service.FailoverReport.FailoverState, 104);
  EXPECT_EQ(service.FailoverReport.FailoverStatus, 0);
  EXPECT_EQ(service.DownloadDir, "/srv/dl");
  EXPECT_EQ(service.Timeout, 300);
  EXPECT_EQ(service.Status, 0);
}

TEST_F(UpdateServiceTest, TimeoutBelowMinimumOrNotANumberFallsBackTo600) {
  for (const char* text : {"299", "abc", "-5"}) {
    writeFile("update.xml", stateFile(std::string("Timeout=\"") + text + "\""));
    UpdateService service(nullptr);
    EXPECT_EQ(service.timeoutSeconds(), 600) << text;
  }
}

TEST_F(UpdateServiceTest, FailedDecommissionOnFileRestartsProtected) {
  writeFile("update.xml", stateFile("FailoverState=\"104\" PendingFailover=\"-103\""));
  UpdateService service(nullptr);
  MutexLock lock(&service.stateMutex);
  EXPECT_EQ(service.FailoverReport.FailoverState, 100);
  EXPECT_EQ(service.FailoverReport.FailoverStatus, -103);
}

TEST_F(UpdateServiceTest, AnyRootNameIsAcceptedButWrongIdIgnoresFile) {
  writeFile("update.xml", stateFile("FailoverState=\"105\"", "Other"));
  {
    UpdateService service(nullptr);
    MutexLock lock(&service.stateMutex);
    EXPECT_EQ(service.FailoverReport.FailoverState, 105);
  }
  writeFile("update.xml", "<?xml ?><Qora><Update ID=\"3670017\" FailoverState=\"105\" Timeout=\"900\" /></Qora>");
  UpdateService service(nullptr);
  MutexLock lock(&service.stateMutex);
  EXPECT_EQ(service.FailoverReport.FailoverState, 100);
  EXPECT_EQ(service.Timeout, 600);
}

TEST_F(UpdateServiceTest, PendingUpdateBecomesSuccessOrInstallErrorFromLog) {
  const std::string pending = stateFile("PendingUpdate=\"1\"");
  writeFile("update.xml", pending);
  {
    UpdateService service(nullptr);  // no log file
    MutexLock lock(&service.stateMutex);
    EXPECT_EQ(service.Status, 13);
  }
  writeFile("update.xml", pending);
  writeFile("logs/update.log", "Copying files\r\nDone\n");
  {
    UpdateService service(nullptr);
    MutexLock lock(&service.stateMutex);
    EXPECT_EQ(service.Status, 13);
  }
  writeFile("update.xml", pending);
  writeFile("logs/update.log", "Copying files\nError: Update failed");
  {
    UpdateService service(nullptr);
    MutexLock lock(&service.stateMutex);
    EXPECT_EQ(service.Status, -20);
  }
  writeFile("update.xml", stateFile("PendingUpdate=\"0\""));
  UpdateService service(nullptr);
  MutexLock lock(&service.stateMutex);
  EXPECT_EQ(service.Status, 0);
}

TEST_F(UpdateServiceTest, PersistedStateIsExactText) {
  UpdateService service(nullptr);
  {
    MutexLock lock(&service.stateMutex);
    service.DownloadDir = "D:\\srv\\downloads";
  }
  service.persistState();
  EXPECT_EQ(readFile("update.xml"),
            "<?xml ?>\n<Qora Delta=\"0\">\n    <Update ID=\"3670016\" HasFailover=\"1\" FailoverState=\"100\" "
            "HasFailback=\"1\" DownloadDir=\"D:\\srv\\downloads\" Timeout=\"600\" />\n</Qora>\n");

  {
    MutexLock lock(&service.stateMutex);
    service.HasFailover = false;
    service.Status = ko::core::PENDING_UPDATE;
    service.FailoverReport.FailoverStatus = ko::core::DECOMMISSION_PENDING;
    service.DownloadDir = "a&b<c";
  }
  service.persistState();
  EXPECT_EQ(readFile("update.xml"),
            "<?xml ?>\n<Qora Delta=\"0\">\n    <Update ID=\"3670016\" HasFailover=\"0\" HasFailback=\"0\" "
            "DownloadDir=\"a&amp;b&lt;c\" Timeout=\"600\" PendingUpdate=\"1\" />\n</Qora>\n");

  {
    MutexLock lock(&service.stateMutex);
    service.Status = ko::core::BUNDLE_INSTALL;
  }
  service.persistState();
  EXPECT_NE(readFile("update.xml").find("Timeout=\"600\" PendingFailover=\"101\" />"), std::string::npos);
}

TEST_F(UpdateServiceTest, SavedStateSurvivesRestart) {
  {
    UpdateService service(nullptr);
    {
      MutexLock lock(&service.stateMutex);
      service.FailoverReport.FailoverState = ko::core::RESERVE_SPARE;
      service.FailoverReport.FailoverStatus = ko::core::DECOMMISSION_PENDING;
      service.DownloadDir = "dl & more";
      service.Timeout = 1200;
      service.Status = ko::core::PENDING_UPDATE;
    }
    service.persistState();
  }
  UpdateService restored(nullptr);
  MutexLock lock(&restored.stateMutex);
  EXPECT_EQ(restored.FailoverReport.FailoverState, ko::core::RESERVE_SPARE);
  EXPECT_EQ(restored.FailoverReport.FailoverStatus, 0);  // PendingUpdate wins the one slot
  EXPECT_EQ(restored.DownloadDir, "dl & more");
  EXPECT_EQ(restored.Timeout, 1200);
  EXPECT_EQ(restored.Status, ko::core::UPDATE_SUCCESS);
}

}  // namespace
}  // namespace sorvik
