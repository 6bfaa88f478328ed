// The real plug-in under sorvik-host: a restart unloads and reloads it, and
// the new instance announces itself and starts its worker again.

#include <filesystem>
#include <string>

#include <gtest/gtest.h>

#include "tests/support/host_run.h"

namespace sorvik::host {
namespace {

TEST(HostPluginRestart, RestartUnloadsAndReloadsThePlugIn) {
  const std::string work = sorvik::testing::makeTempDir("host-restart");
  sorvik::testing::HostRunOptions options;
  options.hostProgram = SORVIK_HOST_PATH;
  options.library = SORVIK_PLUGIN_PATH;
  options.workdir = work;
  options.extraArgs = {"-l", "25", "--child-output", "null"};
  options.limit = std::chrono::seconds(60);
  options.script =
      "wait -t 10 Module Name=\"Sorvik\"\n"
      "wait -t 10 SpareResetStatus\n"
      "restart\n"
      "wait -t 10 plug-in restarted\n"
      "wait -t 10 SpareResetStatus\n"
      "quit\n";
  const sorvik::testing::HostRunResult r = sorvik::testing::runHost(options);
  std::filesystem::remove_all(work);
  ASSERT_FALSE(r.timedOut) << r.output;
  EXPECT_EQ(r.exitCode, 0) << r.output;
  EXPECT_EQ(r.count("<Module Name=\"Sorvik\" ID=\"3670016\""), 2u) << r.output;
  EXPECT_EQ(r.count("plug-in unloaded"), 2u) << r.output;
}

}  // namespace
}  // namespace sorvik::host
