#include <gtest/gtest.h>

#include "Sorvik/service/location_text.h"
#include "Sorvik/service/service_test_support.h"

namespace sorvik {
namespace {

struct InstalledHost : testing::FakeHost {
  InstalledHost() { install(); }
};

class CommandIntakeTest : public ::testing::Test {
 protected:
  void send(const std::string& updates) {
    const std::string text = "<?xml ?><Qora Delta=\"0\">" + updates + "</Qora>";
    service_.processCommand(reinterpret_cast<const unsigned char*>(text.data()), text.size());
  }
  void sendAgent(const std::string& attributes) { send("<Update ID=\"3670016\" " + attributes + " />"); }

  void makeSpare(const char* drives = "C:\\\\") {
    MutexLock lock(&service_.stateMutex);
    service_.storageDrives = drives;
    service_.FailoverReport.FailoverState = ko::core::RESERVE_SPARE;
  }
  int32_t posted() {
    MutexLock lock(&service_.stateMutex);
    return service_.postedAction;
  }
  AgentRequestRecord request() {
    MutexLock lock(&service_.stateMutex);
    return service_.AgentRequest;
  }
  void clearPosted() {
    MutexLock lock(&service_.stateMutex);
    service_.postedAction = action_none;
    service_.AgentRequest = AgentRequestRecord{};
  }

  testing::ScopedTempCwd cwd_;
  InstalledHost host_;
  UpdateService service_{nullptr};
};

TEST_F(CommandIntakeTest, UpdateRequestsAreStoredLoggedAndReplaced) {
  send("<Update ID=\"3670016\" Location=\"http://h/a.zip\" Checksum=\"abc\" />"
       "<Other ID=\"3670016\" Location=\"http://h/other.zip\" />"
       "<Update ID=\"99\" Location=\"http://h/foreign.zip\" />"
       "<Update ID=\"3670016\" Location=\"\" />"
       "<Update ID=\"3670016\" Location=\"http://h/b.zip\" FailbackAgentRun=\"1\" />");
  EXPECT_EQ(testing::logTexts(host_),
            (std::vector<std::string>{"Update to http://h/a.zip", "Update checksum abc",
                                      "Ignore update request with empty location.", "Update to http://h/b.zip",
                                      "Update checksum "}));
  MutexLock lock(&service_.stateMutex);
  EXPECT_EQ(service_.Location, "http://h/b.zip");
  EXPECT_EQ(service_.Checksum, "");
  EXPECT_EQ(service_.postedAction, action_none);
}

TEST_F(CommandIntakeTest, CredentialsInLocationAreMaskedInTheLog) {
  send("<Update ID=\"3670016\" Location=\"https://bob:hunter2@h:8443/x/a.zip\" />");
  EXPECT_TRUE(host_.hasLog("Update to https://****@h:8443/x/a.zip"));
  EXPECT_FALSE(host_.hasLog("hunter2"));
  MutexLock lock(&service_.stateMutex);
  EXPECT_EQ(service_.Location, "https://bob:hunter2@h:8443/x/a.zip");  // stored as given

  EXPECT_EQ(locationForLog("ftp://h/p:q@r/a.zip"), "ftp://****@r/a.zip");
  EXPECT_EQ(locationForLog("http://h/mail@x"), "http://h/mail@x");
  EXPECT_EQ(locationForLog("no scheme:x@y"), "no scheme:x@y");
}

TEST_F(CommandIntakeTest, CommandsAreDroppedWhileUpdateOrDecommissionRuns) {
  makeSpare();
  for (const int32_t status : {1, 2, 3, 4}) {
    {
      MutexLock lock(&service_.stateMutex);
      service_.Status = status;
    }
    send("<Update ID=\"3670016\" Location=\"http://h/a.zip\" /><Update ID=\"3670016\" FailbackAgentRun=\"0\" />");
  }
  {
    MutexLock lock(&service_.stateMutex);
    service_.Status = ko::core::UPDATE_SUCCESS;
    service_.FailoverReport.FailoverStatus = ko::core::DECOMMISSION_PENDING;
  }
  send("<Update ID=\"3670016\" FailbackAgentRun=\"0\" />");
  EXPECT_TRUE(host_.logs().empty());
  EXPECT_EQ(posted(), action_none);
  MutexLock lock(&service_.stateMutex);
  EXPECT_TRUE(service_.Location.empty());
}

TEST_F(CommandIntakeTest, UnusableDocumentsAreIgnoredSilently) {
  service_.processCommand(nullptr, 10);
  const std::string good = "<Qora><Update ID=\"3670016\" Location=\"http://h/a.zip\" /></Qora>";
  service_.processCommand(reinterpret_cast<const unsigned char*>(good.data()), 0);
  for (const std::string& text : {std::string("<Qora><Update"), std::string("<Other><Update ID=\"3670016\" "
                                                                            "Location=\"http://h/a.zip\" /></Other>"),
                                  std::string(2000, '<')}) {
    service_.processCommand(reinterpret_cast<const unsigned char*>(text.data()), text.size());
  }
  std::string deep = "<Qora>";
  for (int i = 0; i < 200000; ++i) deep += "<a>";
  service_.processCommand(reinterpret_cast<const unsigned char*>(deep.data()), deep.size());
  EXPECT_TRUE(host_.logs().empty());
  EXPECT_TRUE(host_.documents().empty());
}

TEST_F(CommandIntakeTest, StartChecksRunInOrderAndOnlyFirstTwoReport) {
  const std::string full = "FailbackAgentRun=\"1\" FailoverStart=\"100\" FailoverEnd=\"200\" PasswordToken=\"tok-1\"";
  // 1: no drives, even in the right state.
  {
    MutexLock lock(&service_.stateMutex);
    service_.FailoverReport.FailoverState = ko::core::RESERVE_SPARE;
  }
  sendAgent(full);
  EXPECT_TRUE(host_.hasLog("No drives were found in storage config. Failback will not be possible"));
  // 2: drives known, wrong state.
  {
    MutexLock lock(&service_.stateMutex);
    service_.storageDrives = "D:\\\\";
    service_.FailoverReport.FailoverState = ko::core::COMMISSIONED;
  }
  sendAgent("FailbackAgentRun=\"1\"");
  EXPECT_TRUE(host_.hasLog(
      "Received request for data restore / reset spare.  Ignoring this request: current state COMMISSIONED"));
  const auto refusals = testing::documentTexts(host_, 4);
  ASSERT_EQ(refusals.size(), 2u);
  for (const std::string& doc : refusals) EXPECT_NE(doc.find("FailbackStatus=\"204\" Time=\""), std::string::npos);

  // 3-5: silent or log-only refusals, no status.
  makeSpare();
  host_.clearRecords();
  sendAgent("FailbackAgentRun=\"1\" FailoverEnd=\"200\" PasswordToken=\"t\"");
  sendAgent("FailbackAgentRun=\"1\" FailoverStart=\"100\" FailoverEnd=\"0\" PasswordToken=\"t\"");
  EXPECT_TRUE(host_.logs().empty());
  sendAgent("FailbackAgentRun=\"1\" FailoverStart=\"100\" FailoverEnd=\"200\" PasswordToken=\"\"");
  EXPECT_EQ(testing::logTexts(host_), std::vector<std::string>{"PasswordToken is needed for command to start_agent"});
  EXPECT_TRUE(host_.documents().empty());
  EXPECT_EQ(posted(), action_none);
  MutexLock lock(&service_.stateMutex);
  EXPECT_EQ(service_.FailbackReport.FailbackStatus, 200);  // refusals are not stored
  EXPECT_EQ(service_.FailbackReport.Time, 0u);
}

TEST_F(CommandIntakeTest, AcceptedStartsCarryTheirRequest) {
  makeSpare();
  sendAgent("FailbackAgentRun=\"1\" FailoverStart=\"100\" FailoverEnd=\"200\" PasswordToken=\"tok-1\" Port=\"7100\"");
  EXPECT_EQ(posted(), action_start_agent);
  AgentRequestRecord r = request();
  EXPECT_EQ(r.FailoverStart, 100);
  EXPECT_EQ(r.FailoverEnd, 200);
  EXPECT_EQ(r.PasswordToken, "tok-1");
  EXPECT_EQ(r.Port, 7100u);
  EXPECT_TRUE(host_.hasLog("Received request to start_agent "));

  // SpareReset selects reset mode whatever its number; text does not.
  clearPosted();
  sendAgent("FailbackAgentRun=\"1\" SpareReset=\"0\" FailoverStart=\"1\" FailoverEnd=\"2\" Port=\"abc\"");
  EXPECT_EQ(posted(), action_start_reset);
  r = request();
  EXPECT_EQ(r.PasswordToken, "plinkowarb");
  EXPECT_EQ(r.Port, 7066u);
  clearPosted();
  sendAgent("FailbackAgentRun=\"1\" SpareReset=\"yes\" FailoverStart=\"1\" FailoverEnd=\"2\" PasswordToken=\"t\"");
  EXPECT_EQ(posted(), action_start_agent);

  // A port no agent can listen on falls back to the default.
  clearPosted();
  sendAgent("FailbackAgentRun=\"1\" FailoverStart=\"1\" FailoverEnd=\"2\" PasswordToken=\"t\" Port=\"-1\"");
  EXPECT_EQ(request().Port, 7066u);
  EXPECT_TRUE(host_.hasLog("Agent port -1 out of range, using 7066"));

  // A token is one line of the agent's input; it cannot smuggle in more.
  clearPosted();
  sendAgent("FailbackAgentRun=\"1\" FailoverStart=\"1\" FailoverEnd=\"2\" PasswordToken=\"tok-1&#10;-delete\"");
  EXPECT_EQ(posted(), action_none);
  EXPECT_TRUE(host_.hasLog("PasswordToken for start_agent contains a line break; request ignored"));

  for (const auto& record : host_.logs()) EXPECT_EQ(record.text.find("tok-1"), std::string::npos);
}

TEST_F(CommandIntakeTest, StopNeedsNothingAndResetsRequest) {
  makeSpare();
  sendAgent("FailbackAgentRun=\"1\" FailoverStart=\"100\" FailoverEnd=\"200\" PasswordToken=\"tok\"");
  {
    MutexLock lock(&service_.stateMutex);
    service_.storageDrives.clear();
    service_.FailoverReport.FailoverState = ko::core::PROTECTED;
  }
  sendAgent("FailbackAgentRun=\"0\"");
  EXPECT_EQ(posted(), action_stop_agent);
  const AgentRequestRecord r = request();
  EXPECT_EQ(r.FailoverStart, 0);
  EXPECT_EQ(r.PasswordToken, "");
  EXPECT_EQ(r.Port, 7066u);
  EXPECT_TRUE(host_.hasLog("Received request to stop_agent "));

  clearPosted();
  sendAgent("FailbackAgentRun=\"2\"");
  sendAgent("FailbackAgentRun=\"stop\"");
  sendAgent("SpareReset=\"1\"");
  EXPECT_EQ(posted(), action_none);
}

}  // namespace
}  // namespace sorvik
