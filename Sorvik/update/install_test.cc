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

class InstallTest : public testing::UpdateStepTest {
 protected:
  void SetUp() override {
    UpdateStepTest::SetUp();
    fs::create_directory(dir() / "logs");
    writeFile(dir() / "logs" / "update.log", "step one\r\nlast");
    fs::remove(dir() / "update.xml");
  }
  // The last `count` log lines as "level text".
  std::vector<std::string> logTail(size_t count) const {
    const auto logs = host_->logs();
    std::vector<std::string> tail;
    for (size_t i = logs.size() > count ? logs.size() - count : 0; i < logs.size(); ++i) {
      tail.push_back(std::to_string(logs[i].level) + " " + logs[i].text);
    }
    return tail;
  }
  bool pendingMarkSaved() const {
    return readFile(dir() / "update.xml").find("PendingUpdate=\"1\"") != std::string::npos;
  }

  const std::string bundle_ = "downloads/f.zip";
};

TEST_F(InstallTest, EveryScriptEndSeenIsAFailureWithItsLog) {
  for (const int32_t exitCode : {22, 0, 1}) {
    host().clearRecords();
    host().setScript("scripts/update.ps1", ChildScript::exits(exitCode, "noise on stdout\n", "and stderr\n"));
    InstallBundle(service(), bundle_);
    const auto start = host().starts().at(0);
    EXPECT_EQ(start.flags, 12u);
    EXPECT_EQ(start.text_a, "");
    EXPECT_EQ(start.args, (std::vector<std::string>{"scripts/update.ps1", bundle_}));
    EXPECT_EQ(statuses(), (std::vector<int32_t>{BUNDLE_INSTALL, PENDING_UPDATE, -exitCode}));
    EXPECT_EQ(logTail(3), (std::vector<std::string>{
                              "75 Update failed (" + std::to_string(-exitCode) + "):", "75   step one", "75   last"}));
    EXPECT_FALSE(pendingMarkSaved());  // the final save drops the mark
  }

  host().clearRecords();
  {
    MutexLock lock(&service().stateMutex);
    service().Timeout = 0;  // no waiting at all
  }
  host().setScript("scripts/update.ps1", ChildScript::runsUntilTold());
  InstallBundle(service(), bundle_);
  EXPECT_EQ(statuses(), (std::vector<int32_t>{BUNDLE_INSTALL, PENDING_UPDATE, INSTALL_TIMEOUT}));
  EXPECT_EQ(logTail(3), (std::vector<std::string>{"75 Update timeout:", "75   step one", "75   last"}));
  EXPECT_FALSE(pendingMarkSaved());
}

TEST_F(InstallTest, UnstartableScriptLeavesTheStateFileAlone) {
  host().setScript("scripts/update.ps1", ChildScript::failsToStart(2));
  InstallBundle(service(), bundle_);
  EXPECT_EQ(statuses(), (std::vector<int32_t>{BUNDLE_INSTALL, INSTALL_ERROR}));
  EXPECT_EQ(logTail(1), std::vector<std::string>{"75 Update failed (failed to locate or execute script)."});
  EXPECT_FALSE(fs::exists(dir() / "update.xml"));
}

TEST_F(InstallTest, CloseDuringTheWaitKeepsThePendingMark) {
  host().setScript("scripts/update.ps1", ChildScript::runsUntilTold());
  std::thread closer([&] {
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
  EXPECT_TRUE(pendingMarkSaved());
  EXPECT_TRUE(logsWith("step one").empty());
}

}  // namespace
}  // namespace sorvik
