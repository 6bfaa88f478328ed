#include "Sorvik/failover/failback_agent.h"

#include <future>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Sorvik/failover/failover_test_env.h"
#include "Sorvik/ipc/client.h"

namespace sorvik::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr char kAgent[] = "./kelp";
constexpr char kToken[] = "Tq9-secret-4711";
constexpr char kDrives[] = "C:\\\\,D:\\\\";
constexpr auto kWait = std::chrono::seconds(10);
// Long enough for a scripted answer on a loaded machine; only the silent
// agent ever waits it out.
constexpr auto kShortLimit = std::chrono::milliseconds(250);
constexpr auto kAnswerLimit = std::chrono::seconds(3);

AgentRequestRecord request() {
  AgentRequestRecord r;
  r.FailoverStart = 1700000000;
  r.FailoverEnd = 1700003600;
  r.PasswordToken = kToken;
  r.Port = 7066;
  return r;
}

// An agent that prints `firstLine` once it has read its token line.
ChildScript agentPrinting(std::string firstLine) {
  ChildScript script = ChildScript::runsUntilTold();
  script.onStdin = [firstLine](FakeHost& host, const StdinEvent& event) {
    if (event.all.find('\n') != std::string::npos) host.sendOutput(event.id, 0, firstLine);
  };
  return script;
}

class FailbackAgentTest : public FailoverTest {
 protected:
  void setWorkerRunning(bool running) {
    MutexLock lock(&service().stateMutex);
    service().workerRunning = running;
  }
};

TEST_F(FailbackAgentTest, StartPassesWindowDrivesAndPortAndLearnsThePort) {
  host().setScript(kAgent, agentPrinting(" 7123 listening\r\n"));
  AgentRequestRecord r = request();

  StartAgent(service(), kDrives, r);

  StartRecord start;
  ASSERT_TRUE(host().waitForStart(kAgent, kWait, &start));
  EXPECT_THAT(start.args, ElementsAre("./kelp", "-x", "-start", "2023-11-14T22:13:20Z", "-end", "2023-11-14T23:13:20Z",
                                      "-drives", kDrives, "-port", "7066"));
  EXPECT_EQ(start.flags, 2u);
  EXPECT_EQ(host().stdinOf(start.id), std::string(kToken) + "\n");
  EXPECT_FALSE(host().stdinClosed(start.id));
  EXPECT_EQ(r.Port, 7123u);
  ASSERT_TRUE(service().agentClient);
  const int32_t pid = service().agentClient->value();
  EXPECT_TRUE(host().hasLog("Starting failback agent: {./kelp -x -start 2023-11-14T22:13:20Z -end "
                            "2023-11-14T23:13:20Z -drives C:\\\\,D:\\\\ -port 7066}"));
  EXPECT_TRUE(host().hasLog("Failback agent started, pid=" + std::to_string(pid) + ". Retrieving port..."));
  EXPECT_TRUE(host().hasLog("Failback agent started successfully, pid=" + std::to_string(pid) + ", port=7123"));
}

TEST_F(FailbackAgentTest, AgentWithoutAUsablePortIsDroppedButNotKilled) {
  struct Case {
    const char* name;
    ChildScript script;
    std::chrono::nanoseconds limit;
    const char* error;
  };
  const Case cases[] = {
      {"silent", ChildScript::runsUntilTold(), kShortLimit, "invalid stoi argument"},
      {"exits early", ChildScript::exits(3), kAnswerLimit, "invalid stoi argument"},
      {"words first", agentPrinting("listening on 7123\n"), kAnswerLimit, "invalid stoi argument"},
      {"empty line", agentPrinting("\n"), kAnswerLimit, "invalid stoi argument"},
      {"too large", agentPrinting("99999999999\n"), kAnswerLimit, "stoi argument out of range"},
      {"not a port", agentPrinting("70000\n"), kAnswerLimit, "port 70000 out of range"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    host().clearRecords();
    host().setScript(kAgent, c.script);
    AgentRequestRecord r = request();

    StartAgentWithPortLimit(service(), kDrives, r, c.limit);

    const auto failures = logsWith("Failed to retrieve failback agent's port. Error: ");
    ASSERT_EQ(failures.size(), 1u);
    EXPECT_EQ(failures[0].text, std::string("Failed to retrieve failback agent's port. Error: ") + c.error);
    EXPECT_EQ(failures[0].level, 75);
    EXPECT_EQ(r.Port, 0u);
    EXPECT_FALSE(service().agentClient);
    EXPECT_FALSE(host().hasLog("started successfully"));
  }
  EXPECT_THAT(platform_.terminations(), IsEmpty());
}

TEST_F(FailbackAgentTest, HandshakeStopsAtOnceWhenThePluginCloses) {
  host().setScript(kAgent, ChildScript::runsUntilTold());
  setWorkerRunning(false);
  AgentRequestRecord r = request();
  const auto began = std::chrono::steady_clock::now();

  StartAgent(service(), kDrives, r);  // the real 5 s limit

  EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::seconds(2));
  EXPECT_TRUE(host().hasLog("Failed to retrieve failback agent's port. Error: invalid stoi argument"));
  EXPECT_FALSE(service().agentClient);
}

TEST_F(FailbackAgentTest, StartFailureNamesTheHostsError) {
  host().setScript(kAgent, ChildScript::failsToStart(2));
  AgentRequestRecord r = request();

  StartAgent(service(), kDrives, r);
  StartReset(service(), kDrives, r);

  const auto failures = logsWith("Failed to start failback agent- No such file or directory");
  ASSERT_EQ(failures.size(), 2u);
  EXPECT_EQ(failures[0].level, 75);
  EXPECT_FALSE(service().agentClient);
  EXPECT_EQ(r.Port, 7066u);
  EXPECT_FALSE(host().hasLog("Failback agent started"));
}

TEST_F(FailbackAgentTest, ResetDeletesWithoutPortAndDoesNotWaitForOutput) {
  host().setScript(kAgent, ChildScript::runsUntilTold());
  AgentRequestRecord r = request();

  StartReset(service(), "E:\\\\", r);

  StartRecord start;
  ASSERT_TRUE(host().waitForStart(kAgent, kWait, &start));
  EXPECT_THAT(start.args, ElementsAre("./kelp", "-x", "-delete", "-start", "2023-11-14T22:13:20Z", "-end",
                                      "2023-11-14T23:13:20Z", "-drives", "E:\\\\"));
  EXPECT_EQ(start.flags, 2u);
  ASSERT_TRUE(host().waitUntil([&] { return !host().stdinOf(start.id).empty(); }, kWait));
  EXPECT_EQ(host().stdinOf(start.id), std::string(kToken) + "\n");
  ASSERT_TRUE(service().agentClient);
  EXPECT_EQ(service().agentClient->state(), ko::ipc::ClientState::Running);
  EXPECT_TRUE(host().hasLog("Failback agent started, pid=" + std::to_string(service().agentClient->value()) + "."));
  EXPECT_EQ(r.Port, 7066u);
}

TEST_F(FailbackAgentTest, StopEndsTheTrackedAgentByIdAndAnyOtherByExactName) {
  platform_.addProcess(4001, "kelp");
  platform_.addProcess(4002, "Kelp");
  platform_.addProcess(4003, "kelp2");
  platform_.addProcess(4004, "kelp");
  host().setScript(kAgent, ChildScript::runsUntilTold());
  AgentRequestRecord r = request();
  StartReset(service(), kDrives, r);
  ASSERT_TRUE(service().agentClient);
  const uint32_t pid = static_cast<uint32_t>(service().agentClient->value());
  const uint32_t id = service().agentClient->id();

  // Running with a known pid: exactly that process, the handle stays.
  StopAgent(service(), service().agentClient, 15);
  ASSERT_EQ(platform_.terminations().size(), 1u);
  EXPECT_EQ(platform_.terminations()[0].pid, pid);
  EXPECT_EQ(platform_.terminations()[0].code, 15u);
  EXPECT_TRUE(service().agentClient);
  EXPECT_TRUE(host().hasLog("Terminating failback agent process with code 15, pid=" + std::to_string(pid)));

  // Once the agent has exited the handle is let go and nothing is ended.
  host().exitChild(id, 0);
  ASSERT_TRUE(host().waitUntil(
      [&] { return service().agentClient->state() == ko::ipc::ClientState::Exited; }, kWait));
  StopAgent(service(), service().agentClient, 9);
  EXPECT_FALSE(service().agentClient);
  EXPECT_TRUE(host().hasLog("Failback agent child proc pipe closed"));
  EXPECT_EQ(platform_.terminations().size(), 1u);

  // No handle: every process named exactly like the agent.
  StopAgent(service(), service().agentClient, 9);
  const auto ended = platform_.terminations();
  ASSERT_EQ(ended.size(), 3u);
  EXPECT_EQ(ended[1].pid, 4001u);
  EXPECT_EQ(ended[2].pid, 4004u);
  EXPECT_EQ(ended[1].code, 9u);
  EXPECT_TRUE(host().hasLog("Terminating existing failback agent process with code 9, pid=4001"));
  EXPECT_TRUE(host().hasLog("Terminating existing failback agent process with code 9, pid=4004"));
}

TEST_F(FailbackAgentTest, StopWithAnUnusableHandleFallsBackToTheName) {
  platform_.addProcess(4100, "kelp");
  host().setScript(kAgent, ChildScript::failsToStart(13));
  auto failed = ko::ipc::spawn(std::vector<std::string>{kAgent});
  ASSERT_EQ(failed->state(), ko::ipc::ClientState::Failed);

  StopAgent(service(), failed, 15);
  EXPECT_TRUE(failed);  // not ours to drop
  ASSERT_EQ(platform_.terminations().size(), 1u);
  EXPECT_EQ(platform_.terminations()[0].pid, 4100u);

  // A process table that cannot be read ends nothing.
  platform_.addProcess(4101, "kelp");
  platform_.failProcessWalk();
  std::shared_ptr<ko::ipc::client> none;
  StopAgent(service(), none, 15);
  EXPECT_EQ(platform_.terminations().size(), 1u);
  EXPECT_FALSE(terminate_process(0, 9));
}

TEST_F(FailbackAgentTest, TokenReachesOnlyTheAgentsInputInAWholeSession) {
  host().setScript(kAgent, agentPrinting("7070\n"));
  AgentRequestRecord r = request();
  StartAgent(service(), kDrives, r);
  ASSERT_TRUE(service().agentClient);
  StopAgent(service(), service().agentClient, 15);
  host().exitChild(service().agentClient->id(), 15);
  ASSERT_TRUE(host().waitIdle(kWait));
  StopAgent(service(), service().agentClient, 9);

  host().setScript(kAgent, ChildScript::exits(0));
  StartReset(service(), kDrives, r);
  ASSERT_TRUE(host().waitIdle(kWait));

  ASSERT_EQ(host().starts().size(), 2u);
  for (const LogRecord& line : host().logs()) EXPECT_EQ(line.text.find(kToken), std::string::npos) << line.text;
  for (const StartRecord& start : host().starts()) {
    for (const std::string& arg : start.args) EXPECT_EQ(arg.find(kToken), std::string::npos) << arg;
    EXPECT_EQ(host().stdinOf(start.id), std::string(kToken) + "\n");
  }
  for (const DocumentRecord& doc : host().documents()) EXPECT_EQ(doc.text.find(kToken), std::string::npos);
}

TEST(AgentPortTest, ReadsLikeStoi) {
  struct Case {
    const char* line;
    const char* error;
    int32_t port;
  };
  const Case cases[] = {
      {"7066", "", 7066},
      {"  \t+8080 ready", "", 8080},
      {"-12", "", -12},
      {"2147483647", "", INT32_MAX},
      {"-2147483648", "", INT32_MIN},
      {"2147483648", "stoi argument out of range", 0},
      {"-2147483649", "stoi argument out of range", 0},
      {"123456789012345678901234567890", "stoi argument out of range", 0},
      {"", "invalid stoi argument", 0},
      {"   ", "invalid stoi argument", 0},
      {"+", "invalid stoi argument", 0},
      {"port 7066", "invalid stoi argument", 0},
  };
  for (const Case& c : cases) {
    int32_t port = 0;
    EXPECT_EQ(parseAgentPort(c.line, &port), c.error) << c.line;
    EXPECT_EQ(port, c.port) << c.line;
  }
}

}  // namespace
}  // namespace sorvik::testing
