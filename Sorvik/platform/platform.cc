#include "Sorvik/platform/platform.h"

#include <atomic>

namespace sorvik::platform {
namespace {
std::atomic<Platform*> installed{nullptr};
}  // namespace

Platform& current() {
  Platform* p = installed.load(std::memory_order_acquire);
  return p != nullptr ? *p : native();
}

Platform* setForTesting(Platform* replacement) {
  return installed.exchange(replacement, std::memory_order_acq_rel);
}

}  // namespace sorvik::platform
