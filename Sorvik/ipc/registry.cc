#include "Sorvik/ipc/registry.h"

#include <utility>

#include "Sorvik/ipc/client_internals.h"
#include "Sorvik/ipc/packet.h"
#include "Sorvik/plugin/host_log.h"

namespace ko::ipc {

namespace {

constexpr uint32_t kIdCounterMask = 0xFFFFF;
constexpr uint32_t kIdAttempts = 0x100000;

}  // namespace

Registry& Registry::instance() {
  // Destroyed when the library is unloaded; the host delivers nothing after Unload.
  static Registry registry;
  return registry;
}

void Registry::setTransport(Transport transport) {
  auto fresh = transport ? std::make_shared<const Transport>(std::move(transport)) : nullptr;
  sorvik::MutexLock lock(&transportMu_);
  transport_ = std::move(fresh);
}

std::shared_ptr<const Transport> Registry::transport() {
  sorvik::MutexLock lock(&transportMu_);
  return transport_;
}

bool Registry::allocateId(uint32_t* id) {
  for (uint32_t attempt = 0; attempt < kIdAttempts; ++attempt) {
    lastId = ((lastId + 1) & kIdCounterMask) | (idBase << 4);
    if (clients.find(lastId) == clients.end()) {
      *id = lastId;
      return true;
    }
  }
  return false;
}

void setLastIdForTesting(uint32_t last) {
  Registry& registry = Registry::instance();
  sorvik::MutexLock lock(&registry.mu);
  registry.lastId = last;
}

void set_transport(uint32_t id_base, Transport transport) {
  Registry& registry = Registry::instance();
  sorvik::MutexLock lock(&registry.mu);
  registry.idBase = id_base;
  registry.setTransport(std::move(transport));
}

bool receive(const unsigned char* packet, uint64_t length) {
  PacketHeader header;
  if (!decodePacketHeader(packet, static_cast<size_t>(length), &header)) return false;
  const char* payload = reinterpret_cast<const char*>(packet) + kPacketHeaderSize;
  const size_t payloadLength = static_cast<size_t>(length - kPacketHeaderSize);

  bool reportOverflow = false;
  {
    Registry& registry = Registry::instance();
    sorvik::MutexLock registryLock(&registry.mu);
    auto found = registry.clients.find(header.id);
    if (found == registry.clients.end()) return false;
    const std::shared_ptr<client> target = found->second;
    client::Internals& in = target->internals();
    sorvik::MutexLock clientLock(&in.mu);
    size_t dropped = 0;
    switch (static_cast<PacketType>(header.type)) {
      case PacketType::StdoutData:
        dropped = in.output[0].append(payload, payloadLength, /*dropCarriageReturns=*/true);
        break;
      case PacketType::StderrData:
        dropped = in.output[1].append(payload, payloadLength, /*dropCarriageReturns=*/false);
        break;
      case PacketType::Started:
        in.state = ClientState::Running;
        in.value = static_cast<int32_t>(header.value);
        break;
      case PacketType::StartFailed:
        in.state = ClientState::Failed;
        in.value = static_cast<int32_t>(header.value);
        registry.clients.erase(found);
        break;
      case PacketType::Exited:
        in.state = ClientState::Exited;
        in.value = static_cast<int32_t>(header.value);
        registry.clients.erase(found);
        break;
      default:
        return false;
    }
    if (dropped > 0 && !in.overflowReported) {
      in.overflowReported = true;
      reportOverflow = true;
    }
    in.changed.signalAll();
  }
  if (reportOverflow) {
    ko::core::log(50, "Output of child %u exceeds %zu unread bytes; dropping the oldest", header.id,
                  OutputBuffer::kDefaultLimit);
  }
  return true;
}

void shutdown(bool closed) {
  Registry& registry = Registry::instance();
  sorvik::MutexLock registryLock(&registry.mu);
  for (auto& entry : registry.clients) {
    client::Internals& in = entry.second->internals();
    sorvik::MutexLock clientLock(&in.mu);
    // A start the host never answered would otherwise block its spawn forever.
    if (in.state == ClientState::Running) {
      in.state = ClientState::Exited;
      in.value = 0;
      in.changed.signalAll();
    } else if (in.state == ClientState::Pending) {
      in.state = ClientState::Failed;
      in.value = 0;
      in.changed.signalAll();
    }
  }
  registry.clients.clear();
  registry.closed = closed;
}

}  // namespace ko::ipc
