// A tiny plug-in for testing sorvik-host's runner end to end. Command
// documents are instructions instead of XML:
//   spawn ID FLAGS ARG|ARG|...    send a StartRequest
//   stdin ID VALUE TEXT           send TEXT ("\n" for a line feed) as StdinData
//   stdin-bulk ID VALUE COUNT     send COUNT bytes of 'x', chunked as the plug-in does
// Every packet delivered back is logged as
//   "packet id=I type=T value=V bytes=N data=<first bytes, escaped>".

#include <cstdint>
#include <cstdio>
#include <cstring>
#include <sstream>
#include <algorithm>
#include <string>

#include "Sorvik/ipc/packet.h"
#include "Sorvik/platform/mutex.h"
#include "Sorvik/plugin/host_records.h"
#include "Sorvik/plugin/module.h"

namespace {

ko::core::HostCallback g_callback = nullptr;
// The worker blocks until Close, like the real plug-in's worker.
sorvik::Mutex g_mu;
sorvik::CondVar g_cv(&g_mu);
bool g_closed GUARDED_BY(g_mu) = false;

void waitForClose() NO_THREAD_SAFETY_ANALYSIS {
  sorvik::MutexLock lock(&g_mu);
  while (!g_closed) g_cv.wait();
}

void setClosed(bool closed) {
  sorvik::MutexLock lock(&g_mu);
  g_closed = closed;
  g_cv.signalAll();
}

int32_t sendToHost(uint32_t target, uint32_t type, const void* data, size_t length, int32_t level = -1) {
  if (g_callback == nullptr) return -1;
  ko::core::HostMessage message = ko::core::HostMessage::make(ko::core::kModuleId, target, type, data, length);
  if (level >= 0) message.setLogLevel(level);
  return g_callback(message.bytes, 0);
}

void log(const std::string& text) {
  sendToHost(ko::core::kTargetLog, ko::core::kTypeLogLine, text.data(), text.size(), ko::core::kLogProgress);
}

bool sendPacket(uint32_t id, uint32_t type, uint32_t value, const std::string& payload) {
  size_t offset = 0;
  do {
    const size_t chunk = std::min(payload.size() - offset, ko::ipc::kMaxPacketPayload);
    std::string packet(ko::ipc::kPacketHeaderSize + chunk, '\0');
    ko::ipc::PacketHeader header{static_cast<uint32_t>(packet.size()), id, type, value};
    ko::ipc::encodePacketHeader(header, reinterpret_cast<unsigned char*>(&packet[0]));
    std::memcpy(&packet[ko::ipc::kPacketHeaderSize], payload.data() + offset, chunk);
    if (sendToHost(ko::core::kTargetChildProcess, 0, packet.data(), packet.size()) != 0) return false;
    offset += chunk;
  } while (offset < payload.size());
  return true;
}

std::string unescape(const std::string& text) {
  std::string out;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\\' && i + 1 < text.size() && text[i + 1] == 'n') {
      out += '\n';
      ++i;
    } else {
      out += text[i];
    }
  }
  return out;
}

std::string escape(const std::string& bytes) {
  std::string out;
  for (char c : bytes.substr(0, 120)) {
    if (c == '\n') {
      out += "\\n";
    } else if (static_cast<unsigned char>(c) < 32) {
      out += '?';
    } else {
      out += c;
    }
  }
  return out;
}

void runCommand(const std::string& text) {
  std::istringstream in(text);
  std::string verb;
  uint32_t id = 0;
  uint32_t value = 0;
  in >> verb >> id >> value;
  std::string rest;
  std::getline(in >> std::ws, rest);
  bool ok = false;
  if (verb == "spawn") {
    std::string payload = rest;
    for (char& c : payload) {
      if (c == '|') c = '\0';
    }
    ok = sendPacket(id, 6, value, payload);
  } else if (verb == "stdin") {
    ok = sendPacket(id, 0, value, unescape(rest));
  } else if (verb == "stdin-bulk") {
    ok = sendPacket(id, 0, value, std::string(std::stoul(rest), 'x'));
  }
  log(verb + " " + std::to_string(id) + (ok ? " sent" : " refused"));
}

}  // namespace

#define TEST_PLUGIN_EXPORT extern "C" __attribute__((visibility("default")))

TEST_PLUGIN_EXPORT int32_t Load(void* parmsIn, void* parmsOut) {
  g_callback = ko::core::readHostCallback(parmsIn);
  ko::core::writeLoadParmsOut(parmsOut);
  setClosed(false);
  return 0;
}

TEST_PLUGIN_EXPORT int32_t Open() {
  const std::string announce =
      "<?xml ?><Qora Delta=\"0\"><Modules><Module Name=\"HostTestPlugin\" /></Modules></Qora>";
  sendToHost(ko::core::kTargetState, ko::core::kTypeXmlDocument, announce.data(), announce.size());
  return 0;
}

TEST_PLUGIN_EXPORT int32_t IOCTL(void* record) {
  const ko::core::IoctlRequest request = ko::core::readIoctlRecord(record);
  if (request.code == 1) {
    log("worker entered");
    waitForClose();
  } else if (request.code == 4) {
    ko::ipc::PacketHeader header;
    if (!ko::ipc::decodePacketHeader(request.data, request.length, &header)) return 0;
    const std::string payload(reinterpret_cast<const char*>(request.data) + ko::ipc::kPacketHeaderSize,
                              request.length - ko::ipc::kPacketHeaderSize);
    log("packet id=" + std::to_string(header.id) + " type=" + std::to_string(header.type) +
        " value=" + std::to_string(header.value) + " bytes=" + std::to_string(payload.size()) +
        " data=" + escape(payload));
  }
  return 0;
}

TEST_PLUGIN_EXPORT int32_t Write(void* record) {
  const ko::core::WriteRequest request = ko::core::readWriteRecord(record);
  runCommand(std::string(reinterpret_cast<const char*>(request.data), request.length));
  return 0;
}

TEST_PLUGIN_EXPORT int32_t Close() {
  setClosed(true);
  return 0;
}

TEST_PLUGIN_EXPORT int32_t Unload() {
  g_callback = nullptr;
  return 0;
}
