// Failover and failback end to end: the development host with its real
// process runner, the plug-in, the sample decommission script and the real
// failback agent.
//
// Each test gives its agent a file name of its own (and tells the plug-in
// through SORVIK_AGENT_IMAGE_NAME), so stopping agents by name never reaches
// another test's agent.

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>

#include "Sorvik/platform/platform.h"
#include "tests/support/host_run.h"
#include "tests/support/host_session.h"

namespace sorvik::testing {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

std::string readFile(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

void writeFile(const fs::path& path, const std::string& text) {
  fs::create_directories(path.parent_path());
  std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
}

// One HTTP/1.0 request to 127.0.0.1:port; the whole answer, or "" on failure.
std::string httpGet(const std::string& port, const std::string& path, const std::string& token) {
  const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(std::stoi(port)));
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  timeval limit{5, 0};
  ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
  std::string answer;
  if (::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0) {
    const std::string request = "GET " + path + " HTTP/1.0\r\nAuthorization: Bearer " + token + "\r\n\r\n";
    if (::send(fd, request.data(), request.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(request.size())) {
      char buf[4096];
      ssize_t n;
      while ((n = ::recv(fd, buf, sizeof buf, 0)) > 0) answer.append(buf, static_cast<size_t>(n));
    }
  }
  ::close(fd);
  return answer;
}

class FailoverEndToEnd : public ::testing::Test {
 protected:
  void SetUp() override {
    work_ = makeTempDir("sorvik-failover-e2e");
    ASSERT_FALSE(work_.empty());
    agentName_ = "kelp-e2e-" + std::to_string(::getpid()) + "-" + std::to_string(counter_++);
    fs::copy_file(SORVIK_PLUGIN_PATH, work_ + "/libsorvik.so");
    fs::create_directories(work_ + "/scripts");
    fs::copy_file(SORVIK_SOURCE_DIR "/scripts/failover.ps1", work_ + "/scripts/failover.ps1");
    useAgent(KELP_PATH);
  }
  void TearDown() override {
    session_.reset();
    // Anything this test's agent name still names was started by this test.
    for (uint32_t pid : agents()) platform::native().terminateProcess(pid, 9);
    fs::remove_all(work_);
  }

  // ./kelp is a link to a private copy named after this test.
  void useAgent(const std::string& program) {
    fs::remove(work_ + "/" + agentName_);
    fs::remove(work_ + "/kelp");
    fs::copy_file(program, work_ + "/" + agentName_);
    fs::create_symlink(work_ + "/" + agentName_, work_ + "/kelp");
  }

  std::vector<uint32_t> agents() const {
    std::vector<uint32_t> ids;
    platform::native().findProcessesByName({agentName_}, &ids);
    return ids;
  }

  // An ended agent can linger for a moment before the system removes it.
  bool agentsGone(std::chrono::milliseconds within = 5s) const {
    const auto deadline = std::chrono::steady_clock::now() + within;
    while (!agents().empty()) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::sleep_for(20ms);
    }
    return true;
  }

  void start(std::map<std::string, std::string> env = {}) {
    env["SORVIK_AGENT_IMAGE_NAME"] = agentName_;
    session_ = std::make_unique<HostSession>(SORVIK_HOST_PATH, work_ + "/libsorvik.so", work_,
                                             std::vector<std::string>{"-l", "0", "--child-output", "null"}, env);
    ASSERT_TRUE(session_->started());
    ASSERT_TRUE(session_->waitFor("SpareResetStatus", 10s)) << session_->output();
  }

  // Starts with the failover state already RESERVE_SPARE, as a server that
  // was made a spare before its last restart.
  void startAsSpare() {
    writeFile(work_ + "/update.xml",
              "<?xml ?>\n<Qora Delta=\"0\">\n    <Update ID=\"3670016\" HasFailover=\"1\" FailoverState=\"105\" "
              "HasFailback=\"1\" DownloadDir=\"\" Timeout=\"600\" />\n</Qora>\n");
    start();
  }

  bool expect(const std::string& regex, std::chrono::milliseconds timeout = 15s, std::string* group = nullptr) {
    return session_->waitFor(regex, timeout, group, mark_, &mark_);
  }

  int quit() {
    session_->send("quit");
    return session_->finish(20s);
  }

  static inline int counter_ = 0;
  std::string work_, agentName_;
  std::unique_ptr<HostSession> session_;
  size_t mark_ = 0;
};

TEST_F(FailoverEndToEnd, ADecommissionScriptThatEndsIsAnErrorAndTheRoleFallsBack) {
  start({{"SORVIK_FAILOVER_EXIT", "3"}});
  session_->send("failover DECOMMISSION_FAILOVER");
  ASSERT_TRUE(expect("FailoverStatus=\"101\"")) << session_->output();
  ASSERT_TRUE(expect("FailoverStatus=\"-103\"")) << session_->output();
  EXPECT_EQ(quit(), 0);
  const std::string state = readFile(work_ + "/update.xml");
  EXPECT_NE(state.find("FailoverState=\"100\""), std::string::npos) << state;
  EXPECT_EQ(state.find("PendingFailover"), std::string::npos) << state;
  EXPECT_NE(readFile(work_ + "/logs/failover.log").find("exiting with code 3"), std::string::npos);
}

TEST_F(FailoverEndToEnd, ADecommissionCompletedByARestartKeepsTheRequestedRole) {
  start();
  session_->send("failover DECOMMISSION_FAILOVER");
  ASSERT_TRUE(expect("FailoverStatus=\"101\"")) << session_->output();
  // The script restarts the host; the new load finds the requested role.
  ASSERT_TRUE(expect("plug-in restarted", 20s)) << session_->output();
  ASSERT_TRUE(expect("FailoverState=\"102\"")) << session_->output();
  EXPECT_FALSE(session_->waitFor("FailoverStatus=\"-103\"", 0ms)) << "the restart must end the wait silently";
  // From there the state machine goes on: 102 -> COMMISSIONED is allowed.
  session_->send("failover COMMISSIONED");
  ASSERT_TRUE(expect("FailoverStatus=\"104\"")) << session_->output();
  EXPECT_EQ(quit(), 0);
  EXPECT_NE(readFile(work_ + "/update.xml").find("FailoverState=\"104\""), std::string::npos);
}

TEST_F(FailoverEndToEnd, AFailbackSessionServesTheDrivesOnThePortTheAgentReports) {
  const std::string drive = work_ + "/drive-e";
  writeFile(drive + "/cam1/clip-0001.mkv", "recording");
  startAsSpare();
  const std::string token = "s3cret-token-e2e";
  session_->send("drives " + drive);
  ASSERT_TRUE(expect("Processed Storage config")) << session_->output();
  session_->send("agent-start now-3600 now+3600 " + token + " 0");
  ASSERT_TRUE(expect("FailbackStatus=\"201\"")) << session_->output();
  std::string port;
  ASSERT_TRUE(expect("FailbackStatus=\"202\" Port=\"([0-9]+)\"", 15s, &port)) << session_->output();

  const std::string listing = httpGet(port, "/files", token);
  EXPECT_NE(listing.find("200"), std::string::npos) << listing;
  EXPECT_NE(listing.find("clip-0001.mkv"), std::string::npos) << listing;
  EXPECT_NE(httpGet(port, "/files", "wrong-token").find("401"), std::string::npos);
  ASSERT_EQ(agents().size(), 1u);

  session_->send("agent-stop");
  ASSERT_TRUE(expect("FailbackStatus=\"200\"")) << session_->output();
  EXPECT_TRUE(agentsGone());
  EXPECT_EQ(quit(), 0);
  // The token travelled only on the agent's standard input.
  EXPECT_EQ(session_->output().find(token), std::string::npos);
}

TEST_F(FailoverEndToEnd, SpareResetEmptiesAMarkedDriveAndRefusesAnUnmarkedOne) {
  const std::string marked = work_ + "/spare-1", unmarked = work_ + "/data-1";
  writeFile(marked + "/.kelp-spare", "");
  writeFile(marked + "/old/recording.bin", "old");
  writeFile(unmarked + "/keep.bin", "keep");
  startAsSpare();
  session_->send("drives " + marked);
  ASSERT_TRUE(expect("Processed Storage config")) << session_->output();
  session_->send("agent-reset now-60 now");
  ASSERT_TRUE(expect("SpareResetStatus=\"205\"")) << session_->output();
  EXPECT_FALSE(fs::exists(marked + "/old"));
  EXPECT_TRUE(fs::exists(marked + "/.kelp-spare"));

  session_->send("drives " + unmarked);
  ASSERT_TRUE(expect("Processed Storage config")) << session_->output();
  session_->send("agent-reset now-60 now");
  ASSERT_TRUE(expect("SpareResetStatus=\"204\"")) << session_->output();
  EXPECT_TRUE(fs::exists(unmarked + "/keep.bin"));
  EXPECT_EQ(quit(), 0);
}

TEST_F(FailoverEndToEnd, AnAgentThatNeverReportsItsPortIsAnErrorAndIsStoppedByName) {
  useAgent(SILENT_AGENT_PATH);
  startAsSpare();
  session_->send("drives " + work_);
  session_->send("agent-start now-60 now token-x 0");
  ASSERT_TRUE(expect("FailbackStatus=\"201\"")) << session_->output();
  const auto asked = std::chrono::steady_clock::now();
  ASSERT_TRUE(expect("FailbackStatus=\"204\"", 15s)) << session_->output();
  const double waited = std::chrono::duration<double>(std::chrono::steady_clock::now() - asked).count();
  EXPECT_GT(waited, 4.0);
  EXPECT_LT(waited, 10.0);
  EXPECT_NE(session_->output().find("Failed to retrieve failback agent's port"), std::string::npos);
  ASSERT_EQ(agents().size(), 1u) << "the silent agent is left running";
  session_->send("agent-stop");
  ASSERT_TRUE(expect("FailbackStatus=\"200\"")) << session_->output();
  EXPECT_TRUE(agentsGone());
  EXPECT_EQ(quit(), 0);
}

TEST_F(FailoverEndToEnd, ClosingThePlugInEndsARunningAgent) {
  startAsSpare();
  session_->send("drives " + work_);
  session_->send("agent-start now-60 now token-y 0");
  ASSERT_TRUE(expect("FailbackStatus=\"202\"")) << session_->output();
  ASSERT_EQ(agents().size(), 1u);
  EXPECT_EQ(quit(), 0);
  EXPECT_TRUE(agentsGone()) << "an agent outlived Close";
}

}  // namespace
}  // namespace sorvik::testing
