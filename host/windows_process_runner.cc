// Win32 implementation of the process runner: CreateProcess with pipes for
// the three standard streams, where only those three handles are
// inherited (an explicit handle list), and a few threads per child: one
// reader per output pipe, one stdin writer and one that waits for the end.
// They hand their events to the runner thread, which alone delivers
// packets, so a child's output always arrives after its Started and before
// its Exited.

#include <windows.h>

#include <cctype>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <deque>
#include <map>
#include <memory>
#include <thread>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/packet.h"
#include "Sorvik/platform/mutex.h"
#include "Sorvik/platform/windows/win32_errno.h"
#include "host/process_runner.h"
#include "host/windows_command_line.h"

namespace sorvik::host {
namespace {

using Clock = std::chrono::steady_clock;
using ko::ipc::PacketType;

// How long an ended child's output may still arrive before Exited is sent
// anyway (a grandchild may hold the pipe open).
constexpr auto kOutputGrace = std::chrono::milliseconds(500);

enum class ItemKind { Packet, Flush, Detach, Stop, Output, OutputEnd, Exit };
struct Item {
  ItemKind kind = ItemKind::Packet;
  std::string bytes;
  uint64_t child = 0;  // Output, OutputEnd, Exit: the runner's serial number
  int stream = 0;      // 0 stdout, 1 stderr
  uint32_t exitCode = 0;
};

// The runner's inbox. Shared with the threads that watch children, which
// may outlive the runner: a child keeps running after stop().
class Inbox {
 public:
  void push(Item item) {
    MutexLock lock(&mu_);
    if (closed_) return;
    items_.push_back(std::move(item));
    arrived_.signalAll();
  }
  // Everything queued, once there is something or `deadline` has passed.
  std::deque<Item> take(Clock::time_point deadline) {
    MutexLock lock(&mu_);
    while (items_.empty() && waitUntil(deadline)) {
    }
    std::deque<Item> out;
    out.swap(items_);
    return out;
  }
  void close() {
    MutexLock lock(&mu_);
    closed_ = true;
    items_.clear();
  }

 private:
  bool waitUntil(Clock::time_point deadline) REQUIRES(mu_) NO_THREAD_SAFETY_ANALYSIS {
    if (deadline == Clock::time_point::max()) {
      arrived_.wait();
      return true;
    }
    return arrived_.waitUntil(deadline);
  }

  Mutex mu_;
  CondVar arrived_{&mu_};
  std::deque<Item> items_ GUARDED_BY(mu_);
  bool closed_ GUARDED_BY(mu_) = false;
};

// Feeds one child's standard input from its own thread, so a child that
// does not read never blocks the runner.
class StdinWriter {
 public:
  explicit StdinWriter(HANDLE pipe) : pipe_(pipe) {}

  static void start(const std::shared_ptr<StdinWriter>& self) {
    std::thread([self] { self->run(); }).detach();
  }
  void send(std::string bytes) {
    MutexLock lock(&mu_);
    if (!bytes.empty()) queue_.push_back(std::move(bytes));
    closeDeadline_ = Clock::time_point::max();
    changed_.signalAll();
  }
  void closeWhenDrained() {
    MutexLock lock(&mu_);
    closeWhenDrained_ = true;
    changed_.signalAll();
  }
  void closeAfter(Clock::time_point deadline) {
    MutexLock lock(&mu_);
    closeDeadline_ = deadline;
    changed_.signalAll();
  }
  // The child's id was forgotten: nothing more goes in, nothing is closed.
  void discard() {
    MutexLock lock(&mu_);
    queue_.clear();
    closeWhenDrained_ = false;
    closeDeadline_ = Clock::time_point::max();
    changed_.signalAll();
  }
  // The child has ended.
  void finish() {
    MutexLock lock(&mu_);
    queue_.clear();
    closeWhenDrained_ = true;
    changed_.signalAll();
  }

 private:
  bool wait() REQUIRES(mu_) NO_THREAD_SAFETY_ANALYSIS {
    if (closeDeadline_ == Clock::time_point::max()) {
      changed_.wait();
      return true;
    }
    return changed_.waitUntil(closeDeadline_);
  }

  void run() {
    for (;;) {
      std::string chunk;
      {
        MutexLock lock(&mu_);
        while (queue_.empty() && !closeWhenDrained_) {
          if (closeDeadline_ <= Clock::now()) {
            closeWhenDrained_ = true;
            break;
          }
          wait();
        }
        if (queue_.empty()) break;
        chunk = std::move(queue_.front());
        queue_.pop_front();
      }
      size_t done = 0;
      while (done < chunk.size()) {
        DWORD written = 0;
        const DWORD want = static_cast<DWORD>(chunk.size() - done);
        if (!::WriteFile(pipe_, chunk.data() + done, want, &written, nullptr)) {
          // The child closed its end: nothing queued can reach it any more.
          ::CloseHandle(pipe_);
          return;
        }
        done += written;
      }
    }
    ::CloseHandle(pipe_);
  }

  const HANDLE pipe_;
  Mutex mu_;
  CondVar changed_{&mu_};
  std::deque<std::string> queue_ GUARDED_BY(mu_);
  bool closeWhenDrained_ GUARDED_BY(mu_) = false;
  Clock::time_point closeDeadline_ GUARDED_BY(mu_) = Clock::time_point::max();
};

void readOutput(std::shared_ptr<Inbox> inbox, uint64_t child, int stream, HANDLE pipe) {
  char buffer[ko::ipc::kMaxPacketPayload];
  DWORD n = 0;
  while (::ReadFile(pipe, buffer, sizeof buffer, &n, nullptr) && n > 0) {
    Item item;
    item.kind = ItemKind::Output;
    item.child = child;
    item.stream = stream;
    item.bytes.assign(buffer, n);
    inbox->push(std::move(item));
  }
  ::CloseHandle(pipe);
  Item end;
  end.kind = ItemKind::OutputEnd;
  end.child = child;
  end.stream = stream;
  inbox->push(std::move(end));
}

void awaitExit(std::shared_ptr<Inbox> inbox, uint64_t child, HANDLE process) {
  ::WaitForSingleObject(process, INFINITE);
  DWORD code = 0;
  if (!::GetExitCodeProcess(process, &code)) code = 0;
  ::CloseHandle(process);
  Item item;
  item.kind = ItemKind::Exit;
  item.child = child;
  item.exitCode = code;
  inbox->push(std::move(item));
}

struct Child {
  uint32_t id = 0;
  bool attached = true;
  uint32_t pid = 0;
  std::shared_ptr<StdinWriter> stdinWriter;  // null without pipes
  bool outputOpen[2] = {false, false};
  bool exited = false;
  uint32_t exitCode = 0;
  Clock::time_point exitSeen;
};

// Closes what it holds unless released.
class HandleSet {
 public:
  ~HandleSet() {
    for (HANDLE h : handles_) ::CloseHandle(h);
  }
  HANDLE add(HANDLE h) {
    if (h != nullptr && h != INVALID_HANDLE_VALUE) handles_.push_back(h);
    return h;
  }
  void release(HANDLE h) {
    for (auto& held : handles_) {
      if (held == h) held = nullptr;
    }
    std::vector<HANDLE> kept;
    for (HANDLE held : handles_) {
      if (held != nullptr) kept.push_back(held);
    }
    handles_.swap(kept);
  }

 private:
  std::vector<HANDLE> handles_;
};

// A pipe whose child end alone is inheritable. False with GetLastError set.
bool makePipe(HandleSet* handles, HANDLE* parentEnd, HANDLE* childEnd, bool childReads) {
  HANDLE read = nullptr, write = nullptr;
  if (!::CreatePipe(&read, &write, nullptr, 0)) return false;
  handles->add(read);
  handles->add(write);
  *parentEnd = childReads ? write : read;
  *childEnd = childReads ? read : write;
  return ::SetHandleInformation(*childEnd, HANDLE_FLAG_INHERIT, HANDLE_FLAG_INHERIT) != 0;
}

HANDLE openNul(HandleSet* handles, bool forWriting) {
  SECURITY_ATTRIBUTES inheritable{sizeof(SECURITY_ATTRIBUTES), nullptr, TRUE};
  return handles->add(::CreateFileA("NUL", forWriting ? GENERIC_WRITE : GENERIC_READ,
                                    FILE_SHARE_READ | FILE_SHARE_WRITE, &inheritable, OPEN_EXISTING, 0, nullptr));
}

// An inheritable copy of one of the host's own standard handles, or NUL.
HANDLE inheritableStdHandle(HandleSet* handles, DWORD which) {
  HANDLE own = ::GetStdHandle(which);
  HANDLE copy = nullptr;
  if (own != nullptr && own != INVALID_HANDLE_VALUE &&
      ::DuplicateHandle(::GetCurrentProcess(), own, ::GetCurrentProcess(), &copy, 0, TRUE, DUPLICATE_SAME_ACCESS)) {
    return handles->add(copy);
  }
  return openNul(handles, true);
}

bool endsWithPs1(const std::string& program) {
  if (program.size() < 4) return false;
  std::string tail = program.substr(program.size() - 4);
  for (char& c : tail) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return tail == ".ps1";
}

class WindowsProcessRunner final : public ProcessRunner {
 public:
  WindowsProcessRunner(RunnerOptions options, PacketDelivery deliver, RunnerNotice notice)
      : options_(std::move(options)), deliver_(std::move(deliver)), notice_(std::move(notice)) {}

  ~WindowsProcessRunner() override { stop(); }

  bool start(std::string* /*error*/) override {
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
    }
    inbox_->push(Item{ItemKind::Stop, {}, 0, 0, 0});
    if (thread_.joinable()) thread_.join();
  }

  size_t childCount() override {
    MutexLock lock(&mu_);
    return childCount_;
  }

 private:
  void waitForRunner() REQUIRES(mu_) NO_THREAD_SAFETY_ANALYSIS { done_.wait(); }

  void barrier(ItemKind kind) {
    uint64_t ticket;
    {
      MutexLock lock(&mu_);
      if (!running_) return;
      ticket = ++barriersRequested_;
    }
    inbox_->push(Item{kind, {}, 0, 0, 0});
    MutexLock lock(&mu_);
    while (barriersDone_ < ticket && running_) waitForRunner();
  }

  void post(Item item) {
    {
      MutexLock lock(&mu_);
      if (!running_) return;
    }
    inbox_->push(std::move(item));
  }

  void run() {
    bool stopping = false;
    while (!stopping) {
      for (Item& item : inbox_->take(nextDeadline())) {
        if (item.kind == ItemKind::Stop) {
          stopping = true;
          break;
        }
        handle(item);
      }
      finishEndedChildren();
    }
    // Children keep running; their threads find the inbox closed.
    inbox_->close();
    for (auto& [serial, child] : children_) {
      if (child.stdinWriter) child.stdinWriter->discard();
    }
    children_.clear();
    MutexLock lock(&mu_);
    running_ = false;
    childCount_ = 0;
    done_.signalAll();
  }

  void handle(Item& item) {
    switch (item.kind) {
      case ItemKind::Flush:
      case ItemKind::Detach: {
        if (item.kind == ItemKind::Detach) detachChildren();
        MutexLock lock(&mu_);
        ++barriersDone_;
        done_.signalAll();
        return;
      }
      case ItemKind::Packet:
        handlePacket(item.bytes);
        return;
      case ItemKind::Output: {
        auto it = children_.find(item.child);
        if (it != children_.end() && it->second.attached) {
          sendPacket(it->second.id, item.stream == 0 ? PacketType::StdoutData : PacketType::StderrData, 0,
                     item.bytes.data(), item.bytes.size());
        }
        return;
      }
      case ItemKind::OutputEnd: {
        auto it = children_.find(item.child);
        if (it != children_.end()) it->second.outputOpen[item.stream] = false;
        return;
      }
      case ItemKind::Exit: {
        auto it = children_.find(item.child);
        if (it == children_.end()) return;
        it->second.exited = true;
        it->second.exitCode = item.exitCode;
        it->second.exitSeen = Clock::now();
        if (it->second.stdinWriter) it->second.stdinWriter->finish();
        return;
      }
      case ItemKind::Stop:
        return;
    }
  }

  Clock::time_point nextDeadline() const {
    Clock::time_point next = Clock::time_point::max();
    for (const auto& [serial, child] : children_) {
      if (child.exited && child.exitSeen + kOutputGrace < next) next = child.exitSeen + kOutputGrace;
    }
    return next;
  }

  void finishEndedChildren() {
    const Clock::time_point now = Clock::now();
    std::vector<Child> ended;
    for (auto it = children_.begin(); it != children_.end();) {
      const Child& child = it->second;
      const bool drained = !child.outputOpen[0] && !child.outputOpen[1];
      if (child.exited && (drained || child.exitSeen + kOutputGrace <= now)) {
        ended.push_back(std::move(it->second));
        it = children_.erase(it);
      } else {
        ++it;
      }
    }
    if (ended.empty()) return;
    // Counted out before the plug-in hears of the end.
    updateCount();
    for (const Child& child : ended) {
      if (child.attached) {
        sendPacket(child.id, PacketType::Exited, child.exitCode);
      } else {
        notice_("runner: detached child pid " + std::to_string(child.pid) + " exited with code " +
                std::to_string(child.exitCode));
      }
    }
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
    for (auto& [serial, child] : children_) {
      if (child.attached && child.id == id && !child.exited) return &child;
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

  void queueStdin(const ko::ipc::PacketHeader& header, size_t packetLength, const unsigned char* payload,
                  size_t length) {
    Child* child = findAttached(header.id);
    // A child that has ended or has no pipe simply loses the bytes.
    if (child == nullptr || !child->stdinWriter) return;
    child->stdinWriter->send(std::string(reinterpret_cast<const char*>(payload), length));
    switch (stdinCloseFor(header.value, packetLength)) {
      case StdinClose::Keep:
        return;
      case StdinClose::AfterQuietPeriod:
        child->stdinWriter->closeAfter(Clock::now() + std::chrono::milliseconds(options_.closeGraceMs));
        return;
      case StdinClose::WhenDrained:
        child->stdinWriter->closeWhenDrained();
        return;
    }
  }

  void detachChildren() {
    for (auto& [serial, child] : children_) {
      if (!child.attached) continue;
      child.attached = false;
      if (child.stdinWriter) child.stdinWriter->discard();
    }
  }

  // The directory a child starts in: the working directory, then the
  // request's own directory below it.
  std::string childDirectory(const std::string& requested) const {
    std::string dir = options_.workingDir;
    if (!requested.empty()) dir = dir.empty() ? requested : dir + "\\" + requested;
    return dir;
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
      if (old->stdinWriter) old->stdinWriter->discard();
    }
    std::string program;
    if (const int error = resolveWindowsProgram(start.args[0], options_.workingDir, &program); error != 0) {
      sendPacket(header.id, PacketType::StartFailed, static_cast<uint32_t>(error));
      return;
    }
    std::vector<std::string> argv;
    if (endsWithPs1(program)) {
      argv.push_back(options_.ps1Interpreter);
      for (auto& a : ps1InterpreterArguments(options_.ps1Interpreter)) argv.push_back(a);
    }
    argv.push_back(program);
    argv.insert(argv.end(), start.args.begin() + 1, start.args.end());

    const bool piped = (header.value & ko::ipc::kSpawnPiped) != 0;
    HandleSet handles;
    HANDLE childIn = nullptr, childOut = nullptr, childErr = nullptr;
    HANDLE parentIn = nullptr, parentOut = nullptr, parentErr = nullptr;
    bool ok = true;
    if (piped) {
      ok = makePipe(&handles, &parentIn, &childIn, true) && makePipe(&handles, &parentOut, &childOut, false) &&
           makePipe(&handles, &parentErr, &childErr, false);
    } else {
      childIn = openNul(&handles, false);
      childOut = options_.inheritOutput ? inheritableStdHandle(&handles, STD_OUTPUT_HANDLE) : openNul(&handles, true);
      childErr = options_.inheritOutput ? inheritableStdHandle(&handles, STD_ERROR_HANDLE) : openNul(&handles, true);
      ok = childIn != INVALID_HANDLE_VALUE && childOut != INVALID_HANDLE_VALUE && childErr != INVALID_HANDLE_VALUE;
    }
    PROCESS_INFORMATION process{};
    if (ok) ok = createProcess(argv, childDirectory(start.textA), childIn, childOut, childErr, &process);
    if (!ok) {
      sendPacket(header.id, PacketType::StartFailed,
                 static_cast<uint32_t>(platform::errnoFromWin32Error(::GetLastError())));
      return;
    }
    ::CloseHandle(process.hThread);

    const uint64_t serial = ++nextSerial_;
    Child child;
    child.id = header.id;
    child.pid = process.dwProcessId;
    if (piped) {
      handles.release(parentIn);
      handles.release(parentOut);
      handles.release(parentErr);
      child.stdinWriter = std::make_shared<StdinWriter>(parentIn);
      StdinWriter::start(child.stdinWriter);
      child.outputOpen[0] = child.outputOpen[1] = true;
      std::thread(readOutput, inbox_, serial, 0, parentOut).detach();
      std::thread(readOutput, inbox_, serial, 1, parentErr).detach();
    }
    std::thread(awaitExit, inbox_, serial, process.hProcess).detach();
    children_.emplace(serial, std::move(child));
    updateCount();
    sendPacket(header.id, PacketType::Started, process.dwProcessId);
  }

  // The child inherits exactly its three standard handles. False with
  // GetLastError set.
  bool createProcess(const std::vector<std::string>& argv, const std::string& directory, HANDLE in, HANDLE out,
                     HANDLE err, PROCESS_INFORMATION* process) {
    HANDLE inherit[3] = {in, out, err};
    size_t count = 0;
    for (HANDLE h : {in, out, err}) {
      bool seen = false;
      for (size_t i = 0; i < count; ++i) seen = seen || inherit[i] == h;
      if (!seen) inherit[count++] = h;
    }
    SIZE_T size = 0;
    ::InitializeProcThreadAttributeList(nullptr, 1, 0, &size);
    std::vector<char> storage(size);
    auto* attributes = reinterpret_cast<LPPROC_THREAD_ATTRIBUTE_LIST>(storage.data());
    if (!::InitializeProcThreadAttributeList(attributes, 1, 0, &size)) return false;
    bool ok = ::UpdateProcThreadAttribute(attributes, 0, PROC_THREAD_ATTRIBUTE_HANDLE_LIST, inherit,
                                          count * sizeof(HANDLE), nullptr, nullptr) != 0;
    if (ok) {
      STARTUPINFOEXA info{};
      info.StartupInfo.cb = sizeof(info);
      info.StartupInfo.dwFlags = STARTF_USESTDHANDLES;
      info.StartupInfo.hStdInput = in;
      info.StartupInfo.hStdOutput = out;
      info.StartupInfo.hStdError = err;
      info.lpAttributeList = attributes;
      std::string commandLine = windowsCommandLine(argv);
      std::string environment = windowsEnvironmentBlock(options_.extraEnvironment);
      ok = ::CreateProcessA(nullptr, commandLine.data(), nullptr, nullptr, TRUE, EXTENDED_STARTUPINFO_PRESENT,
                            environment.data(), directory.empty() ? nullptr : directory.c_str(), &info.StartupInfo,
                            process) != 0;
    }
    const DWORD error = ::GetLastError();
    ::DeleteProcThreadAttributeList(attributes);
    ::SetLastError(error);
    return ok;
  }

  const RunnerOptions options_;
  const PacketDelivery deliver_;
  const RunnerNotice notice_;
  const std::shared_ptr<Inbox> inbox_ = std::make_shared<Inbox>();
  std::thread thread_;

  Mutex mu_;
  CondVar done_{&mu_};
  bool running_ GUARDED_BY(mu_) = false;
  uint64_t barriersRequested_ GUARDED_BY(mu_) = 0;
  uint64_t barriersDone_ GUARDED_BY(mu_) = 0;
  size_t childCount_ GUARDED_BY(mu_) = 0;

  // Runner thread only.
  std::map<uint64_t, Child> children_;
  uint64_t nextSerial_ = 0;
};

}  // namespace

std::unique_ptr<ProcessRunner> newProcessRunner(RunnerOptions options, PacketDelivery deliver, RunnerNotice notice) {
  return std::make_unique<WindowsProcessRunner>(std::move(options), std::move(deliver), std::move(notice));
}

}  // namespace sorvik::host
