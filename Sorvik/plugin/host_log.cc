#include "Sorvik/plugin/host_log.h"

#include <cstdio>
#include <memory>

#include "Sorvik/plugin/host_callback.h"

namespace ko::core {
namespace {

constexpr size_t kLineBuffer = 2048;

int32_t sendLine(uint32_t moduleId, HostCallback callback, int32_t level, const char* text, size_t length) {
  HostMessage line = HostMessage::make(moduleId, kTargetLog, kTypeLogLine, text, length);
  line.setLogLevel(level);
  return callback(line.bytes, 0);
}

}  // namespace

int32_t hostLogV(uint32_t moduleId, HostCallback callback, int32_t level, const char* format, va_list args) {
  if (callback == nullptr || format == nullptr) return 0;
  HostMessage query = HostMessage::make(moduleId, kTargetLog, kTypeLogLevelQuery, nullptr, 0);
  const int32_t threshold = callback(query.bytes, 0);
  if (level < threshold) return 0;

  char buffer[kLineBuffer];
  va_list again;
  va_copy(again, args);
  const int n = std::vsnprintf(buffer, sizeof(buffer), format, args);
  if (n < 1) {
    va_end(again);
    return 0;
  }
  const size_t full = static_cast<size_t>(n);
  if (full < kLineBuffer) {
    va_end(again);
    return sendLine(moduleId, callback, level, buffer, full);
  }
  if (level != 0 || full == kLineBuffer) {
    va_end(again);
    // The stored text and its NUL: the host sees the first 2047 characters.
    return sendLine(moduleId, callback, level, buffer, kLineBuffer);
  }
  // Level 0 diagnostics may be long; they travel whole.
  std::unique_ptr<char[]> heap(new char[full + 1]);
  const int m = std::vsnprintf(heap.get(), full + 1, format, again);
  va_end(again);
  if (m < 1) return 0;
  return sendLine(moduleId, callback, level, heap.get(), static_cast<size_t>(m));
}

int32_t hostLog(uint32_t moduleId, HostCallback callback, int32_t level, const char* format, ...) {
  va_list args;
  va_start(args, format);
  const int32_t result = hostLogV(moduleId, callback, level, format, args);
  va_end(args);
  return result;
}

void log(int32_t level, const char* format, ...) {
  va_list args;
  va_start(args, format);
  hostLogV(kModuleId, hostCallback(), level, format, args);
  va_end(args);
}

}  // namespace ko::core
