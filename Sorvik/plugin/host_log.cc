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

// Kept out of line so that a line the host drops costs only the query.
__attribute__((noinline)) int32_t formatAndSend(uint32_t moduleId, HostCallback callback, int32_t level,
                                                const char* format, va_list args) {
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

}  // namespace

// The threshold is asked for on every line, before any formatting.
inline bool hostWants(uint32_t moduleId, HostCallback callback, int32_t level) {
  HostMessage query = HostMessage::make(moduleId, kTargetLog, kTypeLogLevelQuery, nullptr, 0);
  return level >= callback(query.bytes, 0);
}

int32_t hostLogV(uint32_t moduleId, HostCallback callback, int32_t level, const char* format, va_list args) {
  if (callback == nullptr || format == nullptr || !hostWants(moduleId, callback, level)) return 0;
  return formatAndSend(moduleId, callback, level, format, args);
}

int32_t hostLog(uint32_t moduleId, HostCallback callback, int32_t level, const char* format, ...) {
  if (callback == nullptr || format == nullptr || !hostWants(moduleId, callback, level)) return 0;
  va_list args;
  va_start(args, format);
  const int32_t result = formatAndSend(moduleId, callback, level, format, args);
  va_end(args);
  return result;
}

void log(int32_t level, const char* format, ...) {
  const HostCallback callback = hostCallback();
  if (callback == nullptr || format == nullptr || !hostWants(kModuleId, callback, level)) return;
  va_list args;
  va_start(args, format);
  formatAndSend(kModuleId, callback, level, format, args);
  va_end(args);
}

}  // namespace ko::core
