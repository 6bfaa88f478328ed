// The real plug-in under sorvik-host: restarts unload and reload it, and an
// agent start travels from the command through the runner to kelp and back.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>

#include <gtest/gtest.h>

#include "tests/support/host_run.h"

namespace sorvik::host {
namespace {

namespace fs = std::filesystem;

class HostWithPlugin : public ::testing::Test {
 protected:
  void SetUp() override {
    work_ = sorvik::testing::makeTempDir("host-plugin");
    // Agents are stopped by image name; a name of this run's own keeps the
    // plug-in away from every other kelp on the machine.
    agentName_ = "kelp-host-test-" + std::to_string(::getpid());
  }
  void TearDown() override {
    // Release decommission scripts still blocked on the gate.
    const int fd = ::open((work_ + "/gate").c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC);
    if (fd >= 0) ::close(fd);
    fs::remove_all(work_);
  }
  sorvik::testing::HostRunResult run(const std::string& script) {
    sorvik::testing::HostRunOptions options;
    options.hostProgram = SORVIK_HOST_PATH;
    options.library = SORVIK_PLUGIN_PATH;
    options.workdir = work_;
    options.extraArgs = {"-l", "25", "--child-output", "null"};
    options.env = {{"SORVIK_AGENT_IMAGE_NAME", agentName_}};
    options.limit = std::chrono::seconds(60);
    options.script = script;
    sorvik::testing::HostRunResult r = sorvik::testing::runHost(options);
    EXPECT_FALSE(r.timedOut) << r.output;
    return r;
  }
  std::string work_;
  std::string agentName_;
};

TEST_F(HostWithPlugin, RestartUnloadsAndReloadsThePlugIn) {
  const auto r = run(
      "wait -t 10 Module Name=\"Sorvik\"\n"
      "wait -t 10 SpareResetStatus\n"
      "restart\n"
      "wait -t 10 plug-in restarted\n"
      "wait -t 10 SpareResetStatus\n"
      "quit\n");
  EXPECT_EQ(r.exitCode, 0) << r.output;
  EXPECT_EQ(r.count("<Module Name=\"Sorvik\" ID=\"3670016\""), 2u) << r.output;
  EXPECT_EQ(r.count("HOST plug-in unloaded"), 2u) << r.output;
}

TEST_F(HostWithPlugin, DecommissionScriptsRestartTheHostAndTheAgentReportsItsPort) {
  fs::create_directories(work_ + "/scripts");
  fs::create_directories(work_ + "/drive");
  ASSERT_EQ(::mkfifo((work_ + "/gate").c_str(), 0600), 0);
  // The stand-in script asks for the restart and keeps running through it.
  std::ofstream(work_ + "/scripts/failover.ps1") << "kill -HUP \"$SORVIK_HOST_PID\"\ncat gate > /dev/null\n";
  fs::copy_file(KELP_PATH, work_ + "/" + agentName_);
  fs::create_symlink(agentName_, work_ + "/kelp");
  const auto r = run(
      "wait -t 10 SpareResetStatus\n"
      "failover DECOMMISSION_FAILOVER\n"
      "wait -t 10 plug-in restarted\n"
      "wait -t 10 SpareResetStatus\n"
      "failover COMMISSIONED\n"
      "wait -t 10 FailoverStatus=\"104\"\n"
      "failover RESERVE_SPARE\n"
      "wait -t 10 plug-in restarted\n"
      "wait -t 10 SpareResetStatus\n"
      "drives " + work_ + "/drive\n"
      "agent-start now-3600 now+3600 s3cret-token\n"
      "wait -t 10 FailbackStatus=\"202\" Port=\n"
      "agent-stop\n"
      "wait -t 10 FailbackStatus=\"200\"\n"
      "quit\n");
  EXPECT_EQ(r.exitCode, 0) << r.output;
  EXPECT_TRUE(r.contains("Failback agent started successfully")) << r.output;
  EXPECT_EQ(r.count("HOST plug-in restarted"), 2u) << r.output;
  EXPECT_FALSE(r.contains("s3cret-token")) << r.output;
}

}  // namespace
}  // namespace sorvik::host
