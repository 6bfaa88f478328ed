#pragma once

// Wire format of one child-process packet: a 16-byte little-endian header
// (total length, id, type, value) followed by the payload.

#include <cstddef>
#include <cstdint>

namespace ko::ipc {

inline constexpr size_t kPacketHeaderSize = 16;
inline constexpr size_t kMaxPacketSize = 65536;
inline constexpr size_t kMaxPacketPayload = kMaxPacketSize - kPacketHeaderSize;

struct PacketHeader {
  uint32_t total_length = 0;
  uint32_t id = 0;
  uint32_t type = 0;
  uint32_t value = 0;
};

void encodePacketHeader(const PacketHeader& header, unsigned char* out);
// False when fewer than 16 bytes are available.
bool decodePacketHeader(const unsigned char* in, size_t length, PacketHeader* header);

}  // namespace ko::ipc
