#include "Sorvik/service/worker.h"

#include <algorithm>

#include <gtest/gtest.h>

#include "Sorvik/platform/platform.h"
#include "Sorvik/service/service_test_support.h"

namespace sorvik {
namespace {

using testing::ChildScript;
using testing::logTexts;
using testing::readFile;
using testing::writeFile;
using std::chrono::seconds;

struct InstalledHost : testing::FakeHost {
  InstalledHost() { install(); }
};

bool contains(const std::vector<std::string>& lines, const std::string& line) {
  return std::find(lines.begin(), lines.end(), line) != lines.end();
}

class WorkerTest : public ::testing::Test {
 protected:
  WorkerTest() {
    host_.setScript("./kelp", ChildScript::runsUntilTold());
    service_.setWorkerWaitForTesting(&wait_);
  }

  // Starts the worker and waits until start-up is done and it sleeps.
  void startWorker() {
    worker_ = std::make_unique<testing::WorkerThread>(service_);
    ASSERT_TRUE(wait_.waitUntilSleeping(service_, 1));
  }

  // Posts work as a producer does and waits for the pass it causes.
  void post(int32_t action, const AgentRequestRecord& request = {}) {
    const size_t next = wait_.periodCount(service_) + 1;
    {
      MutexLock lock(&service_.stateMutex);
      service_.postedAction = action;
      service_.AgentRequest = request;
    }
    service_.wakeCondition.signalAll();
    ASSERT_TRUE(wait_.waitUntilSleeping(service_, next));
  }

  void timeOut() { ASSERT_TRUE(wait_.runTimedOutPass(service_)); }

  seconds lastPeriod() { return wait_.periods(service_).back(); }

  int32_t failbackStatus() {
    MutexLock lock(&service_.stateMutex);
    return service_.FailbackReport.FailbackStatus;
  }

  // Ends the agent the fake host runs and waits until the plug-in has seen it.
  void agentExits(int32_t code) {
    const auto starts = host_.starts();
    ASSERT_FALSE(starts.empty());
    host_.exitChild(starts.back().id, code);
    ASSERT_TRUE(host_.waitIdle(testing::kTestDeadline));
  }

  testing::ScopedTempCwd cwd_;
  InstalledHost host_;
  testing::FakeSteps steps_;
  testing::DrivenWait wait_;
  UpdateService service_{&steps_};
  std::unique_ptr<testing::WorkerThread> worker_;
};

TEST_F(WorkerTest, StartUpReportsEverythingInOrder) {
  // A restart after an install whose script logged a failure.
  writeFile("update.xml",
            "<?xml ?><Qora Delta=\"0\"><Update ID=\"3670016\" FailoverState=\"104\" PendingUpdate=\"1\" /></Qora>");
  writeFile("logs/update.log", "Stopping server\r\nUpdate failed: disk full\n");
  testing::FakeSteps steps;
  UpdateService service(&steps);
  service.setWorkerWaitForTesting(&wait_);
  host_.clearRecords();
  testing::WorkerThread worker(service);
  ASSERT_TRUE(wait_.waitUntilSleeping(service, 1));

  // The directory as the platform writes it (native separators).
  const std::string downloads = (cwd_.path() / "downloads").make_preferred().string();
  EXPECT_TRUE(boost::filesystem::is_directory(downloads));
  EXPECT_EQ(service.downloadDir(), downloads);
  EXPECT_EQ(readFile("update.xml"),
            "<?xml ?>\n<Qora Delta=\"0\">\n    <Update ID=\"3670016\" HasFailover=\"1\" FailoverState=\"104\" "
            "HasFailback=\"1\" DownloadDir=\"" +
                downloads + "\" Timeout=\"600\" />\n</Qora>\n");

  const auto docs = host_.documents();
  ASSERT_EQ(docs.size(), 4u);
  EXPECT_EQ(docs[0].target, 256u);
  EXPECT_EQ(docs[0].text, "<?xml ?><Qora Delta=\"0\"><Update ID=\"3670016\" HasFailover=\"1\" FailoverState=\"104\" "
                          "HasFailback=\"1\" DownloadDir=\"" +
                              downloads + "\" Timeout=\"600\" PackageType=\"" + platform::packageTypeName() +
                              "\" /></Qora>");
  EXPECT_EQ(docs[1].target, 4u);
  EXPECT_EQ(docs[1].text.find("<?xml ?><Qora><Update ID=\"3670016\" Status=\"-20\" FailoverStatus=\"104\" Time=\""), 0u);
  EXPECT_EQ(docs[2].text.find("<?xml ?><Qora Delta=\"0\"><Update ID=\"3670016\" FailbackStatus=\"200\" Time=\""), 0u);
  EXPECT_EQ(docs[2].text.find("Time=\"0\""), std::string::npos);
  EXPECT_EQ(docs[3].text.find("<?xml ?><Qora Delta=\"0\"><Update ID=\"3670016\" SpareResetStatus=\"200\" Time=\""), 0u);

  const std::vector<std::string> expected = {
      "Emit failover status: COMMISSIONED (104)", "Emit update status: (INSTALL_ERROR)", "Update failed:",
      "  Stopping server", "  Update failed: disk full", "Emit Failback status: NONE (200)",
      "Emit Spare Reset status: NONE (200)"};
  EXPECT_EQ(logTexts(host_), expected);
  for (const auto& record : host_.logs()) {
    if (record.text.rfind("  ", 0) == 0 || record.text == "Update failed:") {
      EXPECT_EQ(record.level, 75);
    }
  }
  {
    MutexLock lock(&service.stateMutex);
    EXPECT_TRUE(service.workerRunning);
    EXPECT_EQ(service.FailoverReport.FailoverStatus, 104);
  }
  EXPECT_EQ(wait_.periods(service).back(), seconds(3420));
}

TEST_F(WorkerTest, IdlePassLogsAndSleepsAgain) {
  startWorker();
  host_.clearRecords();
  timeOut();
  EXPECT_EQ(logTexts(host_), std::vector<std::string>{"WorkerThread awake action=none, currentAction=none"});
  EXPECT_EQ(lastPeriod(), seconds(3420));
  EXPECT_TRUE(steps_.calls().empty());
}

TEST_F(WorkerTest, UpdateRequestRunsDownloadChecksumInstall) {
  startWorker();
  const auto requestUpdate = [&](const char* location, const char* checksum) {
    const size_t next = wait_.periodCount(service_) + 1;
    {
      MutexLock lock(&service_.stateMutex);
      service_.Location = location;
      service_.Checksum = checksum;
    }
    service_.wakeCondition.signalAll();
    ASSERT_TRUE(wait_.waitUntilSleeping(service_, next));
  };
  requestUpdate("http://h/a.zip", "abc");
  requestUpdate("http://h/b.zip", "");
  steps_.checksumMatches = false;
  requestUpdate("http://h/c.zip", "def");
  steps_.downloadSucceeds = false;
  requestUpdate("http://h/d.zip", "def");

  const std::vector<std::string> expected = {
      "DownloadBundle http://h/a.zip", "VerifyBundleChecksum downloads/bundle.zip abc",
      "InstallBundle downloads/bundle.zip", "DownloadBundle http://h/b.zip", "InstallBundle downloads/bundle.zip",
      "DownloadBundle http://h/c.zip", "VerifyBundleChecksum downloads/bundle.zip def",
      "DownloadBundle http://h/d.zip"};
  EXPECT_EQ(steps_.calls(), expected);
  MutexLock lock(&service_.stateMutex);
  EXPECT_TRUE(service_.Location.empty());
  EXPECT_TRUE(service_.Checksum.empty());
}

TEST_F(WorkerTest, AgentActionWinsOverUpdateAndDecommissionOverBoth) {
  startWorker();
  size_t next = wait_.periodCount(service_) + 1;
  {
    MutexLock lock(&service_.stateMutex);
    service_.Location = "http://h/a.zip";
    service_.postedAction = action_stop_agent;
  }
  service_.wakeCondition.signalAll();
  ASSERT_TRUE(wait_.waitUntilSleeping(service_, next));
  EXPECT_EQ(steps_.calls(), std::vector<std::string>{"StopAgent null 15"});
  timeOut();  // finish the stop: abandoned at once, no client

  next = wait_.periodCount(service_) + 1;
  {
    MutexLock lock(&service_.stateMutex);
    service_.Location = "http://h/b.zip";
    service_.postedAction = action_decommission;
    service_.decommissionRequested = true;
  }
  service_.wakeCondition.signalAll();
  ASSERT_TRUE(wait_.waitUntilSleeping(service_, next));
  EXPECT_EQ(steps_.calls(), (std::vector<std::string>{"StopAgent null 15", "Decommission"}));
  MutexLock lock(&service_.stateMutex);
  EXPECT_TRUE(service_.Location.empty());
  EXPECT_FALSE(service_.decommissionRequested);
  EXPECT_EQ(service_.postedAction, action_none);
}

TEST_F(WorkerTest, StopWithoutAgentIsAbandonedAfterOneSecond) {
  startWorker();
  host_.clearRecords();
  post(action_stop_agent);
  EXPECT_EQ(lastPeriod(), seconds(1));
  timeOut();
  const auto logs = logTexts(host_);
  EXPECT_TRUE(contains(logs, "Verifying the failback agent exited"));
  EXPECT_TRUE(contains(logs, "Abandon agent ipc.  Shutdown attempts 1, ipc object is null"));
  EXPECT_TRUE(contains(logs, "Emit Failback status: NONE (200)"));
  EXPECT_EQ(steps_.calls(), std::vector<std::string>{"StopAgent null 15"});
  EXPECT_EQ(lastPeriod(), seconds(3420));
}

TEST_F(WorkerTest, AgentStartReportsPendingThenReadyAndIsNotStartedTwice) {
  {
    MutexLock lock(&service_.stateMutex);
    service_.storageDrives = "C:\\\\";
  }
  startWorker();
  host_.clearRecords();
  AgentRequestRecord request;
  request.Port = 7070;
  request.PasswordToken = "secret-token";
  post(action_start_agent, request);
  EXPECT_EQ(steps_.calls(), std::vector<std::string>{"StartAgent C:\\\\ 7070"});
  EXPECT_EQ(failbackStatus(), 202);
  EXPECT_EQ(lastPeriod(), seconds(30));
  const auto docs = testing::documentTexts(host_, 4);
  ASSERT_EQ(docs.size(), 2u);
  EXPECT_NE(docs[0].find("FailbackStatus=\"201\" Time="), std::string::npos);
  EXPECT_NE(docs[1].find("FailbackStatus=\"202\" Port=\"7070\" Time="), std::string::npos);

  host_.clearRecords();
  post(action_start_agent, request);
  EXPECT_EQ(steps_.calls().size(), 1u);
  EXPECT_TRUE(host_.hasLog("Agent is already running. Expecting stop_agent command first"));
  const auto again = testing::documentTexts(host_, 4);
  ASSERT_EQ(again.size(), 1u);
  EXPECT_EQ(again[0], docs[1]);  // the stored report, time unchanged
  for (const auto& record : host_.logs()) EXPECT_EQ(record.text.find("secret-token"), std::string::npos);
}

TEST_F(WorkerTest, AgentThatExitsOnItsOwnIsReportedAsError) {
  startWorker();
  post(action_start_agent);
  agentExits(3);
  host_.clearRecords();
  timeOut();
  EXPECT_TRUE(host_.hasLog("Failback agent exited with code 3. Emit failback status ERROR (204)"));
  EXPECT_EQ(failbackStatus(), 204);
  EXPECT_FALSE(service_.agentClient);
  EXPECT_EQ(lastPeriod(), seconds(3420));
}

TEST_F(WorkerTest, FailedAgentStartReportsError) {
  host_.setScript("./kelp", ChildScript::failsToStart(2));
  startWorker();
  post(action_start_agent);
  EXPECT_EQ(failbackStatus(), 204);
  EXPECT_EQ(lastPeriod(), seconds(3420));
}

TEST_F(WorkerTest, StopRetriesWithKillThenAbandons) {
  startWorker();
  post(action_start_agent);
  host_.clearRecords();
  post(action_stop_agent);
  timeOut();
  timeOut();
  EXPECT_EQ(failbackStatus(), 202);  // still stopping
  timeOut();
  const std::vector<std::string> expected = {"StartAgent  7066", "StopAgent client 15", "StopAgent client 9",
                                             "StopAgent client 9"};
  EXPECT_EQ(steps_.calls(), expected);
  const auto logs = logTexts(host_);
  EXPECT_EQ(std::count(logs.begin(), logs.end(), "Killing agent process"), 2);
  EXPECT_TRUE(contains(logs, "Abandon agent ipc.  Shutdown attempts 3, ipc object is valid"));
  EXPECT_EQ(failbackStatus(), 200);
  EXPECT_FALSE(service_.agentClient);
  const auto periods = wait_.periods(service_);
  EXPECT_EQ(std::vector<seconds>(periods.end() - 4, periods.end()),
            (std::vector<seconds>{seconds(1), seconds(1), seconds(1), seconds(3420)}));
}

TEST_F(WorkerTest, StopEndsAsSoonAsAgentHasExited) {
  startWorker();
  post(action_start_agent);
  post(action_stop_agent);
  agentExits(15);
  host_.clearRecords();
  timeOut();
  EXPECT_TRUE(host_.hasLog("Failback agent exited. Emit status: FAILBACK_NONE (200)"));
  EXPECT_EQ(failbackStatus(), 200);
  EXPECT_EQ(steps_.calls().size(), 2u);  // no kill needed
  EXPECT_EQ(lastPeriod(), seconds(3420));
}

TEST_F(WorkerTest, SpareResetOutcomeFollowsExitCode) {
  startWorker();
  for (const int32_t code : {0, 1}) {
    post(action_start_reset);
    EXPECT_EQ(lastPeriod(), seconds(1));
    timeOut();  // still running: nothing happens
    agentExits(code);
    host_.clearRecords();
    timeOut();
    const int32_t status = code == 0 ? 205 : 204;
    MutexLock lock(&service_.stateMutex);
    EXPECT_EQ(service_.SpareResetStatus, status);
  }
  EXPECT_TRUE(host_.hasLog("Reset agent exited with code 1. Emit reset status ERROR (204)"));
  EXPECT_TRUE(host_.waitForDocument("SpareResetStatus=\"204\"", testing::kTestDeadline));
}

TEST_F(WorkerTest, MissingClientDropsSupervisionAndUnknownActionIsLogged) {
  steps_.onStartReset = nullptr;  // the step leaves no client behind
  startWorker();
  post(action_start_reset);
  host_.clearRecords();
  timeOut();
  EXPECT_TRUE(host_.hasLog("Expected a valid IPC object for agent when current action is start_reset"));
  EXPECT_EQ(lastPeriod(), seconds(3420));

  post(action_update);
  bool found = false;
  for (const auto& record : host_.logs()) {
    if (record.text == "Worker thread received unknown action") found = record.level == 100;
  }
  EXPECT_TRUE(found);
}

TEST_F(WorkerTest, StopRequestEndsWorkerAndDropsPendingUpdate) {
  startWorker();
  {
    MutexLock lock(&service_.stateMutex);
    service_.Location = "http://h/a.zip";  // stored, worker not yet woken
  }
  worker_->stop();
  EXPECT_TRUE(steps_.calls() == (std::vector<std::string>{"StopAgent null 15", "StopAgent null 9"}));
  MutexLock lock(&service_.stateMutex);
  EXPECT_FALSE(service_.workerRunning);
  EXPECT_TRUE(service_.Location.empty());
}

TEST_F(WorkerTest, SecondWorkerIsRefusedWhileOneRuns) {
  startWorker();
  service_.runWorker();  // returns at once instead of racing the first
  EXPECT_TRUE(host_.hasLog("Worker thread is already running; second start ignored"));
  post(action_stop_agent);  // the first one still serves
  EXPECT_EQ(steps_.calls(), std::vector<std::string>{"StopAgent null 15"});
}

TEST(WorkerRealClockTest, CloseWhileWaitingReturnsPromptly) {
  testing::ScopedTempCwd cwd;
  InstalledHost host;
  testing::FakeSteps steps;
  UpdateService service(&steps);
  const auto started = std::chrono::steady_clock::now();
  {
    testing::WorkerThread worker(service);
    ASSERT_TRUE(host.waitForLog("Emit Spare Reset status", testing::kTestDeadline));
    worker.stop();
  }
  EXPECT_LT(std::chrono::steady_clock::now() - started, seconds(5));
  EXPECT_EQ(steps.calls(), (std::vector<std::string>{"StopAgent null 15", "StopAgent null 9"}));
}

}  // namespace
}  // namespace sorvik
