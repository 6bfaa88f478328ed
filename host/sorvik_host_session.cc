#include "host/sorvik_host_session.h"

#include <cstring>
#include <vector>

#include "Sorvik/plugin/host_records.h"
#include "Sorvik/plugin/module.h"

namespace sorvik::host {
namespace {

constexpr size_t kLoadParmsSize = 256;
constexpr size_t kIoctlRecordSize = 40;
constexpr size_t kWriteRecordSize = 32;
constexpr uint32_t kIoctlRunWorker = 1;
constexpr uint32_t kIoctlConfiguration = 2;
constexpr uint32_t kIoctlChildPacket = 4;
constexpr std::chrono::milliseconds kWorkerStartLimit{5000};
constexpr std::chrono::milliseconds kWorkerStopLimit{5000};

// The host callback is a plain function pointer; it reaches the one
// session of the process through this slot.
std::atomic<HostSession*> g_session{nullptr};

void fillIoctlRecord(unsigned char* record, uint32_t code, const void* data, size_t length) {
  std::memset(record, 0, kIoctlRecordSize);
  ko::core::writeU32(record + 8, code);
  ko::core::writeU32(record + 24, static_cast<uint32_t>(length));
  ko::core::writePointer(record + 32, data);
}

std::string payloadText(const ko::core::HostMessage& message) {
  const auto* data = static_cast<const char*>(message.data());
  if (data == nullptr) return std::string();
  std::string text(data, message.length());
  // A line cut by the plug-in ends in its NUL.
  while (!text.empty() && text.back() == '\0') text.pop_back();
  return text;
}

}  // namespace

HostSession::HostSession(SessionOptions options, EventSink sink)
    : options_(std::move(options)), sink_(std::move(sink)), threshold_(options_.logThreshold) {
  g_session.store(this);
  runner_ = newProcessRunner(
      options_.runner, [this](const unsigned char* packet, size_t length) { deliver(packet, length); },
      [this](const std::string& text) { notice(text); });
}

HostSession::~HostSession() {
  shutdown();
  runner_.reset();
  g_session.store(nullptr);
}

bool HostSession::start(std::string* error) {
  if (!runner_->start(error)) return false;
  runnerUp_.store(true);
  MutexLock lock(&lifecycleMu_);
  return loadPlugin(error);
}

bool HostSession::restart(std::string* error) {
  MutexLock lock(&lifecycleMu_);
  notice("restarting the plug-in");
  // A child may ask for the restart before its Started packet reached the
  // plug-in; Close would leave that start unanswered.
  runner_->flush();
  unloadPlugin();
  // The new instance numbers its children from the start again.
  runner_->detachAll();
  if (!loadPlugin(error)) return false;
  notice("plug-in restarted");
  return true;
}

void HostSession::shutdown() {
  {
    MutexLock lock(&lifecycleMu_);
    unloadPlugin();
  }
  if (runnerUp_.exchange(false)) runner_->stop();
}

bool HostSession::sendCommand(const std::string& xml) {
  MutexLock lock(&lifecycleMu_);
  if (!loaded_) return false;
  unsigned char record[kWriteRecordSize] = {};
  ko::core::writeU32(record + 16, static_cast<uint32_t>(xml.size()));
  ko::core::writePointer(record + 24, xml.data());
  library_.entry().write(record);
  return true;
}

bool HostSession::sendConfiguration(const std::string& xml) {
  MutexLock lock(&lifecycleMu_);
  if (!loaded_) return false;
  unsigned char record[kIoctlRecordSize];
  fillIoctlRecord(record, kIoctlConfiguration, xml.data(), xml.size());
  library_.entry().ioctl(record);
  return true;
}

bool HostSession::loadPlugin(std::string* error) {
  if (!library_.open(options_.libraryPath, error)) return false;
  const PluginEntryPoints entry = library_.entry();
  std::vector<unsigned char> in(kLoadParmsSize, 0);
  std::vector<unsigned char> out(kLoadParmsSize, 0);
  ko::core::writePointer(in.data() + 16, reinterpret_cast<const void*>(&HostSession::callback));
  entry.load(in.data(), out.data());
  const uint32_t moduleId = ko::core::readU32(out.data() + 8);
  {
    MutexLock lock(&gateMu_);
    gateIoctl_ = entry.ioctl;
  }
  entry.open();
  {
    MutexLock lock(&workerMu_);
    workerEntered_ = false;
    workerDone_ = false;
  }
  worker_ = std::thread([this, ioctl = entry.ioctl] {
    {
      MutexLock lock(&workerMu_);
      workerId_ = std::this_thread::get_id();
    }
    unsigned char record[kIoctlRecordSize];
    fillIoctlRecord(record, kIoctlRunWorker, nullptr, 0);
    ioctl(record);
    MutexLock lock(&workerMu_);
    workerId_ = std::thread::id();
    workerDone_ = true;
    workerChanged_.signalAll();
  });
  loaded_ = true;
  notice("loaded " + options_.libraryPath + " (module id " + std::to_string(moduleId) + ")");
  return true;
}

void HostSession::unloadPlugin() {
  if (!loaded_) return;
  const PluginEntryPoints entry = library_.entry();
  if (!waitWorker(&workerEntered_, kWorkerStartLimit)) notice("the worker has not reported; closing anyway");
  entry.close();
  while (!waitWorker(&workerDone_, kWorkerStopLimit)) {
    notice("the worker is still running; calling Close again");
    entry.close();
  }
  if (worker_.joinable()) worker_.join();
  {
    // No delivery may still be inside the library when it goes away.
    MutexLock lock(&gateMu_);
    gateIoctl_ = nullptr;
    while (inFlight_ > 0) waitGateIdle();
  }
  entry.unload();
  library_.close();
  loaded_ = false;
  notice("plug-in unloaded");
}

bool HostSession::waitWorker(bool* flag, std::chrono::milliseconds limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  MutexLock lock(&workerMu_);
  while (!*flag && !workerDone_ && std::chrono::steady_clock::now() < deadline) waitWorkerChange(deadline);
  return *flag || workerDone_;
}

void HostSession::deliver(const unsigned char* packet, size_t length) {
  int32_t (*ioctl)(void*) = nullptr;
  {
    MutexLock lock(&gateMu_);
    ioctl = gateIoctl_;
    if (ioctl == nullptr) return;  // between two instances: nobody to tell
    ++inFlight_;
  }
  unsigned char record[kIoctlRecordSize];
  fillIoctlRecord(record, kIoctlChildPacket, packet, length);
  ioctl(record);
  MutexLock lock(&gateMu_);
  if (--inFlight_ == 0) gateIdle_.signalAll();
}

void HostSession::notice(const std::string& text) {
  Event event;
  event.kind = EventKind::Notice;
  event.text = text;
  event.when = std::chrono::system_clock::now();
  sink_(std::move(event));
}

int32_t HostSession::callback(void* message, uint64_t /*reserved*/) {
  HostSession* session = g_session.load();
  if (session == nullptr || message == nullptr) return -1;
  return session->onMessage(message);
}

int32_t HostSession::onMessage(const void* raw) {
  {
    MutexLock lock(&workerMu_);
    if (!workerEntered_ && workerId_ == std::this_thread::get_id()) {
      workerEntered_ = true;
      workerChanged_.signalAll();
    }
  }
  const ko::core::HostMessage message = ko::core::copyHostMessage(raw);
  if (message.target() == ko::core::kTargetChildProcess) {
    if (!runnerUp_.load()) return -1;
    runner_->submit(static_cast<const unsigned char*>(message.data()), message.length());
    return 0;
  }
  if (message.type() == ko::core::kTypeLogLevelQuery) return threshold_.load();
  Event event;
  event.when = std::chrono::system_clock::now();
  event.text = payloadText(message);
  if (message.type() == ko::core::kTypeLogLine) {
    event.kind = EventKind::Log;
    event.level = message.logLevel();
  } else if (message.type() == ko::core::kTypeXmlDocument) {
    event.kind = EventKind::Document;
    event.target = message.target();
  } else {
    event.kind = EventKind::Notice;
    event.text = "unknown message target " + std::to_string(message.target()) + " type " +
                 std::to_string(message.type()) + " (" + std::to_string(message.length()) + " bytes)";
  }
  sink_(std::move(event));
  return 0;
}

}  // namespace sorvik::host
