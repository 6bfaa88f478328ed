#pragma once

// How the worker sleeps between passes. The real policy waits on the steady
// clock; tests substitute one whose time-outs they fire by hand, so that the
// 1, 30 and 3420 second supervision periods never cost real time.

#include <chrono>

#include "Sorvik/service/update_service.h"

namespace sorvik {

class WorkerWait {
 public:
  virtual ~WorkerWait() = default;
  // Entered and left with service.stateMutex held. Sleeps on
  // service.wakeCondition until service.workerShouldWake() holds (true) or
  // `timeout` has passed with it still false (false).
  virtual bool waitForWork(UpdateService& service, std::chrono::seconds timeout)
      REQUIRES(service.stateMutex) = 0;
};

// The real policy: a monotonic deadline that saturates instead of overflowing.
WorkerWait& steadyClockWait();

}  // namespace sorvik
