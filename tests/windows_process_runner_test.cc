// The Windows process runner against real child processes: packets in,
// packets out, argument quoting, standard input closing, start failures,
// and that a child inherits no handle but its three standard ones.

#include <windows.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <string>
#include <vector>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/packet.h"
#include "Sorvik/platform/mutex.h"
#include "host/process_runner.h"
#include "host/windows_command_line.h"

namespace sorvik::host {
namespace {

using ko::ipc::PacketType;
using namespace std::chrono_literals;

std::string testChildPath() {
  char self[MAX_PATH];
  std::string path(self, ::GetModuleFileNameA(nullptr, self, sizeof self));
  return path.substr(0, path.find_last_of('\\') + 1) + SORVIK_TEST_CHILD;
}

std::string packet(uint32_t id, PacketType type, uint32_t value, const std::string& payload) {
  std::string bytes(ko::ipc::kPacketHeaderSize + payload.size(), '\0');
  ko::ipc::PacketHeader header;
  header.total_length = static_cast<uint32_t>(bytes.size());
  header.id = id;
  header.type = static_cast<uint32_t>(type);
  header.value = value;
  ko::ipc::encodePacketHeader(header, reinterpret_cast<unsigned char*>(&bytes[0]));
  std::memcpy(&bytes[ko::ipc::kPacketHeaderSize], payload.data(), payload.size());
  return bytes;
}

std::string startPayload(const std::vector<std::string>& args) {
  std::string payload;
  for (size_t i = 0; i < args.size(); ++i) payload += (i ? std::string(1, '\0') : "") + args[i];
  return payload;
}

struct Received {
  uint32_t id;
  PacketType type;
  uint32_t value;
  std::string payload;
};

// Collects what the runner delivers; tests wait on it with deadlines.
class Inbox {
 public:
  void add(const unsigned char* bytes, size_t length) {
    ko::ipc::PacketHeader header;
    ASSERT_TRUE(ko::ipc::decodePacketHeader(bytes, length, &header));
    MutexLock lock(&mu_);
    packets_.push_back(Received{header.id, static_cast<PacketType>(header.type), header.value,
                                std::string(reinterpret_cast<const char*>(bytes) + ko::ipc::kPacketHeaderSize,
                                            length - ko::ipc::kPacketHeaderSize)});
    changed_.signalAll();
  }
  // The first packet of `type` for `id`, waiting up to 10 s.
  bool waitFor(uint32_t id, PacketType type, Received* out) {
    const auto deadline = CondVar::Clock::now() + 10s;
    MutexLock lock(&mu_);
    for (;;) {
      for (const Received& r : packets_) {
        if (r.id == id && r.type == type) {
          *out = r;
          return true;
        }
      }
      if (!wait(deadline)) return false;
    }
  }
  std::string output(uint32_t id, PacketType stream) {
    MutexLock lock(&mu_);
    std::string all;
    for (const Received& r : packets_) {
      if (r.id == id && r.type == stream) all += r.payload;
    }
    return all;
  }
  std::vector<PacketType> types(uint32_t id) {
    MutexLock lock(&mu_);
    std::vector<PacketType> out;
    for (const Received& r : packets_) {
      if (r.id == id && (r.type == PacketType::Started || r.type == PacketType::Exited)) out.push_back(r.type);
    }
    return out;
  }

 private:
  bool wait(CondVar::Clock::time_point deadline) REQUIRES(mu_) NO_THREAD_SAFETY_ANALYSIS {
    return changed_.waitUntil(deadline);
  }
  Mutex mu_;
  CondVar changed_{&mu_};
  std::vector<Received> packets_ GUARDED_BY(mu_);
};

class WindowsRunnerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    runner_ = newProcessRunner(
        RunnerOptions{}, [this](const unsigned char* p, size_t n) { inbox_.add(p, n); },
        [](const std::string&) {});
    std::string error;
    ASSERT_TRUE(runner_->start(&error)) << error;
  }
  void TearDown() override { runner_->stop(); }
  void submit(const std::string& bytes) {
    runner_->submit(reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size());
  }
  void start(uint32_t id, const std::vector<std::string>& args, uint32_t flags = ko::ipc::kSpawnPiped) {
    submit(packet(id, PacketType::StartRequest, flags, startPayload(args)));
  }

  Inbox inbox_;
  std::unique_ptr<ProcessRunner> runner_;
};

TEST_F(WindowsRunnerTest, PipedChildGetsItsArgumentsAndInputAndReportsOutputAndExit) {
  const std::vector<std::string> args = {testChildPath(), "--echo", "plain", "two words", "quote\"inside",
                                         "trailing\\", "C:\\dir with space\\", ""};
  start(5, args);
  Received started;
  ASSERT_TRUE(inbox_.waitFor(5, PacketType::Started, &started));
  EXPECT_NE(started.value, 0u);
  submit(packet(5, PacketType::StdinData, 0, "token line\n"));
  submit(packet(5, PacketType::StdinData, ko::ipc::kStdinClose, "last"));

  Received exited;
  ASSERT_TRUE(inbox_.waitFor(5, PacketType::Exited, &exited)) << "stdin was not closed";
  EXPECT_EQ(exited.value, 7u);
  std::string expected;
  for (size_t i = 2; i < args.size(); ++i) expected += args[i] + "\n";
  EXPECT_EQ(inbox_.output(5, PacketType::StdoutData), expected + "token line\nlast");
  EXPECT_EQ(inbox_.output(5, PacketType::StderrData), "input closed\n");
  EXPECT_EQ(inbox_.types(5), (std::vector<PacketType>{PacketType::Started, PacketType::Exited}));
  EXPECT_EQ(runner_->childCount(), 0u);
}

TEST_F(WindowsRunnerTest, LongInputInFullSizeChunksArrivesWholeBeforeTheClose) {
  start(6, {testChildPath(), "--echo"});
  Received started;
  ASSERT_TRUE(inbox_.waitFor(6, PacketType::Started, &started));
  // Every chunk of a long send carries the close bit; only the last is short.
  const std::string full(ko::ipc::kMaxPacketPayload, 'a');
  submit(packet(6, PacketType::StdinData, ko::ipc::kStdinClose, full));
  submit(packet(6, PacketType::StdinData, ko::ipc::kStdinClose, full));
  submit(packet(6, PacketType::StdinData, ko::ipc::kStdinClose, "end"));
  Received exited;
  ASSERT_TRUE(inbox_.waitFor(6, PacketType::Exited, &exited));
  EXPECT_EQ(inbox_.output(6, PacketType::StdoutData), full + full + "end");
}

TEST_F(WindowsRunnerTest, DetachedChildrenAreForgottenButNoticed) {
  std::vector<std::string> notices;
  Mutex noticeMu;
  runner_->stop();
  runner_ = newProcessRunner(
      RunnerOptions{}, [this](const unsigned char* p, size_t n) { inbox_.add(p, n); },
      [&](const std::string& text) {
        MutexLock lock(&noticeMu);
        notices.push_back(text);
      });
  std::string error;
  ASSERT_TRUE(runner_->start(&error));
  start(8, {testChildPath()});
  Received started;
  ASSERT_TRUE(inbox_.waitFor(8, PacketType::Started, &started));
  runner_->detachAll();
  EXPECT_EQ(runner_->childCount(), 1u);

  HANDLE child = ::OpenProcess(PROCESS_TERMINATE | SYNCHRONIZE, FALSE, started.value);
  ASSERT_NE(child, nullptr);
  ::TerminateProcess(child, 9);
  ::WaitForSingleObject(child, 10000);
  ::CloseHandle(child);
  // The runner hears of the end on its own thread; a flush after that is
  // not ordered with it, so wait for the count with a deadline.
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  while (runner_->childCount() != 0 && std::chrono::steady_clock::now() < deadline) runner_->flush();
  EXPECT_EQ(runner_->childCount(), 0u);
  runner_->stop();
  EXPECT_EQ(inbox_.types(8), std::vector<PacketType>{PacketType::Started});
  MutexLock lock(&noticeMu);
  ASSERT_FALSE(notices.empty());
  EXPECT_EQ(notices.back(), "runner: detached child pid " + std::to_string(started.value) + " exited with code 9");
}

TEST_F(WindowsRunnerTest, StartFailuresCarryAnErrnoValue) {
  start(1, {"./no-such-program"});
  Received failed;
  ASSERT_TRUE(inbox_.waitFor(1, PacketType::StartFailed, &failed));
  EXPECT_EQ(failed.value, static_cast<uint32_t>(ENOENT));

  // A start request whose flags announce a text that is not there.
  submit(packet(2, PacketType::StartRequest, ko::ipc::kSpawnTextA, "no-terminator"));
  ASSERT_TRUE(inbox_.waitFor(2, PacketType::StartFailed, &failed));
  EXPECT_EQ(failed.value, static_cast<uint32_t>(EINVAL));
}

TEST_F(WindowsRunnerTest, ChildrenInheritOnlyTheirStandardHandles) {
  SECURITY_ATTRIBUTES inheritable{sizeof(SECURITY_ATTRIBUTES), nullptr, TRUE};
  HANDLE event = ::CreateEventA(&inheritable, TRUE, FALSE, nullptr);
  ASSERT_NE(event, nullptr);
  const std::string value = std::to_string(reinterpret_cast<uintptr_t>(event));
  for (uint32_t flags : {ko::ipc::kSpawnPiped, 0u}) {
    const uint32_t id = 10 + flags;
    start(id, {testChildPath(), "--check-handle", value}, flags);
    Received exited;
    ASSERT_TRUE(inbox_.waitFor(id, PacketType::Exited, &exited));
    EXPECT_EQ(exited.value, 0u) << "an unrelated inheritable handle reached the child (flags " << flags << ")";
  }
  ::CloseHandle(event);
}

TEST(WindowsCommandLineTest, QuotesOnlyWhatNeedsIt) {
  EXPECT_EQ(quoteWindowsArgument("plain"), "plain");
  EXPECT_EQ(quoteWindowsArgument("C:\\dir\\file"), "C:\\dir\\file");
  EXPECT_EQ(quoteWindowsArgument(""), "\"\"");
  EXPECT_EQ(quoteWindowsArgument("a b"), "\"a b\"");
  EXPECT_EQ(quoteWindowsArgument("a\\\"b"), "\"a\\\\\\\"b\"");
  EXPECT_EQ(quoteWindowsArgument("dir with space\\"), "\"dir with space\\\\\"");
  EXPECT_EQ(ps1InterpreterArguments("C:\\Windows\\System32\\WindowsPowerShell\\v1.0\\powershell.exe").back(), "-File");
  EXPECT_TRUE(ps1InterpreterArguments("stub.exe").empty());
}

TEST(WindowsCommandLineTest, ResolvesProgramsLikeTheHostPromises) {
  char temp[MAX_PATH];
  const std::string dir = std::string(temp, ::GetTempPathA(sizeof temp, temp)) + "sorvik-resolve-" +
                          std::to_string(::GetCurrentProcessId());
  ::CreateDirectoryA(dir.c_str(), nullptr);
  ::CreateDirectoryA((dir + "\\scripts").c_str(), nullptr);
  for (const std::string name : {"\\kelp.exe", "\\scripts\\update.ps1"}) {
    ::CloseHandle(::CreateFileA((dir + name).c_str(), GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS, 0, nullptr));
  }
  std::string path;
  EXPECT_EQ(resolveWindowsProgram("./kelp", dir, &path), 0);
  EXPECT_EQ(path, dir + "\\kelp.exe");
  EXPECT_EQ(resolveWindowsProgram("scripts/update.ps1", dir, &path), 0);
  EXPECT_EQ(path, dir + "\\scripts\\update.ps1");
  EXPECT_EQ(resolveWindowsProgram("./curl", dir, &path), ENOENT);
  EXPECT_EQ(resolveWindowsProgram("cmd", dir, &path), 0);
  EXPECT_EQ(path, "cmd");  // left to CreateProcess's search
  ::DeleteFileA((dir + "\\kelp.exe").c_str());
  ::DeleteFileA((dir + "\\scripts\\update.ps1").c_str());
  ::RemoveDirectoryA((dir + "\\scripts").c_str());
  ::RemoveDirectoryA(dir.c_str());

  ::SetEnvironmentVariableA("SORVIK_BLOCK_TEST", "old");
  const std::string block = windowsEnvironmentBlock({"sorvik_block_test=new", "SORVIK_HOST_PID=42", "junk"});
  EXPECT_NE(block.find(std::string("sorvik_block_test=new\0", 22)), std::string::npos);
  EXPECT_EQ(block.find("SORVIK_BLOCK_TEST=old"), std::string::npos);
  EXPECT_NE(block.find(std::string("SORVIK_HOST_PID=42\0", 19)), std::string::npos);
  EXPECT_EQ(block.find("junk"), std::string::npos);
  EXPECT_EQ(block.substr(block.size() - 2), std::string(2, '\0'));
  ::SetEnvironmentVariableA("SORVIK_BLOCK_TEST", nullptr);
}

}  // namespace
}  // namespace sorvik::host
