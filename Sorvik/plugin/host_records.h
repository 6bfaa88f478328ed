#pragma once

// The records exchanged with the host, read and written at fixed offsets in
// little-endian byte order. Nothing here overlays a struct on host memory.

#include <cstddef>
#include <cstdint>

namespace ko::core {

inline constexpr size_t kHostMessageSize = 192;
inline constexpr size_t kLogDetailSize = 152;

// The host's single callback: a 192-byte HostMessage and a reserved 0.
using HostCallback = int32_t (*)(void* message, uint64_t reserved);

// Little-endian field access on raw record bytes.
uint32_t readU32(const unsigned char* p);
uint64_t readU64(const unsigned char* p);
void writeU32(unsigned char* p, uint32_t v);
void writeU64(unsigned char* p, uint64_t v);
const void* readPointer(const unsigned char* p);
void writePointer(unsigned char* p, const void* v);

// LoadParmsIn: the host callback at offset 16.
HostCallback readHostCallback(const void* loadParmsIn);
// LoadParmsOut: module id, capability word and the two host flags.
void writeLoadParmsOut(void* loadParmsOut);

// IoctlRecord: code at 8, length at 24, data pointer at 32.
struct IoctlRequest {
  uint32_t code = 0;
  const unsigned char* data = nullptr;
  uint32_t length = 0;
};
IoctlRequest readIoctlRecord(const void* record);

// WriteRecord: length at 16, data pointer at 24.
struct WriteRequest {
  const unsigned char* data = nullptr;
  uint32_t length = 0;
};
WriteRequest readWriteRecord(const void* record);

// A HostMessage under construction; all bytes start at zero.
struct HostMessage {
  unsigned char bytes[kHostMessageSize] = {};

  static HostMessage make(uint32_t source, uint32_t target, uint32_t type, const void* data, uint64_t length);
  // Sets the nested log record in the detail area: size 152, version 1, level.
  void setLogLevel(int32_t level);

  uint32_t size() const { return readU32(bytes + 0); }
  uint32_t version() const { return readU32(bytes + 4); }
  uint32_t length() const { return readU32(bytes + 8); }
  const void* data() const { return readPointer(bytes + 16); }
  uint32_t source() const { return readU32(bytes + 24); }
  uint32_t target() const { return readU32(bytes + 32); }
  uint32_t type() const { return readU32(bytes + 36); }
  int32_t logLevel() const { return static_cast<int32_t>(readU32(bytes + 48)); }
};

// Decodes a HostMessage the host received (used by hosts and tests).
HostMessage copyHostMessage(const void* message);

}  // namespace ko::core
