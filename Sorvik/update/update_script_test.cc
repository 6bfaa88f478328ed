// The development stand-in for the installation script, run as the
// development host runs it: through /bin/sh, in the working directory, with
// SORVIK_HOST_PID naming the process to signal (here this test process).

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "host/test_temp_dir.h"

#include <algorithm>
#include <boost/filesystem.hpp>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>

#include "Sorvik/update/update_test_env.h"

namespace sorvik {
namespace {

namespace fs = boost::filesystem;

int hangupPipe[2] = {-1, -1};

void noteHangup(int) {
  const char byte = 1;
  [[maybe_unused]] const ssize_t ignored = ::write(hangupPipe[1], &byte, 1);
}

class UpdateScriptTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = cwd_.path();
    ASSERT_EQ(::pipe2(hangupPipe, O_CLOEXEC | O_NONBLOCK), 0);
    struct sigaction action = {};
    action.sa_handler = noteHangup;
    ASSERT_EQ(::sigaction(SIGHUP, &action, &oldAction_), 0);
    write(dir_ / "libsorvik.so", "OLD");
    fs::create_hard_link(dir_ / "libsorvik.so", dir_ / "loaded-copy");  // the inode the host has mapped
    write(dir_ / "update.xml", "<Update ID=\"3670016\" PendingUpdate=\"1\" />\n");
  }

  void TearDown() override {
    ::sigaction(SIGHUP, &oldAction_, nullptr);
    ::close(hangupPipe[0]);
    ::close(hangupPipe[1]);
  }

  static void write(const fs::path& path, const std::string& bytes) {
    std::ofstream(path.string(), std::ios::binary | std::ios::trunc) << bytes;
  }
  static std::string read(const fs::path& path) {
    std::ifstream in(path.string(), std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
  }

  // A tar.gz holding `member` with `content`.
  fs::path makeBundle(const std::string& member, const std::string& content) {
    fs::create_directories(dir_ / "stage");
    write(dir_ / "stage" / member, content);
    const fs::path bundle = dir_ / "bundle.tar.gz";
    const std::string command = "tar -czf '" + bundle.string() + "' -C '" + (dir_ / "stage").string() + "' " + member;
    EXPECT_EQ(std::system(command.c_str()), 0);
    return bundle;
  }

  FILE* startScript(const fs::path& bundle, const std::string& hostPid) {
    const std::string command = "cd '" + dir_.string() + "' && SORVIK_HOST_PID=" + hostPid +
                                " SORVIK_UPDATE_RESTART_WAIT=10 /bin/sh '" SORVIK_SOURCE_DIR "/scripts/update.ps1' '" +
                                bundle.string() + "' </dev/null >/dev/null 2>&1; echo $?";
    return ::popen(command.c_str(), "r");
  }

  static int finish(FILE* script) {
    char line[32] = {};
    const bool read = std::fgets(line, sizeof line, script) != nullptr;
    ::pclose(script);
    return read ? std::atoi(line) : -1;
  }

  // Plays the host: on SIGHUP the restarted plug-in rewrites update.xml
  // without the pending mark.
  bool restartOnHangup(int timeoutMs) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    while (true) {
      pollfd fd = {hangupPipe[0], POLLIN, 0};
      const auto left =
          std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
      const int ready = ::poll(&fd, 1, static_cast<int>(std::max<int64_t>(left.count(), 0)));
      if (ready == 1) break;
      if (ready == 0 || errno != EINTR) return false;  // EINTR: the signal itself
    }
    write(dir_ / "update.xml", "<Update ID=\"3670016\" />\n");
    return true;
  }

  testing::ScopedTempCwd cwd_;
  fs::path dir_;
  struct sigaction oldAction_ = {};
  testing::Watchdog watchdog_{std::chrono::seconds(60)};
};

TEST_F(UpdateScriptTest, ReplacesTheLibraryByRenameAndRestartsTheHost) {
  FILE* script = startScript(makeBundle("libsorvik.so", "NEW"), std::to_string(::getpid()));
  ASSERT_NE(script, nullptr);
  EXPECT_TRUE(restartOnHangup(20000));
  EXPECT_EQ(finish(script), 0);

  EXPECT_EQ(read(dir_ / "libsorvik.so"), "NEW");
  EXPECT_EQ(read(dir_ / "loaded-copy"), "OLD");  // never written in place
  const std::string log = read(dir_ / "logs" / "update.log");
  EXPECT_EQ(log.find("Update failed"), std::string::npos) << log;
  EXPECT_NE(log.find("plug-in restarted"), std::string::npos) << log;
}

TEST_F(UpdateScriptTest, FailuresLeaveTheLibraryAndSayUpdateFailed) {
  // Stale failure lines from an earlier run must not survive.
  fs::create_directories(dir_ / "logs");
  write(dir_ / "logs" / "update.log", "Update failed: long ago\n");

  EXPECT_EQ(finish(startScript(makeBundle("other.so", "NEW"), std::to_string(::getpid()))), 23);
  EXPECT_NE(read(dir_ / "logs" / "update.log").find("Update failed: bundle is not a tar.gz"), std::string::npos);

  EXPECT_EQ(finish(startScript(makeBundle("libsorvik.so", "NEW"), "")), 20);
  const std::string log = read(dir_ / "logs" / "update.log");
  EXPECT_NE(log.find("Update failed: SORVIK_HOST_PID is not set"), std::string::npos) << log;
  EXPECT_EQ(log.find("long ago"), std::string::npos);

  EXPECT_EQ(read(dir_ / "libsorvik.so"), "OLD");
  EXPECT_FALSE(restartOnHangup(0));
}

}  // namespace
}  // namespace sorvik
