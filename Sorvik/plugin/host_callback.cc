#include "Sorvik/plugin/host_callback.h"

#include <atomic>

namespace ko::core {
namespace {
// Atomic so that threads reading the slot never race with Load/Unload.
std::atomic<HostCallback> slot{nullptr};
}  // namespace

HostCallback hostCallback() { return slot.load(std::memory_order_acquire); }

void setHostCallback(HostCallback callback) { slot.store(callback, std::memory_order_release); }

int32_t callHost(HostMessage& message) {
  HostCallback callback = hostCallback();
  if (callback == nullptr) return 0;
  return callback(message.bytes, 0);
}

}  // namespace ko::core
