// POSIX implementation of the process runner: posix_spawn for the start (it
// reports the real errno of a failed exec), non-blocking pipes and one poll
// loop for all children, and a pidfd per child to notice its end without a
// SIGCHLD handler.

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <deque>
#include <thread>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/packet.h"
#include "Sorvik/platform/mutex.h"
#include "host/posix_spawn_command.h"
#include "host/process_runner.h"

extern char** environ;

namespace sorvik::host {
namespace {

using Clock = std::chrono::steady_clock;
using ko::ipc::PacketType;

// Children whose end cannot be watched through a pidfd are polled this often.
constexpr int kReapPollMs = 50;

void closeFd(int* fd) {
  if (*fd >= 0) ::close(*fd);
  *fd = -1;
}

int openPidFd(pid_t pid) {
#ifdef SYS_pidfd_open
  const long fd = ::syscall(SYS_pidfd_open, pid, 0);
  return fd < 0 ? -1 : static_cast<int>(fd);
#else
  (void)pid;
  return -1;
#endif
}

struct Child {
  uint32_t id = 0;
  bool attached = true;
  pid_t pid = -1;
  int pidFd = -1;
  int stdinFd = -1;
  int outFd[2] = {-1, -1};  // stdout, stderr
  std::deque<std::string> stdinQueue;
  size_t stdinOffset = 0;  // bytes of stdinQueue.front() already written
  bool closeWhenDrained = false;
  Clock::time_point closeDeadline = Clock::time_point::max();
  bool reaped = false;
  int32_t exitCode = 0;

  ~Child() {
    closeFd(&pidFd);
    closeFd(&stdinFd);
    closeFd(&outFd[0]);
    closeFd(&outFd[1]);
  }
};

enum class ItemKind { Packet, Flush, Detach, Stop };
struct Item {
  ItemKind kind = ItemKind::Packet;
  std::string bytes;
};

// Thread-safe: the queue and counters are guarded by mu_; children_ and
// every descriptor are touched by the runner thread alone.
class PosixProcessRunner final : public ProcessRunner {
 public:
  PosixProcessRunner(RunnerOptions options, PacketDelivery deliver, RunnerNotice notice)
      : options_(std::move(options)), deliver_(std::move(deliver)), notice_(std::move(notice)) {}

  ~PosixProcessRunner() override {
    stop();
    closeFd(&wakeRead_);
    closeFd(&wakeWrite_);
  }

  bool start(std::string* error) override {
    int fds[2];
    if (::pipe2(fds, O_CLOEXEC | O_NONBLOCK) != 0) {
      *error = std::string("cannot create wake pipe: ") + std::strerror(errno);
      return false;
    }
    wakeRead_ = fds[0];
    wakeWrite_ = fds[1];
    // A child that closes its stdin early must cost an EPIPE, not the host.
    struct sigaction current;
    if (::sigaction(SIGPIPE, nullptr, &current) == 0 && current.sa_handler == SIG_DFL) ::signal(SIGPIPE, SIG_IGN);
    {
      MutexLock lock(&mu_);
      running_ = true;
    }
    thread_ = std::thread([this] { run(); });
    return true;
  }

  void submit(const unsigned char* packet, size_t length) override {
    Item item;
    item.bytes.assign(reinterpret_cast<const char*>(packet), length);
    post(std::move(item));
  }

  void flush() override { barrier(ItemKind::Flush); }

  void detachAll() override { barrier(ItemKind::Detach); }

  void stop() override {
    {
      MutexLock lock(&mu_);
      if (!running_) return;
      queue_.push_back(Item{ItemKind::Stop, {}});
    }
    wake();
    if (thread_.joinable()) thread_.join();
  }

  size_t childCount() override {
    MutexLock lock(&mu_);
    return childCount_;
  }

 private:
  // CondVar's annotation names its own mutex pointer, which the analysis
  // cannot equate with mu_.
  void waitForRunner() REQUIRES(mu_) NO_THREAD_SAFETY_ANALYSIS { cv_.wait(); }

  // Queues `kind` behind everything submitted so far and waits until the
  // runner thread has reached it.
  void barrier(ItemKind kind) {
    uint64_t ticket;
    {
      MutexLock lock(&mu_);
      if (!running_) return;
      ticket = ++barriersRequested_;
      queue_.push_back(Item{kind, {}});
    }
    wake();
    MutexLock lock(&mu_);
    while (barriersDone_ < ticket && running_) waitForRunner();
  }

  void post(Item item) {
    {
      MutexLock lock(&mu_);
      if (!running_) return;
      queue_.push_back(std::move(item));
    }
    wake();
  }

  void wake() {
    const char byte = 1;
    // A full pipe already guarantees a wake-up.
    while (::write(wakeWrite_, &byte, 1) < 0 && errno == EINTR) {
    }
  }

  void run() {
    bool stopping = false;
    while (!stopping) {
      std::deque<Item> items;
      {
        MutexLock lock(&mu_);
        items.swap(queue_);
      }
      for (Item& item : items) {
        if (item.kind == ItemKind::Stop) {
          stopping = true;
          break;
        }
        if (item.kind == ItemKind::Flush || item.kind == ItemKind::Detach) {
          if (item.kind == ItemKind::Detach) detachChildren();
          MutexLock lock(&mu_);
          ++barriersDone_;
          cv_.signalAll();
          continue;
        }
        handlePacket(item.bytes);
      }
      if (stopping) break;
      pollOnce();
    }
    children_.clear();
    MutexLock lock(&mu_);
    running_ = false;
    childCount_ = 0;
    cv_.signalAll();
  }

  void updateCount() {
    MutexLock lock(&mu_);
    childCount_ = children_.size();
  }

  void sendPacket(uint32_t id, PacketType type, uint32_t value, const char* data = nullptr, size_t length = 0) {
    std::string packet(ko::ipc::kPacketHeaderSize + length, '\0');
    ko::ipc::PacketHeader header;
    header.total_length = static_cast<uint32_t>(packet.size());
    header.id = id;
    header.type = static_cast<uint32_t>(type);
    header.value = value;
    ko::ipc::encodePacketHeader(header, reinterpret_cast<unsigned char*>(&packet[0]));
    if (length != 0) std::memcpy(&packet[ko::ipc::kPacketHeaderSize], data, length);
    deliver_(reinterpret_cast<const unsigned char*>(packet.data()), packet.size());
  }

  Child* findAttached(uint32_t id) {
    for (auto& child : children_) {
      if (child->attached && child->id == id && !child->reaped) return child.get();
    }
    return nullptr;
  }

  void handlePacket(const std::string& bytes) {
    dispatchPluginPacket(bytes, notice_,
                         {[this](const auto& header, const unsigned char* payload, size_t length) {
                            startChild(header, payload, length);
                          },
                          [this](const auto& header, size_t packetLength, const unsigned char* payload,
                                 size_t length) { queueStdin(header, packetLength, payload, length); }});
  }

  void startChild(const ko::ipc::PacketHeader& header, const unsigned char* payload, size_t length) {
    StartPayload start;
    if (!decodeStartPayload(payload, length, header.value, &start)) {
      notice_("runner: malformed start request for id " + std::to_string(header.id));
      sendPacket(header.id, PacketType::StartFailed, EINVAL);
      return;
    }
    if (Child* old = findAttached(header.id)) {
      notice_("runner: id " + std::to_string(header.id) + " reused while pid " + std::to_string(old->pid) +
              " runs; detaching that child");
      old->attached = false;
    }
    SpawnCommand command;
    command.args = start.args;
    command.workingDir = options_.workingDir;
    command.childDir = start.textA;
    command.ps1Interpreter = options_.ps1Interpreter;
    command.piped = (header.value & ko::ipc::kSpawnPiped) != 0;
    command.inheritOutput = options_.inheritOutput;
    command.extraEnvironment = options_.extraEnvironment;
    SpawnedProcess process;
    const int error = spawnProcess(command, &process);
    if (error != 0) {
      sendPacket(header.id, PacketType::StartFailed, static_cast<uint32_t>(error));
      return;
    }
    auto child = std::make_unique<Child>();
    child->id = header.id;
    child->pid = process.pid;
    child->pidFd = openPidFd(process.pid);
    child->stdinFd = process.stdinFd;
    child->outFd[0] = process.stdoutFd;
    child->outFd[1] = process.stderrFd;
    children_.push_back(std::move(child));
    updateCount();
    sendPacket(header.id, PacketType::Started, static_cast<uint32_t>(process.pid));
  }

  void queueStdin(const ko::ipc::PacketHeader& header, size_t packetLength, const unsigned char* payload,
                  size_t length) {
    Child* child = findAttached(header.id);
    // A child that has ended or has no pipe simply loses the bytes.
    if (child == nullptr || child->stdinFd < 0) return;
    if (length != 0) child->stdinQueue.emplace_back(reinterpret_cast<const char*>(payload), length);
    child->closeDeadline = Clock::time_point::max();
    switch (stdinCloseFor(header.value, packetLength)) {
      case StdinClose::Keep:
        return;
      case StdinClose::AfterQuietPeriod:
        child->closeDeadline = Clock::now() + std::chrono::milliseconds(options_.closeGraceMs);
        return;
      case StdinClose::WhenDrained:
        child->closeWhenDrained = true;
        return;
    }
  }

  void detachChildren() {
    for (auto& child : children_) {
      if (!child->attached) continue;
      child->attached = false;
      child->stdinQueue.clear();
      child->closeWhenDrained = false;
      child->closeDeadline = Clock::time_point::max();
    }
  }

  // Reads one piece of stream `index`; false at end of file or error.
  bool readOutput(Child* child, int index) {
    char buffer[ko::ipc::kMaxPacketPayload];
    while (true) {
      const ssize_t n = ::read(child->outFd[index], buffer, sizeof(buffer));
      if (n > 0) {
        if (child->attached) {
          sendPacket(child->id, index == 0 ? PacketType::StdoutData : PacketType::StderrData, 0, buffer,
                     static_cast<size_t>(n));
        }
        return true;
      }
      if (n < 0 && errno == EINTR) continue;
      if (n < 0 && errno == EAGAIN) return true;
      closeFd(&child->outFd[index]);
      return false;
    }
  }

  // Everything the child wrote before it ended, without waiting for writers
  // it may have left behind (a background grandchild keeps the pipe open).
  void drainOutput(Child* child, int index) {
    char buffer[ko::ipc::kMaxPacketPayload];
    while (child->outFd[index] >= 0) {
      const ssize_t n = ::read(child->outFd[index], buffer, sizeof(buffer));
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) break;
      if (child->attached) {
        sendPacket(child->id, index == 0 ? PacketType::StdoutData : PacketType::StderrData, 0, buffer,
                   static_cast<size_t>(n));
      }
    }
    closeFd(&child->outFd[index]);
  }

  void writeStdin(Child* child) {
    while (child->stdinFd >= 0 && !child->stdinQueue.empty()) {
      const std::string& front = child->stdinQueue.front();
      const ssize_t n = ::write(child->stdinFd, front.data() + child->stdinOffset, front.size() - child->stdinOffset);
      if (n < 0 && errno == EINTR) continue;
      if (n < 0 && errno == EAGAIN) return;
      if (n < 0) {
        // The child closed its end: nothing queued can reach it any more.
        child->stdinQueue.clear();
        child->stdinOffset = 0;
        closeFd(&child->stdinFd);
        return;
      }
      child->stdinOffset += static_cast<size_t>(n);
      if (child->stdinOffset == front.size()) {
        child->stdinQueue.pop_front();
        child->stdinOffset = 0;
      }
    }
  }

  void settleStdin(Child* child, Clock::time_point now) {
    if (child->stdinFd < 0) return;
    if (child->closeDeadline <= now) {
      child->closeDeadline = Clock::time_point::max();
      child->closeWhenDrained = true;
    }
    if (child->closeWhenDrained && child->stdinQueue.empty()) closeFd(&child->stdinFd);
  }

  // True when the child has ended and was reaped now.
  bool tryReap(Child* child) {
    int status = 0;
    pid_t r;
    do {
      r = ::waitpid(child->pid, &status, WNOHANG);
    } while (r < 0 && errno == EINTR);
    if (r == 0) return false;
    if (r < 0) {
      // Someone else reaped it (SIGCHLD ignored); the code is unknown.
      child->exitCode = 0;
    } else if (WIFEXITED(status)) {
      child->exitCode = WEXITSTATUS(status);
    } else if (WIFSIGNALED(status)) {
      child->exitCode = exitCodeForSignal(WTERMSIG(status));
    } else {
      return false;  // stopped or continued: still alive
    }
    child->reaped = true;
    return true;
  }

  void finishChild(Child* child) {
    drainOutput(child, 0);
    drainOutput(child, 1);
    closeFd(&child->stdinFd);
    if (child->attached) {
      sendPacket(child->id, PacketType::Exited, static_cast<uint32_t>(child->exitCode));
    } else {
      notice_("runner: detached child pid " + std::to_string(child->pid) + " exited with code " +
              std::to_string(child->exitCode));
    }
  }

  enum Slot { kWake, kPid, kOut, kErr, kIn };
  struct Watch {
    Child* child;
    Slot slot;
  };

  void pollOnce() {
    std::vector<pollfd> fds;
    std::vector<Watch> watches;
    fds.push_back(pollfd{wakeRead_, POLLIN, 0});
    watches.push_back(Watch{nullptr, kWake});
    const Clock::time_point now = Clock::now();
    Clock::time_point nextDeadline = Clock::time_point::max();
    bool needsReapPoll = false;
    for (auto& owned : children_) {
      Child* child = owned.get();
      if (child->pidFd >= 0) {
        fds.push_back(pollfd{child->pidFd, POLLIN, 0});
        watches.push_back(Watch{child, kPid});
      } else {
        needsReapPoll = true;
      }
      if (child->outFd[0] >= 0) {
        fds.push_back(pollfd{child->outFd[0], POLLIN, 0});
        watches.push_back(Watch{child, kOut});
      }
      if (child->outFd[1] >= 0) {
        fds.push_back(pollfd{child->outFd[1], POLLIN, 0});
        watches.push_back(Watch{child, kErr});
      }
      if (child->stdinFd >= 0 && !child->stdinQueue.empty()) {
        fds.push_back(pollfd{child->stdinFd, POLLOUT, 0});
        watches.push_back(Watch{child, kIn});
      }
      if (child->closeDeadline < nextDeadline) nextDeadline = child->closeDeadline;
    }
    int timeoutMs = -1;
    if (nextDeadline != Clock::time_point::max()) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(nextDeadline - now).count();
      timeoutMs = left < 0 ? 0 : static_cast<int>(left) + 1;
    }
    if (needsReapPoll && (timeoutMs < 0 || timeoutMs > kReapPollMs)) timeoutMs = kReapPollMs;

    const int ready = ::poll(fds.data(), fds.size(), timeoutMs);
    if (ready < 0 && errno != EINTR) {
      notice_(std::string("runner: poll failed: ") + std::strerror(errno));
      return;
    }
    bool checkExits = needsReapPoll;
    for (size_t i = 0; ready > 0 && i < fds.size(); ++i) {
      if (fds[i].revents == 0) continue;
      Child* child = watches[i].child;
      switch (watches[i].slot) {
        case kWake: {
          char sink[256];
          while (::read(wakeRead_, sink, sizeof(sink)) > 0) {
          }
          break;
        }
        case kPid:
          checkExits = true;
          break;
        case kOut:
          readOutput(child, 0);
          break;
        case kErr:
          readOutput(child, 1);
          break;
        case kIn:
          writeStdin(child);
          break;
      }
    }
    const Clock::time_point after = Clock::now();
    for (auto& owned : children_) settleStdin(owned.get(), after);
    if (!checkExits) return;
    std::vector<std::unique_ptr<Child>> alive;
    std::vector<std::unique_ptr<Child>> ended;
    for (auto& owned : children_) {
      (!owned->reaped && tryReap(owned.get()) ? ended : alive).push_back(std::move(owned));
    }
    children_.swap(alive);
    if (ended.empty()) return;
    // Counted out before the plug-in hears of the end.
    updateCount();
    for (auto& child : ended) finishChild(child.get());
  }

  const RunnerOptions options_;
  const PacketDelivery deliver_;
  const RunnerNotice notice_;
  int wakeRead_ = -1;
  int wakeWrite_ = -1;
  std::thread thread_;

  Mutex mu_;
  CondVar cv_{&mu_};
  std::deque<Item> queue_ GUARDED_BY(mu_);
  bool running_ GUARDED_BY(mu_) = false;
  uint64_t barriersRequested_ GUARDED_BY(mu_) = 0;
  uint64_t barriersDone_ GUARDED_BY(mu_) = 0;
  size_t childCount_ GUARDED_BY(mu_) = 0;

  std::vector<std::unique_ptr<Child>> children_;  // runner thread only
};

}  // namespace

std::unique_ptr<ProcessRunner> newProcessRunner(RunnerOptions options, PacketDelivery deliver, RunnerNotice notice) {
  return std::make_unique<PosixProcessRunner>(std::move(options), std::move(deliver), std::move(notice));
}

}  // namespace sorvik::host
