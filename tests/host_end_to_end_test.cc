// sorvik-host as a program: a small test plug-in asks it to run real
// children, and every packet that comes back shows up in its log.

#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include <gtest/gtest.h>

#include "tests/support/host_run.h"

namespace sorvik::host {
namespace {

namespace fs = std::filesystem;
using sorvik::testing::HostRunOptions;
using sorvik::testing::HostRunResult;

class HostEndToEnd : public ::testing::Test {
 protected:
  void SetUp() override { work_ = sorvik::testing::makeTempDir("host-e2e"); }
  void TearDown() override { fs::remove_all(work_); }

  HostRunResult run(const std::string& script, std::vector<std::string> extraArgs = {},
                    const std::string& library = HOST_TEST_PLUGIN_PATH) {
    HostRunOptions options;
    options.hostProgram = SORVIK_HOST_PATH;
    options.library = library;
    options.workdir = work_;
    options.script = script;
    options.extraArgs = {"-l", "0", "--child-output", "null"};
    options.extraArgs.insert(options.extraArgs.end(), extraArgs.begin(), extraArgs.end());
    options.limit = std::chrono::seconds(30);
    HostRunResult result = runHost(options);
    EXPECT_FALSE(result.timedOut) << result.output;
    return result;
  }

  std::string work_;
};

TEST_F(HostEndToEnd, AnswersStartRequestsAndDeliversOutputBeforeTheExit) {
  const HostRunResult r = run(
      "wait -t 5 HostTestPlugin\n"
      "wait -t 5 worker entered\n"
      "write spawn 100 2 ./missing\n"
      "wait -t 10 packet id=100 type=4 value=2 \n"
      "write spawn 101 2 /bin/sh|-c|read x; echo \"got $x\"; echo err >&2; exit 4\n"
      "write stdin 101 1 hello\\n\n"
      "wait -t 10 packet id=101 type=5 value=4\n"
      "quit\n");
  ASSERT_EQ(r.exitCode, 0) << r.output;
  const size_t started = r.find("PROGRESS packet id=101 type=3");
  const size_t out = r.find("PROGRESS packet id=101 type=1 value=0 bytes=10 data=got hello\\n");
  const size_t err = r.find("PROGRESS packet id=101 type=2 value=0 bytes=4 data=err\\n");
  const size_t exited = r.find("PROGRESS packet id=101 type=5 value=4");
  ASSERT_NE(started, std::string::npos) << r.output;
  ASSERT_NE(out, std::string::npos) << r.output;
  ASSERT_NE(err, std::string::npos) << r.output;
  EXPECT_LT(started, out);
  EXPECT_LT(out, exited);
  EXPECT_LT(err, exited);
  EXPECT_TRUE(r.contains("plug-in unloaded"));
}

TEST_F(HostEndToEnd, SighupFromAChildRestartsThePlugInWhileTheChildRuns) {
  ASSERT_EQ(::mkfifo((work_ + "/gate").c_str(), 0600), 0);
  const HostRunResult r = run(
      "wait -t 5 worker entered\n"
      "write spawn 200 2 /bin/sh|-c|kill -HUP $SORVIK_HOST_PID; read x < gate; echo survived > after.txt\n"
      "wait -t 10 plug-in restarted\n"
      "write spawn 201 2 /bin/sh|-c|echo go > gate\n"
      "wait -t 10 -r detached child pid [0-9]+ exited with code 0\n"
      "quit\n");
  ASSERT_EQ(r.exitCode, 0) << r.output;
  EXPECT_EQ(r.count("Module Name=\"HostTestPlugin\""), 2u) << r.output;
  std::ifstream after(work_ + "/after.txt");
  std::string text;
  std::getline(after, text);
  EXPECT_EQ(text, "survived");
  // The old instance never hears of its child again.
  EXPECT_EQ(r.find("packet id=200 type=5"), std::string::npos) << r.output;
}

TEST_F(HostEndToEnd, WaitsConsumeEventsAndAFailingScriptExitsNonZero) {
  const HostRunResult timedOut = run(
      "wait -t 5 worker entered\n"
      "restart\n"
      "wait -t 5 worker entered\n"
      "wait -t 0.3 worker entered\n"
      "quit\n");
  EXPECT_EQ(timedOut.exitCode, 1) << timedOut.output;
  EXPECT_EQ(timedOut.count("PROGRESS worker entered"), 2u) << timedOut.output;
  EXPECT_TRUE(timedOut.contains("script failed at")) << timedOut.output;
  EXPECT_TRUE(timedOut.contains("timed out after 0.3 s")) << timedOut.output;

  const HostRunResult unknown = run("frobnicate\nquit\n");
  EXPECT_EQ(unknown.exitCode, 1);
  EXPECT_TRUE(unknown.contains("unknown instruction 'frobnicate'")) << unknown.output;

  const HostRunResult masked = run("agent-start now-60 now s3cret 7070\nquit\n");
  EXPECT_EQ(masked.exitCode, 0) << masked.output;
  EXPECT_FALSE(masked.contains("s3cret")) << masked.output;

  EXPECT_EQ(run("quit\n", {"--help"}).exitCode, 0);
  EXPECT_EQ(run("quit\n", {"--no-such-option"}).exitCode, 2);
  EXPECT_EQ(run("quit\n", {}, work_ + "/missing.so").exitCode, 3);
}

}  // namespace
}  // namespace sorvik::host
