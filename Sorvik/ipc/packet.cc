#include "Sorvik/ipc/packet.h"

#include "Sorvik/plugin/host_records.h"

namespace ko::ipc {

void encodePacketHeader(const PacketHeader& header, unsigned char* out) {
  ko::core::writeU32(out + 0, header.total_length);
  ko::core::writeU32(out + 4, header.id);
  ko::core::writeU32(out + 8, header.type);
  ko::core::writeU32(out + 12, header.value);
}

bool decodePacketHeader(const unsigned char* in, size_t length, PacketHeader* header) {
  if (in == nullptr || length < kPacketHeaderSize) return false;
  header->total_length = ko::core::readU32(in + 0);
  header->id = ko::core::readU32(in + 4);
  header->type = ko::core::readU32(in + 8);
  header->value = ko::core::readU32(in + 12);
  return true;
}

}  // namespace ko::ipc
