#include "Sorvik/failover/decommission.h"

#include <future>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Sorvik/failover/failover_test_env.h"
#include "Sorvik/ipc/client.h"
#include "Sorvik/plugin/status_codes.h"

namespace sorvik::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::Not;

using StateAndStatus = std::pair<int32_t, int32_t>;

constexpr char kScript[] = "scripts/failover.ps1";
constexpr auto kWait = std::chrono::seconds(10);

class DecommissionTest : public FailoverTest {
 protected:
  // The state the configuration intake leaves behind when it posts a decommission.
  void requestDecommission(int32_t target, int32_t timeoutSeconds) {
    MutexLock lock(&service().stateMutex);
    service().FailoverReport.FailoverState = target;
    service().FailoverReport.FailoverStatus = target;
    service().Timeout = timeoutSeconds;
  }

  StateAndStatus stateAndStatus() {
    MutexLock lock(&service().stateMutex);
    return {service().FailoverReport.FailoverState, service().FailoverReport.FailoverStatus};
  }

  // FailoverStatus values of the status documents sent so far.
  std::vector<std::string> failoverStatuses() const {
    std::vector<std::string> codes;
    for (const std::string& doc : statusDocuments()) {
      const auto at = doc.find("FailoverStatus=\"");
      if (at == std::string::npos) continue;
      const auto start = at + 16;
      codes.push_back(doc.substr(start, doc.find('"', start) - start));
    }
    return codes;
  }
};

TEST_F(DecommissionTest, ScriptThatCannotStartReportsErrorAndKeepsRequestedState) {
  requestDecommission(ko::core::DECOMMISSION_FAILOVER, 600);
  host().setScript(kScript, ChildScript::failsToStart(2));

  Decommission(service());

  StartRecord start;
  ASSERT_TRUE(host().waitForStart(kScript, kWait, &start));
  EXPECT_THAT(start.args, ElementsAre(kScript));
  EXPECT_EQ(start.flags, 12u);
  EXPECT_EQ(start.text_a, "");
  EXPECT_THAT(failoverStatuses(), ElementsAre("101", "-103"));
  ASSERT_EQ(logsWith("Failover failed (failed to locate or execute script). Emit status DECOMMISSION_ERROR (-103)")
                .size(),
            1u);
  EXPECT_EQ(logsWith("failed to locate")[0].level, 75);
  EXPECT_EQ(stateAndStatus(), StateAndStatus(ko::core::DECOMMISSION_FAILOVER, -103));
  EXPECT_TRUE(platform_.stateSaves().empty());
}

TEST_F(DecommissionTest, ScriptExitIsAFailureWhateverItsCode) {
  struct Case {
    int32_t exitCode;
    const char* logLine;
  };
  for (const Case& c : {Case{2, "Failover failed (-2):"}, Case{0, "Failover failed (0):"},
                        Case{INT32_MIN, "Failover failed (2147483648):"}}) {
    SCOPED_TRACE(c.exitCode);
    host().clearRecords();
    const size_t savesBefore = platform_.stateSaves().size();
    requestDecommission(ko::core::DECOMMISSION_ACTIVE, 600);
    host().setScript(kScript, ChildScript::exits(c.exitCode));

    Decommission(service());

    EXPECT_EQ(logsWith(c.logLine).size(), 1u);
    EXPECT_TRUE(host().hasLog("Attempting to decommission server"));
    EXPECT_TRUE(host().hasLog("Failover started."));
    EXPECT_THAT(failoverStatuses(), ElementsAre("101", "-103"));
    EXPECT_EQ(stateAndStatus(), StateAndStatus(ko::core::PROTECTED, -103));
    // Saved while pending, then again with the failure.
    const std::vector<std::string> saves = platform_.stateSaves();
    ASSERT_EQ(saves.size(), savesBefore + 2);
    EXPECT_THAT(saves[savesBefore], HasSubstr("FailoverState=\"103\""));
    EXPECT_THAT(saves[savesBefore], HasSubstr("PendingFailover=\"101\""));
    EXPECT_THAT(saves[savesBefore + 1], HasSubstr("FailoverState=\"100\""));
    EXPECT_THAT(saves[savesBefore + 1], Not(HasSubstr("PendingFailover")));
  }
}

TEST_F(DecommissionTest, TimeLimitReportsFailureAndLeavesScriptRunning) {
  // A limit of 0 s makes the wait return at once with the script still running.
  requestDecommission(ko::core::RESERVE_SPARE, 0);
  host().setScript(kScript, ChildScript::runsUntilTold());

  Decommission(service());

  EXPECT_EQ(logsWith("Failover timeout, process may still be running...").size(), 1u);
  EXPECT_THAT(failoverStatuses(), ElementsAre("101", "-103"));
  EXPECT_EQ(stateAndStatus(), StateAndStatus(ko::core::PROTECTED, -103));
  EXPECT_EQ(platform_.stateSaves().size(), 2u);
  EXPECT_TRUE(platform_.terminations().empty());
}

TEST_F(DecommissionTest, CloseDuringTheRunEndsSilentlyAndTheNextLoadSeesThePendingFailover) {
  requestDecommission(ko::core::DECOMMISSION_FAILOVER, 600);
  host().setScript(kScript, ChildScript::runsUntilTold());

  auto run = std::async(std::launch::async, [this] { Decommission(service()); });
  ASSERT_TRUE(host().waitForLog("Failover started.", kWait));
  // What Close does: stop the worker, then end every child's wait.
  {
    MutexLock lock(&service().stateMutex);
    service().workerRunning = false;
  }
  ko::ipc::shutdown(true);
  ASSERT_EQ(run.wait_for(kWait), std::future_status::ready);

  EXPECT_THAT(failoverStatuses(), ElementsAre("101"));
  EXPECT_TRUE(logsWith("Failover failed").empty());
  EXPECT_TRUE(logsWith("timeout").empty());
  EXPECT_EQ(stateAndStatus(), StateAndStatus(ko::core::DECOMMISSION_FAILOVER, 101));
  EXPECT_EQ(platform_.stateSaves().size(), 1u);

  // The restart: a new service object reads what the run saved.
  service_.reset();
  UpdateService restarted(nullptr);
  MutexLock lock(&restarted.stateMutex);
  EXPECT_EQ(restarted.FailoverReport.FailoverState, ko::core::DECOMMISSION_FAILOVER);
  EXPECT_EQ(restarted.FailoverReport.FailoverStatus, ko::core::DECOMMISSION_PENDING);
}

}  // namespace
}  // namespace sorvik::testing
