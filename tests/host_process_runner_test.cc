#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/packet.h"
#include "Sorvik/platform/mutex.h"
#include "host/process_runner.h"
#include "tests/support/host_run.h"

namespace sorvik::host {
namespace {

namespace fs = std::filesystem;
using ko::ipc::PacketType;

struct Packet {
  ko::ipc::PacketHeader header;
  std::string payload;
  size_t size = 0;
};

// Records the runner's deliveries and notices; tests wait on it with a
// deadline instead of sleeping.
class Collector {
 public:
  void deliver(const unsigned char* bytes, size_t length) {
    Packet p;
    ko::ipc::decodePacketHeader(bytes, length, &p.header);
    p.payload.assign(reinterpret_cast<const char*>(bytes) + ko::ipc::kPacketHeaderSize,
                     length - ko::ipc::kPacketHeaderSize);
    p.size = length;
    MutexLock lock(&mu_);
    packets_.push_back(p);
    changed_.signalAll();
  }
  void notice(const std::string& text) {
    MutexLock lock(&mu_);
    notices_.push_back(text);
    changed_.signalAll();
  }
  // True once `done` holds; false after ten seconds (the watchdog).
  bool waitFor(const std::function<bool(const std::vector<Packet>&, const std::vector<std::string>&)>& done)
      NO_THREAD_SAFETY_ANALYSIS {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    MutexLock lock(&mu_);
    while (!done(packets_, notices_)) {
      if (!changed_.waitUntil(deadline) && std::chrono::steady_clock::now() >= deadline) {
        return done(packets_, notices_);
      }
    }
    return true;
  }
  bool waitExit(uint32_t id) {
    return waitFor([id](const std::vector<Packet>& ps, const std::vector<std::string>&) {
      for (const Packet& p : ps) {
        if (p.header.id == id && (p.header.type == 5 || p.header.type == 4)) return true;
      }
      return false;
    });
  }
  std::vector<Packet> forId(uint32_t id) {
    MutexLock lock(&mu_);
    std::vector<Packet> out;
    for (const Packet& p : packets_) {
      if (p.header.id == id) out.push_back(p);
    }
    return out;
  }

 private:
  Mutex mu_;
  CondVar changed_{&mu_};
  std::vector<Packet> packets_ GUARDED_BY(mu_);
  std::vector<std::string> notices_ GUARDED_BY(mu_);
};

std::string packet(uint32_t id, PacketType type, uint32_t value, const std::string& payload) {
  std::string bytes(ko::ipc::kPacketHeaderSize, '\0');
  ko::ipc::PacketHeader h{static_cast<uint32_t>(ko::ipc::kPacketHeaderSize + payload.size()), id,
                          static_cast<uint32_t>(type), value};
  ko::ipc::encodePacketHeader(h, reinterpret_cast<unsigned char*>(&bytes[0]));
  return bytes + payload;
}

std::string startPayload(const std::vector<std::string>& args) {
  std::string out;
  for (size_t i = 0; i < args.size(); ++i) out += (i ? std::string(1, '\0') : "") + args[i];
  return out;
}

std::string readFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

void writeFile(const std::string& path, const std::string& text, bool executable) {
  std::ofstream(path) << text;
  if (executable) ::chmod(path.c_str(), 0755);
}

const Packet* firstOfType(const std::vector<Packet>& ps, PacketType type) {
  for (const Packet& p : ps) {
    if (p.header.type == static_cast<uint32_t>(type)) return &p;
  }
  return nullptr;
}

std::string joined(const std::vector<Packet>& ps, PacketType type) {
  std::string out;
  for (const Packet& p : ps) {
    if (p.header.type == static_cast<uint32_t>(type)) out += p.payload;
  }
  return out;
}

class ProcessRunnerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = sorvik::testing::makeTempDir("runner");
    RunnerOptions options;
    options.workingDir = dir_;
    options.inheritOutput = false;
    options.extraEnvironment = {"SORVIK_HOST_PID=4242"};
    runner_ = newProcessRunner(
        options, [this](const unsigned char* b, size_t n) { collector_.deliver(b, n); },
        [this](const std::string& t) { collector_.notice(t); });
    std::string error;
    ASSERT_TRUE(runner_->start(&error)) << error;
  }
  void TearDown() override {
    runner_->stop();
    fs::remove_all(dir_);
  }

  void start(uint32_t id, uint32_t flags, const std::vector<std::string>& args) {
    // Flag bit 3 announces a leading text; the plug-in sends it empty.
    const std::string textA = (flags & ko::ipc::kSpawnTextA) != 0 ? std::string(1, '\0') : "";
    submit(packet(id, PacketType::StartRequest, flags, textA + startPayload(args)));
  }
  // Standard input split the way the plug-in sends it: every chunk carries
  // the same value.
  void sendStdin(uint32_t id, uint32_t value, const std::string& data) {
    size_t offset = 0;
    do {
      const size_t chunk = std::min(data.size() - offset, ko::ipc::kMaxPacketPayload);
      submit(packet(id, PacketType::StdinData, value, data.substr(offset, chunk)));
      offset += chunk;
    } while (offset < data.size());
  }
  void submit(const std::string& bytes) {
    runner_->submit(reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size());
  }
  // Runs a piped child to its end and returns its packets.
  std::vector<Packet> run(uint32_t id, const std::vector<std::string>& args, const std::string& input = "",
                          bool sendInput = false) {
    start(id, ko::ipc::kSpawnPiped, args);
    if (sendInput) sendStdin(id, ko::ipc::kStdinClose, input);
    EXPECT_TRUE(collector_.waitExit(id)) << "child " << id << " did not end";
    return collector_.forId(id);
  }

  std::string dir_;
  Collector collector_;
  std::unique_ptr<ProcessRunner> runner_;
};

TEST(StartPayloadTest, DecodesOptionalTextsAndArguments) {
  const std::string raw = std::string("dir\0env\0./kelp\0-x\0\0", 19);
  StartPayload p;
  ASSERT_TRUE(decodeStartPayload(reinterpret_cast<const unsigned char*>(raw.data()), raw.size(), 8 | 16, &p));
  EXPECT_EQ(p.textA, "dir");
  EXPECT_EQ(p.textB, "env");
  EXPECT_EQ(p.args, (std::vector<std::string>{"./kelp", "-x", "", ""}));
  // Flag bit 3 announces a text the payload lacks; an empty program is refused.
  EXPECT_FALSE(decodeStartPayload(reinterpret_cast<const unsigned char*>("abc"), 3, 8, &p));
  EXPECT_FALSE(decodeStartPayload(reinterpret_cast<const unsigned char*>(""), 0, 0, &p));
}

TEST_F(ProcessRunnerTest, ReportsTheErrnoOfAFailedStartAndResolvesPrograms) {
  writeFile(dir_ + "/not-executable", "echo no\n", false);
  writeFile(dir_ + "/hello", "#!/bin/sh\necho hello \"$1\" from \"$(pwd)\"\n", true);
  start(1, 2, {"./missing"});
  start(2, 2, {"./not-executable"});
  start(3, 2, {"no-such-program-anywhere"});
  const std::vector<Packet> hello = run(4, {"./hello", "arg"});
  const std::vector<Packet> bare = run(5, {"hello", "bare"});  // a bare name finds the working directory first
  const std::vector<Packet> path = run(6, {"sh", "-c", "echo $SORVIK_HOST_PID"});
  ASSERT_TRUE(collector_.waitExit(1) && collector_.waitExit(2) && collector_.waitExit(3));

  const std::pair<uint32_t, uint32_t> expected[] = {{1, ENOENT}, {2, EACCES}, {3, ENOENT}};
  for (const auto& [id, error] : expected) {
    const std::vector<Packet> ps = collector_.forId(id);
    ASSERT_EQ(ps.size(), 1u) << id;
    EXPECT_EQ(ps[0].header.type, 4u) << id;
    EXPECT_EQ(ps[0].header.value, error) << id;
  }
  EXPECT_EQ(joined(hello, PacketType::StdoutData), "hello arg from " + fs::canonical(dir_).string() + "\n");
  EXPECT_EQ(joined(bare, PacketType::StdoutData).substr(0, 11), "hello bare ");
  EXPECT_EQ(joined(path, PacketType::StdoutData), "4242\n");
  EXPECT_EQ(runner_->childCount(), 0u);
}

TEST_F(ProcessRunnerTest, DeliversAllOutputInBoundedPacketsBeforeExited) {
  const std::vector<Packet> ps =
      run(7, {"/bin/sh", "-c", "head -c 200000 /dev/zero | tr '\\0' a; echo oops >&2; exit 7"});
  ASSERT_FALSE(ps.empty());
  EXPECT_EQ(ps.front().header.type, 3u);
  EXPECT_GT(ps.front().header.value, 0u);
  EXPECT_EQ(ps.back().header.type, 5u);
  EXPECT_EQ(ps.back().header.value, 7u);
  for (const Packet& p : ps) {
    EXPECT_LE(p.size, ko::ipc::kMaxPacketSize);
    EXPECT_EQ(p.header.total_length, p.size);
  }
  EXPECT_EQ(joined(ps, PacketType::StdoutData), std::string(200000, 'a'));
  EXPECT_EQ(joined(ps, PacketType::StderrData), "oops\n");
}

TEST_F(ProcessRunnerTest, FeedsLargeStandardInputAndClosesItAfterTheLastChunk) {
  // A whole multiple of the chunk size ends with a full chunk that carries
  // the close bit like every chunk before it.
  const std::vector<Packet> exact = run(8, {"wc", "-c"}, std::string(3 * ko::ipc::kMaxPacketPayload, 'x'), true);
  const std::vector<Packet> uneven = run(9, {"wc", "-c"}, std::string(150001, 'y'), true);
  EXPECT_EQ(std::stoul(joined(exact, PacketType::StdoutData)), 3 * ko::ipc::kMaxPacketPayload);
  EXPECT_EQ(std::stoul(joined(uneven, PacketType::StdoutData)), 150001u);
  // A bare close (no data) ends a reader too.
  start(10, 2, {"cat"});
  sendStdin(10, 0, "line\n");
  sendStdin(10, ko::ipc::kStdinClose, "");
  ASSERT_TRUE(collector_.waitExit(10));
  EXPECT_EQ(joined(collector_.forId(10), PacketType::StdoutData), "line\n");
}

TEST_F(ProcessRunnerTest, AChildThatIgnoresItsInputDoesNotStallOthersAndSignalsMapTo128PlusN) {
  start(11, 2, {"sleep", "60"});
  ASSERT_TRUE(collector_.waitFor([](const std::vector<Packet>& ps, const std::vector<std::string>&) {
    return !ps.empty() && ps.back().header.id == 11;
  }));
  const pid_t sleeper = static_cast<pid_t>(collector_.forId(11).at(0).header.value);
  sendStdin(11, 0, std::string(4 << 20, 'z'));  // far more than a pipe holds
  const std::vector<Packet> echo = run(12, {"echo", "still responsive"});
  EXPECT_EQ(joined(echo, PacketType::StdoutData), "still responsive\n");
  ASSERT_EQ(::kill(sleeper, SIGKILL), 0);
  ASSERT_TRUE(collector_.waitExit(11));
  EXPECT_EQ(collector_.forId(11).back().header.value, static_cast<uint32_t>(exitCodeForSignal(SIGKILL)));
}

TEST_F(ProcessRunnerTest, ChildrenAreReapedAndInheritNoHostDescriptor) {
  const int leaked = ::open("/dev/null", O_RDONLY);  // deliberately without O_CLOEXEC
  ASSERT_GE(leaked, 0);
  const std::vector<Packet> ps = run(13, {"ls", "/proc/self/fd"});
  ::close(leaked);
  std::set<std::string> fds;
  std::istringstream lines(joined(ps, PacketType::StdoutData));
  for (std::string line; std::getline(lines, line);) fds.insert(line);
  // 0-2 are the pipes; ls itself holds one descriptor for the directory.
  EXPECT_EQ(fds.count(std::to_string(leaked)), 0u);
  EXPECT_LE(fds.size(), 4u);
  const pid_t pid = static_cast<pid_t>(ps.at(0).header.value);
  EXPECT_EQ(::waitpid(pid, nullptr, WNOHANG), -1);
  EXPECT_EQ(errno, ECHILD);
}

TEST_F(ProcessRunnerTest, RunsPs1ThroughTheInterpreterAndUnpipedChildrenReadNothing) {
  writeFile(dir_ + "/task.ps1", "read line; echo \"read=$? args=$*\" > ps1.out\n", false);
  start(14, 12, {"task.ps1", "one", "two"});
  ASSERT_TRUE(collector_.waitExit(14));
  const std::vector<Packet> ps = collector_.forId(14);
  ASSERT_NE(firstOfType(ps, PacketType::Exited), nullptr);
  EXPECT_EQ(firstOfType(ps, PacketType::StdoutData), nullptr);
  EXPECT_EQ(readFile(dir_ + "/ps1.out"), "read=1 args=one two\n");
  start(15, 12, {"absent.ps1"});
  ASSERT_TRUE(collector_.waitExit(15));
  EXPECT_EQ(collector_.forId(15).at(0).header.value, static_cast<uint32_t>(ENOENT));
}

TEST_F(ProcessRunnerTest, DetachedChildrenKeepRunningAndTheirIdCanBeReused) {
  start(16, 2, {"cat"});
  ASSERT_TRUE(collector_.waitFor([](const std::vector<Packet>& ps, const std::vector<std::string>&) {
    return !ps.empty() && ps.back().header.id == 16;
  }));
  const pid_t old = static_cast<pid_t>(collector_.forId(16).at(0).header.value);
  runner_->detachAll();
  const std::vector<Packet> fresh = run(16, {"echo", "new"}, "", false);
  EXPECT_EQ(joined(fresh, PacketType::StdoutData), "new\n");
  EXPECT_EQ(::kill(old, 0), 0);  // the detached child still runs
  ASSERT_EQ(::kill(old, SIGTERM), 0);
  const std::string expected = "detached child pid " + std::to_string(old) + " exited with code 143";
  EXPECT_TRUE(collector_.waitFor([&](const std::vector<Packet>&, const std::vector<std::string>& notices) {
    for (const std::string& n : notices) {
      if (n.find(expected) != std::string::npos) return true;
    }
    return false;
  }));
  // Nothing of the detached child reached the plug-in after the detach.
  size_t exits = 0;
  for (const Packet& p : collector_.forId(16)) exits += p.header.type == 5;
  EXPECT_EQ(exits, 1u);
}

}  // namespace
}  // namespace sorvik::host
