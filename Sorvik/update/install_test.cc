#include "Sorvik/update/install.h"

#include <gtest/gtest.h>

#include <boost/filesystem.hpp>
#include <string>
#include <thread>
#include <vector>

#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/update/update_test_env.h"

namespace sorvik {
namespace {

namespace fs = boost::filesystem;
using namespace ko::core;
using testing::ChildScript;
using testing::StartRecord;

class InstallTest : public testing::UpdateStepTest {
 protected:
  void SetUp() override {
    UpdateStepTest::SetUp();
    bundle_ = (dir() / "downloads" / "f.zip").string();
    fs::create_directory(dir() / "logs");
    writeFile(dir() / "logs" / "update.log", "step one\r\nUpdate failed: signature\nlast");
    fs::remove(dir() / "update.xml");
  }

  std::string stateFile() const { return readFile(dir() / "update.xml"); }

  std::vector<std::string> logTail(size_t count) const {
    const auto logs = host_->logs();
    std::vector<std::string> tail;
    for (size_t i = logs.size() > count ? logs.size() - count : 0; i < logs.size(); ++i) {
      tail.push_back(std::to_string(logs[i].level) + " " + logs[i].text);
    }
    return tail;
  }

  std::string bundle_;
};

TEST_F(InstallTest, ScriptExitIsReportedNegatedWithItsLog) {
  for (const int32_t exitCode : {22, 0, 1, 7}) {
    host().clearRecords();
    host().setScript("scripts/update.ps1", ChildScript::exits(exitCode, "noise on stdout\n", "and stderr\n"));
    InstallBundle(service(), bundle_);

    const std::vector<StartRecord> starts = host().starts();
    ASSERT_EQ(starts.size(), 1u);
    EXPECT_EQ(starts[0].flags, 12u);
    EXPECT_EQ(starts[0].text_a, "");
    EXPECT_EQ(starts[0].args, (std::vector<std::string>{"scripts/update.ps1", bundle_}));
    EXPECT_EQ(statuses(), (std::vector<int32_t>{BUNDLE_INSTALL, PENDING_UPDATE, -exitCode}));
    EXPECT_EQ(logTail(4), (std::vector<std::string>{"75 Update failed (" + std::to_string(-exitCode) + "):",
                                                    "75   step one", "75   Update failed: signature",
                                                    "75   last"}));
    EXPECT_TRUE(logsWith("Attempting to install bundle: (" + bundle_ + ")").size() == 1);
    // The final save drops the pending mark.
    EXPECT_NE(stateFile().find("Timeout="), std::string::npos);
    EXPECT_EQ(stateFile().find("PendingUpdate"), std::string::npos);
  }
}

TEST_F(InstallTest, ScriptThatOutlivesTimeoutIsLeftRunning) {
  {
    MutexLock lock(&service().stateMutex);
    service().Timeout = 0;  // no waiting at all
  }
  host().setScript("scripts/update.ps1", ChildScript::runsUntilTold());
  InstallBundle(service(), bundle_);
  EXPECT_EQ(statuses(), (std::vector<int32_t>{BUNDLE_INSTALL, PENDING_UPDATE, INSTALL_TIMEOUT}));
  EXPECT_EQ(logTail(4), (std::vector<std::string>{"75 Update timeout:", "75   step one",
                                                  "75   Update failed: signature", "75   last"}));
  EXPECT_EQ(stateFile().find("PendingUpdate"), std::string::npos);
  // Nothing asked the host to stop the script.
  for (const auto& packet : host().packets()) {
    EXPECT_EQ(packet.header.type, static_cast<uint32_t>(ko::ipc::PacketType::StartRequest));
  }
}

TEST_F(InstallTest, UnstartableScriptLeavesTheStateFileAlone) {
  host().setScript("scripts/update.ps1", ChildScript::failsToStart(2));
  InstallBundle(service(), bundle_);
  EXPECT_EQ(statuses(), (std::vector<int32_t>{BUNDLE_INSTALL, INSTALL_ERROR}));
  EXPECT_EQ(logTail(1), std::vector<std::string>{"75 Update failed (failed to locate or execute script)."});
  EXPECT_FALSE(fs::exists(dir() / "update.xml"));
}

TEST_F(InstallTest, CloseDuringTheWaitKeepsThePendingMark) {
  StartRecord start;
  host().setScript("scripts/update.ps1", ChildScript::runsUntilTold());
  std::thread closer([&] {
    ASSERT_TRUE(host().waitForStart("scripts/update.ps1", std::chrono::seconds(10), &start));
    ASSERT_TRUE(host().waitForDocument("Status=\"3\"", std::chrono::seconds(10)));
    // What Close does: stop the worker, then end every running child.
    {
      MutexLock lock(&service().stateMutex);
      service().workerRunning = false;
    }
    ko::ipc::shutdown(true);
  });
  InstallBundle(service(), bundle_);
  closer.join();
  EXPECT_EQ(statuses(), (std::vector<int32_t>{BUNDLE_INSTALL, PENDING_UPDATE}));
  EXPECT_NE(stateFile().find("PendingUpdate=\"1\""), std::string::npos);
  EXPECT_TRUE(logsWith("Update failed").empty());
  EXPECT_TRUE(logsWith("  step one").empty());
}

}  // namespace
}  // namespace sorvik
