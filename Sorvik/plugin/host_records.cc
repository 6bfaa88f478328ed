#include "Sorvik/plugin/host_records.h"

#include "Sorvik/plugin/module.h"

namespace ko::core {
namespace {

const unsigned char* bytesOf(const void* p) { return static_cast<const unsigned char*>(p); }

}  // namespace

uint32_t readU32(const unsigned char* p) {
  return static_cast<uint32_t>(p[0]) | static_cast<uint32_t>(p[1]) << 8 | static_cast<uint32_t>(p[2]) << 16 |
         static_cast<uint32_t>(p[3]) << 24;
}

uint64_t readU64(const unsigned char* p) {
  return static_cast<uint64_t>(readU32(p)) | static_cast<uint64_t>(readU32(p + 4)) << 32;
}

void writeU32(unsigned char* p, uint32_t v) {
  p[0] = static_cast<unsigned char>(v);
  p[1] = static_cast<unsigned char>(v >> 8);
  p[2] = static_cast<unsigned char>(v >> 16);
  p[3] = static_cast<unsigned char>(v >> 24);
}

void writeU64(unsigned char* p, uint64_t v) {
  writeU32(p, static_cast<uint32_t>(v));
  writeU32(p + 4, static_cast<uint32_t>(v >> 32));
}

const void* readPointer(const unsigned char* p) {
  return reinterpret_cast<const void*>(static_cast<uintptr_t>(readU64(p)));
}

void writePointer(unsigned char* p, const void* v) { writeU64(p, reinterpret_cast<uintptr_t>(v)); }

HostCallback readHostCallback(const void* loadParmsIn) {
  if (loadParmsIn == nullptr) return nullptr;
  return reinterpret_cast<HostCallback>(static_cast<uintptr_t>(readU64(bytesOf(loadParmsIn) + 16)));
}

void writeLoadParmsOut(void* loadParmsOut) {
  if (loadParmsOut == nullptr) return;
  auto* out = static_cast<unsigned char*>(loadParmsOut);
  writeU32(out + 8, kModuleId);
  writeU32(out + 20, 0x2000010);
  out[52] = 1;
  out[55] = 1;
}

IoctlRequest readIoctlRecord(const void* record) {
  IoctlRequest request;
  if (record == nullptr) return request;
  const unsigned char* r = bytesOf(record);
  request.code = readU32(r + 8);
  request.length = readU32(r + 24);
  request.data = static_cast<const unsigned char*>(readPointer(r + 32));
  return request;
}

WriteRequest readWriteRecord(const void* record) {
  WriteRequest request;
  if (record == nullptr) return request;
  const unsigned char* r = bytesOf(record);
  request.length = readU32(r + 16);
  request.data = static_cast<const unsigned char*>(readPointer(r + 24));
  return request;
}

HostMessage HostMessage::make(uint32_t source, uint32_t target, uint32_t type, const void* data, uint64_t length) {
  HostMessage m;
  writeU32(m.bytes + 0, kHostMessageSize);
  writeU32(m.bytes + 4, 1);
  writeU32(m.bytes + 8, static_cast<uint32_t>(length));
  writePointer(m.bytes + 16, data);
  writeU32(m.bytes + 24, source);
  writeU32(m.bytes + 32, target);
  writeU32(m.bytes + 36, type);
  return m;
}

void HostMessage::setLogLevel(int32_t level) {
  writeU32(bytes + 40, kLogDetailSize);
  writeU32(bytes + 44, 1);
  writeU32(bytes + 48, static_cast<uint32_t>(level));
}

HostMessage copyHostMessage(const void* message) {
  HostMessage m;
  if (message == nullptr) return m;
  const unsigned char* src = bytesOf(message);
  for (size_t i = 0; i < kHostMessageSize; ++i) m.bytes[i] = src[i];
  return m;
}

}  // namespace ko::core
