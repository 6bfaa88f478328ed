#pragma once

// The records exchanged with the host, read and written at fixed offsets in
// little-endian byte order. Nothing here overlays a struct on host memory.

#include <cstddef>
#include <cstdint>
#include <cstring>

namespace ko::core {

inline constexpr size_t kHostMessageSize = 192;
inline constexpr size_t kLogDetailSize = 152;

// The host's single callback: a 192-byte HostMessage and a reserved 0.
using HostCallback = int32_t (*)(void* message, uint64_t reserved);

// Little-endian field access on raw record bytes. Inline: the log path
// builds a record per line and must stay cheap when the line is dropped.
// Whole-word copies of one integer each (converted to little-endian first)
// let the host's reads of a field forward from a single store.
inline uint32_t toLittleEndian(uint32_t v) {
#if defined(__BYTE_ORDER__) && __BYTE_ORDER__ == __ORDER_BIG_ENDIAN__
  return __builtin_bswap32(v);
#else
  return v;
#endif
}
inline uint32_t readU32(const unsigned char* p) {
  uint32_t v;
  std::memcpy(&v, p, sizeof v);
  return toLittleEndian(v);
}
inline uint64_t readU64(const unsigned char* p) {
  return static_cast<uint64_t>(readU32(p)) | static_cast<uint64_t>(readU32(p + 4)) << 32;
}
inline void writeU32(unsigned char* p, uint32_t v) {
  v = toLittleEndian(v);
  std::memcpy(p, &v, sizeof v);
}
inline void writeU64(unsigned char* p, uint64_t v) {
  writeU32(p, static_cast<uint32_t>(v));
  writeU32(p + 4, static_cast<uint32_t>(v >> 32));
}
inline const void* readPointer(const unsigned char* p) {
  return reinterpret_cast<const void*>(static_cast<uintptr_t>(readU64(p)));
}
inline void writePointer(unsigned char* p, const void* v) { writeU64(p, reinterpret_cast<uintptr_t>(v)); }

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

  static HostMessage make(uint32_t source, uint32_t target, uint32_t type, const void* data, uint64_t length) {
    HostMessage m;
    m.setHeader(source, target, type, data, length);
    return m;
  }
  // Rewrites the first 40 bytes; the detail area is left as it is.
  void setHeader(uint32_t source, uint32_t target, uint32_t type, const void* data, uint64_t length) {
    writeU32(bytes + 0, kHostMessageSize);
    writeU32(bytes + 4, 1);
    writeU32(bytes + 8, static_cast<uint32_t>(length));
    writeU32(bytes + 12, 0);
    writePointer(bytes + 16, data);
    writeU32(bytes + 24, source);
    writeU32(bytes + 28, 0);
    writeU32(bytes + 32, target);
    writeU32(bytes + 36, type);
  }
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
