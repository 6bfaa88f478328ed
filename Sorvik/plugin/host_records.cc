#include "Sorvik/plugin/host_records.h"

#include "Sorvik/plugin/module.h"

namespace ko::core {
namespace {

const unsigned char* bytesOf(const void* p) { return static_cast<const unsigned char*>(p); }

}  // namespace

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
