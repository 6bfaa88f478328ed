#include "host/fake_host.h"

#include <algorithm>
#include <utility>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/start_payload.h"
#include "Sorvik/plugin/host_callback.h"
#include "Sorvik/plugin/module.h"

namespace sorvik::testing {

namespace {

using ko::ipc::PacketType;

// The live instance. The slot's mutex is held while a callback runs, so the
// destructor cannot free the instance under a callback in flight.
Mutex gLiveMutex;
FakeHost* gLive GUARDED_BY(gLiveMutex) = nullptr;

constexpr size_t kOutputChunk = ko::ipc::kMaxPacketPayload;

std::string buildPacket(uint32_t type, uint32_t id, uint32_t value, const std::string& payload) {
  std::string packet(ko::ipc::kPacketHeaderSize + payload.size(), '\0');
  ko::ipc::PacketHeader header;
  header.total_length = static_cast<uint32_t>(packet.size());
  header.id = id;
  header.type = type;
  header.value = value;
  ko::ipc::encodePacketHeader(header, reinterpret_cast<unsigned char*>(&packet[0]));
  packet.replace(ko::ipc::kPacketHeaderSize, payload.size(), payload);
  return packet;
}

std::string payloadOf(const ko::core::HostMessage& message) {
  const auto* data = static_cast<const char*>(message.data());
  if (data == nullptr || message.length() == 0) return {};
  return std::string(data, message.length());
}

}  // namespace

ChildScript ChildScript::exits(int32_t code, std::string out, std::string err) {
  ChildScript script;
  if (!out.empty()) script.output.push_back({0, std::move(out)});
  if (!err.empty()) script.output.push_back({1, std::move(err)});
  script.exitCode = code;
  return script;
}

ChildScript ChildScript::exitsOnStdinClose(int32_t code, std::string out, std::string err) {
  ChildScript script = exits(code, std::move(out), std::move(err));
  script.finish = Finish::OnStdinClose;
  return script;
}

ChildScript ChildScript::failsToStart(int32_t errorNumber) {
  ChildScript script;
  script.answer = Answer::FailStart;
  script.startError = errorNumber;
  return script;
}

ChildScript ChildScript::runsUntilTold() {
  ChildScript script;
  script.finish = Finish::WhenTestSays;
  return script;
}

ChildScript ChildScript::neverAnswers() {
  ChildScript script;
  script.answer = Answer::NeverAnswer;
  return script;
}

FakeHost::FakeHost() : defaultScript_(ChildScript::failsToStart(2)) {
  {
    MutexLock lock(&mu_);
    sink_ = [](const unsigned char* packet, size_t length) { ko::ipc::receive(packet, length); };
  }
  {
    MutexLock lock(&gLiveMutex);
    gLive = this;
  }
  runner_ = std::thread([this] { runnerLoop(); });
}

FakeHost::~FakeHost() {
  {
    MutexLock lock(&mu_);
    stopping_ = true;
    tasks_.clear();
    changed_.signalAll();
  }
  runner_.join();
  // Ends every waiter on a child before the callback disappears.
  ko::ipc::shutdown(false);
  ko::ipc::set_transport(ko::core::kModuleId, nullptr);
  if (ko::core::hostCallback() == &FakeHost::callback) ko::core::setHostCallback(nullptr);
  MutexLock lock(&gLiveMutex);
  gLive = nullptr;
}

int32_t FakeHost::callback(void* message, uint64_t /*reserved*/) {
  if (message == nullptr) return 0;
  const ko::core::HostMessage copy = ko::core::copyHostMessage(message);
  MutexLock lock(&gLiveMutex);
  return gLive == nullptr ? 0 : gLive->handleMessage(copy);
}

void FakeHost::install() {
  ko::core::setHostCallback(&FakeHost::callback);
  ko::ipc::set_transport(ko::core::kModuleId, [](const unsigned char* bytes, uint64_t length) {
    ko::core::HostMessage message = ko::core::HostMessage::make(
        ko::core::kModuleId, ko::core::kTargetChildProcess, ko::core::kTypeChildProcessPacket, bytes, length);
    return FakeHost::callback(message.bytes, 0) == 0;
  });
}

std::vector<unsigned char> FakeHost::loadParmsIn() {
  std::vector<unsigned char> record(64, 0);
  ko::core::writePointer(record.data() + 16, reinterpret_cast<const void*>(&FakeHost::callback));
  return record;
}

FakeHost::Sink FakeHost::ioctlSink(IoctlEntry ioctl) {
  return [ioctl](const unsigned char* packet, size_t length) {
    unsigned char record[64] = {};
    ko::core::writeU32(record + 8, 4);
    ko::core::writeU32(record + 24, static_cast<uint32_t>(length));
    ko::core::writePointer(record + 32, packet);
    ioctl(record);
  };
}

void FakeHost::setSink(Sink sink) {
  MutexLock lock(&mu_);
  sink_ = std::move(sink);
}

void FakeHost::setThreshold(int32_t threshold) {
  MutexLock lock(&mu_);
  threshold_ = threshold;
}

void FakeHost::setPacketResult(int32_t result) {
  MutexLock lock(&mu_);
  packetResult_ = result;
}

void FakeHost::setScript(const std::string& program, ChildScript script) {
  MutexLock lock(&mu_);
  scripts_[program] = std::move(script);
}

void FakeHost::setDefaultScript(ChildScript script) {
  MutexLock lock(&mu_);
  defaultScript_ = std::move(script);
}

void FakeHost::sendOutput(uint32_t id, int stream, const std::string& bytes) {
  MutexLock lock(&mu_);
  const uint32_t type = static_cast<uint32_t>(stream == 0 ? PacketType::StdoutData : PacketType::StderrData);
  // A real runner never sends a packet over 64 KiB either.
  for (size_t at = 0; at < bytes.size(); at += kOutputChunk) {
    queuePacket(type, id, 0, bytes.substr(at, kOutputChunk));
  }
}

void FakeHost::exitChild(uint32_t id, int32_t code) {
  MutexLock lock(&mu_);
  queuePacket(static_cast<uint32_t>(PacketType::Exited), id, static_cast<uint32_t>(code), {});
}

void FakeHost::startChild(uint32_t id, uint32_t pid) {
  MutexLock lock(&mu_);
  queuePacket(static_cast<uint32_t>(PacketType::Started), id, pid, {});
}

void FakeHost::failChild(uint32_t id, int32_t errorNumber) {
  MutexLock lock(&mu_);
  queuePacket(static_cast<uint32_t>(PacketType::StartFailed), id, static_cast<uint32_t>(errorNumber), {});
}

void FakeHost::deliverRaw(std::string packet) {
  MutexLock lock(&mu_);
  queueDelivery(std::move(packet));
}

std::vector<LogRecord> FakeHost::logs() const {
  MutexLock lock(&mu_);
  return logs_;
}

std::vector<DocumentRecord> FakeHost::documents() const {
  MutexLock lock(&mu_);
  return documents_;
}

std::vector<PacketRecord> FakeHost::packets() const {
  MutexLock lock(&mu_);
  return packets_;
}

std::vector<StartRecord> FakeHost::starts() const {
  MutexLock lock(&mu_);
  return starts_;
}

std::string FakeHost::stdinOf(uint32_t id) const {
  MutexLock lock(&mu_);
  auto it = children_.find(id);
  return it == children_.end() ? std::string() : it->second.stdinBytes;
}

bool FakeHost::stdinClosed(uint32_t id) const {
  MutexLock lock(&mu_);
  auto it = children_.find(id);
  return it != children_.end() && it->second.stdinClosed;
}

bool FakeHost::hasLog(const std::string& substring) const {
  MutexLock lock(&mu_);
  return std::any_of(logs_.begin(), logs_.end(),
                     [&](const LogRecord& r) { return r.text.find(substring) != std::string::npos; });
}

void FakeHost::clearRecords() {
  MutexLock lock(&mu_);
  logs_.clear();
  documents_.clear();
  packets_.clear();
  starts_.clear();
}

bool FakeHost::waitForLog(const std::string& substring, Timeout timeout) const {
  return waitUntil([&] { return hasLog(substring); }, timeout);
}

bool FakeHost::waitForDocument(const std::string& substring, Timeout timeout) const {
  return waitUntil(
      [&] {
        for (const DocumentRecord& d : documents()) {
          if (d.text.find(substring) != std::string::npos) return true;
        }
        return false;
      },
      timeout);
}

bool FakeHost::waitForStart(const std::string& program, Timeout timeout, StartRecord* out) const {
  return waitUntil(
      [&] {
        for (const StartRecord& s : starts()) {
          if (!s.args.empty() && s.args[0] == program) {
            if (out != nullptr) *out = s;
            return true;
          }
        }
        return false;
      },
      timeout);
}

bool FakeHost::waitUntil(const std::function<bool()>& predicate, Timeout timeout) const {
  const auto deadline = saturatingDeadline(timeout);
  // State outside the fake (a client's state, a service field) changes
  // without a host event, hence the short re-check interval.
  const auto recheck = std::chrono::milliseconds(10);
  while (true) {
    uint64_t seen;
    {
      MutexLock lock(&mu_);
      seen = generation_;
    }
    if (predicate()) return true;
    const auto now = CondVar::Clock::now();
    if (now >= deadline) return false;
    MutexLock lock(&mu_);
    const auto until = std::min(deadline, now + recheck);
    while (generation_ == seen && CondVar::Clock::now() < until) waitChangeUntil(until);
  }
}

bool FakeHost::waitIdle(Timeout timeout) const {
  const auto deadline = saturatingDeadline(timeout);
  MutexLock lock(&mu_);
  while (!tasks_.empty() || runnerBusy_) {
    if (!waitChangeUntil(deadline)) return tasks_.empty() && !runnerBusy_;
  }
  return true;
}

int32_t FakeHost::handleMessage(const ko::core::HostMessage& message) {
  const uint32_t target = message.target();
  const uint32_t type = message.type();
  if (target == ko::core::kTargetLog && type == ko::core::kTypeLogLevelQuery) {
    MutexLock lock(&mu_);
    return threshold_;
  }
  if (target == ko::core::kTargetLog && type == ko::core::kTypeLogLine) {
    MutexLock lock(&mu_);
    logs_.push_back({message.logLevel(), payloadOf(message)});
    noteChange();
    return 0;
  }
  if (type == ko::core::kTypeXmlDocument) {
    MutexLock lock(&mu_);
    documents_.push_back({target, payloadOf(message)});
    noteChange();
    return 0;
  }
  if (target == ko::core::kTargetChildProcess && type == ko::core::kTypeChildProcessPacket) {
    return handlePacket(static_cast<const unsigned char*>(message.data()), message.length());
  }
  return 0;
}

int32_t FakeHost::handlePacket(const unsigned char* bytes, size_t length) {
  ko::ipc::PacketHeader header;
  if (!ko::ipc::decodePacketHeader(bytes, length, &header)) return -1;
  std::string payload(reinterpret_cast<const char*>(bytes) + ko::ipc::kPacketHeaderSize,
                      length - ko::ipc::kPacketHeaderSize);
  MutexLock lock(&mu_);
  packets_.push_back({header, payload});
  noteChange();
  if (packetResult_ != 0) return packetResult_;
  if (header.type == static_cast<uint32_t>(PacketType::StartRequest)) {
    handleStart(header, payload);
  } else if (header.type == static_cast<uint32_t>(PacketType::StdinData)) {
    handleStdin(header, payload);
  }
  return 0;
}

void FakeHost::handleStart(const ko::ipc::PacketHeader& header, const std::string& payload) {
  ko::ipc::SpawnOptions options;
  ko::ipc::decodeStartPayload(payload, header.value, &options);
  StartRecord start;
  start.id = header.id;
  start.flags = header.value;
  start.args = options.args;
  start.text_a = options.text_a;
  start.text_b = options.text_b;
  starts_.push_back(start);

  auto found = options.args.empty() ? scripts_.end() : scripts_.find(options.args[0]);
  const ChildScript& script = found == scripts_.end() ? defaultScript_ : found->second;
  ChildRecord& child = children_[header.id];
  child = ChildRecord();
  child.script = script;

  switch (script.answer) {
    case ChildScript::Answer::NeverAnswer:
      return;
    case ChildScript::Answer::FailStart:
      queuePacket(static_cast<uint32_t>(PacketType::StartFailed), header.id,
                  static_cast<uint32_t>(script.startError), {});
      return;
    case ChildScript::Answer::Start:
      break;
  }
  const uint32_t pid = script.pid != 0 ? script.pid : nextPid_++;
  queuePacket(static_cast<uint32_t>(PacketType::Started), header.id, pid, {});
  if (script.finish == ChildScript::Finish::Immediately) queueFinish(header.id, script);
}

void FakeHost::handleStdin(const ko::ipc::PacketHeader& header, const std::string& payload) {
  ChildRecord& child = children_[header.id];
  const bool wasClosed = child.stdinClosed;
  child.stdinBytes += payload;
  if (header.value & ko::ipc::kStdinClose) child.stdinClosed = true;
  if (child.script.onStdin) {
    StdinEvent event{header.id, payload, child.stdinBytes, child.stdinClosed};
    auto handler = child.script.onStdin;
    queueTask([this, handler, event] { handler(*this, event); });
  }
  if (!wasClosed && child.stdinClosed && child.script.finish == ChildScript::Finish::OnStdinClose) {
    queueFinish(header.id, child.script);
  }
}

void FakeHost::queueFinish(uint32_t id, const ChildScript& script) {
  for (const OutputChunk& chunk : script.output) {
    const uint32_t type =
        static_cast<uint32_t>(chunk.stream == 0 ? PacketType::StdoutData : PacketType::StderrData);
    for (size_t at = 0; at < chunk.bytes.size(); at += kOutputChunk) {
      queuePacket(type, id, 0, chunk.bytes.substr(at, kOutputChunk));
    }
  }
  queuePacket(static_cast<uint32_t>(PacketType::Exited), id, static_cast<uint32_t>(script.exitCode), {});
}

void FakeHost::queuePacket(uint32_t type, uint32_t id, uint32_t value, const std::string& payload) {
  queueDelivery(buildPacket(type, id, value, payload));
}

void FakeHost::queueDelivery(std::string packet) {
  queueTask([this, packet = std::move(packet)] {
    Sink sink;
    {
      MutexLock lock(&mu_);
      sink = sink_;
    }
    if (sink) sink(reinterpret_cast<const unsigned char*>(packet.data()), packet.size());
  });
}

void FakeHost::queueTask(std::function<void()> task) {
  if (stopping_) return;
  tasks_.push_back(std::move(task));
  changed_.signalAll();
}

void FakeHost::noteChange() {
  ++generation_;
  changed_.signalAll();
}

void FakeHost::runnerLoop() {
  while (true) {
    std::function<void()> task;
    {
      MutexLock lock(&mu_);
      runnerBusy_ = false;
      noteChange();
      while (tasks_.empty() && !stopping_) waitChange();
      if (stopping_) return;
      task = std::move(tasks_.front());
      tasks_.pop_front();
      runnerBusy_ = true;
    }
    // Never under any lock: the sink enters the plug-in, which may call back.
    task();
  }
}

}  // namespace sorvik::testing
