#pragma once

// Turns a hung test into a failure: when the test is still running after
// `limit`, the watchdog reports it, calls `rescue` (which should end the
// waits the test is stuck in), and aborts the process if that does not free
// the test within five seconds.

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>
#include <thread>
#include <utility>

#include <gtest/gtest.h>

#include "Sorvik/platform/mutex.h"

namespace sorvik::testing {

// Thread-safe: the only shared state, `done_`, is guarded by `mu_`.
class Watchdog {
 public:
  explicit Watchdog(std::chrono::seconds limit = std::chrono::seconds(30), std::function<void()> rescue = {})
      : thread_([this, limit, rescue = std::move(rescue), name = currentTestName()] {
          if (waitDone(limit)) return;
          ADD_FAILURE() << "watchdog: test still running after " << limit.count() << " s";
          std::fprintf(stderr, "watchdog: test %s still running after %lld s\n", name.c_str(),
                       static_cast<long long>(limit.count()));
          if (rescue) rescue();
          if (waitDone(std::chrono::seconds(5))) return;
          std::fprintf(stderr, "watchdog: test %s hung, aborting\n", name.c_str());
          std::abort();
        }) {}
  ~Watchdog() {
    {
      MutexLock lock(&mu_);
      done_ = true;
    }
    cv_.signalAll();
    thread_.join();
  }
  Watchdog(const Watchdog&) = delete;
  Watchdog& operator=(const Watchdog&) = delete;

 private:
  static std::string currentTestName() {
    const ::testing::TestInfo* info = ::testing::UnitTest::GetInstance()->current_test_info();
    return info != nullptr ? std::string(info->test_suite_name()) + "." + info->name() : "?";
  }
  bool waitDone(std::chrono::seconds limit) {
    const auto deadline = saturatingDeadline(limit);
    MutexLock lock(&mu_);
    while (!done_) {
      if (!cv_.waitUntil(deadline)) return done_;
    }
    return true;
  }

  Mutex mu_;
  CondVar cv_{&mu_};
  bool done_ GUARDED_BY(mu_) = false;
  std::thread thread_;
};

}  // namespace sorvik::testing
