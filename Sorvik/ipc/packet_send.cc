// Sending one logical packet to the host, split into wire packets of at most
// 64 KiB when it carries standard-input bytes.

#include <algorithm>
#include <cstring>
#include <vector>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/packet.h"
#include "Sorvik/ipc/registry.h"

namespace ko::ipc {

bool send(uint32_t id, uint32_t type, uint32_t value, const void* data, uint64_t length) {
  const std::shared_ptr<const Transport> transport = Registry::instance().transport();
  if (!transport || !*transport) return false;
  const bool chunked = type == static_cast<uint32_t>(PacketType::StdinData);
  if (!chunked && length > kMaxPacketPayload) return false;

  const auto* payload = static_cast<const unsigned char*>(data);
  uint64_t remaining = data != nullptr ? length : 0;
  // One buffer for every chunk, sized for the largest of them.
  std::vector<unsigned char> buffer(kPacketHeaderSize + static_cast<size_t>(std::min<uint64_t>(remaining, kMaxPacketPayload)));
  PacketHeader header;
  header.id = id;
  header.type = type;
  header.value = value;
  while (true) {
    const size_t piece = static_cast<size_t>(std::min<uint64_t>(remaining, kMaxPacketPayload));
    header.total_length = static_cast<uint32_t>(kPacketHeaderSize + piece);
    encodePacketHeader(header, buffer.data());
    if (piece > 0) std::memcpy(buffer.data() + kPacketHeaderSize, payload, piece);
    if (!(*transport)(buffer.data(), header.total_length)) return false;
    payload += piece;
    remaining -= piece;
    if (remaining == 0) return true;
  }
}

}  // namespace ko::ipc
