#include "Sorvik/service/worker_wait.h"

#include "Sorvik/platform/mutex.h"

namespace sorvik {
namespace {

class SteadyClockWait final : public WorkerWait {
 public:
  bool waitForWork(UpdateService& service, std::chrono::seconds timeout) override
      REQUIRES(service.stateMutex) {
    const auto deadline = saturatingDeadline(timeout);
    while (!service.workerShouldWake()) {
      // Spurious wake-ups re-test; a time-out still honours a late producer.
      if (!service.waitForWakeUntil(deadline)) return service.workerShouldWake();
    }
    return true;
  }
};

}  // namespace

WorkerWait& steadyClockWait() {
  static SteadyClockWait wait;
  return wait;
}

}  // namespace sorvik
