#include "host/process_runner.h"

#include "Sorvik/ipc/client.h"

namespace sorvik::host {

bool decodeStartPayload(const unsigned char* data, size_t length, uint32_t flags, StartPayload* out) {
  const std::string payload(reinterpret_cast<const char*>(data), length);
  size_t pos = 0;
  auto takeText = [&](std::string* text) {
    const size_t nul = payload.find('\0', pos);
    if (nul == std::string::npos) return false;
    *text = payload.substr(pos, nul - pos);
    pos = nul + 1;
    return true;
  };
  StartPayload result;
  if ((flags & ko::ipc::kSpawnTextA) != 0 && !takeText(&result.textA)) return false;
  if ((flags & ko::ipc::kSpawnTextB) != 0 && !takeText(&result.textB)) return false;
  // The arguments are NUL-separated without a final NUL.
  while (true) {
    const size_t nul = payload.find('\0', pos);
    if (nul == std::string::npos) {
      result.args.push_back(payload.substr(pos));
      break;
    }
    result.args.push_back(payload.substr(pos, nul - pos));
    pos = nul + 1;
  }
  if (result.args.front().empty()) return false;
  *out = std::move(result);
  return true;
}

StdinClose stdinCloseFor(uint32_t value, size_t packetLength) {
  if ((value & ko::ipc::kStdinClose) == 0) return StdinClose::Keep;
  return packetLength >= ko::ipc::kMaxPacketSize ? StdinClose::AfterQuietPeriod : StdinClose::WhenDrained;
}

void dispatchPluginPacket(const std::string& bytes, const RunnerNotice& notice, const PluginPacketHandlers& handlers) {
  ko::ipc::PacketHeader header;
  const auto* raw = reinterpret_cast<const unsigned char*>(bytes.data());
  if (!ko::ipc::decodePacketHeader(raw, bytes.size(), &header)) {
    notice("runner: dropped a packet shorter than its header (" + std::to_string(bytes.size()) + " bytes)");
    return;
  }
  const unsigned char* payload = raw + ko::ipc::kPacketHeaderSize;
  const size_t payloadLength = bytes.size() - ko::ipc::kPacketHeaderSize;
  switch (static_cast<ko::ipc::PacketType>(header.type)) {
    case ko::ipc::PacketType::StartRequest:
      handlers.start(header, payload, payloadLength);
      return;
    case ko::ipc::PacketType::StdinData:
      handlers.stdinData(header, bytes.size(), payload, payloadLength);
      return;
    default:
      notice("runner: dropped a packet of unexpected type " + std::to_string(header.type) + " for id " +
             std::to_string(header.id));
  }
}

}  // namespace sorvik::host
