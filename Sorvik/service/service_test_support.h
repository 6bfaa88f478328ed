#pragma once

// Shared pieces of the service tests: a private current directory (the state
// file and the install log are relative to it), a recording WorkerSteps, a
// worker wait whose time-outs the test fires, and a worker thread guarded by
// a watchdog. Header-only; included by *_test.cc files only.

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <boost/filesystem.hpp>
#include <gtest/gtest.h>

#include "Sorvik/ipc/client.h"
#include "Sorvik/service/update_service.h"
#include "Sorvik/service/worker_wait.h"
#include "host/fake_host.h"
#include "host/test_temp_dir.h"
#include "host/test_watchdog.h"

namespace sorvik::testing {

inline constexpr std::chrono::seconds kTestDeadline{10};

inline void writeFile(const std::string& path, const std::string& bytes) {
  const boost::filesystem::path p(path);
  if (p.has_parent_path()) boost::filesystem::create_directories(p.parent_path());
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << bytes;
}

inline std::string readFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// Records every step the worker asks for. Agent starts spawn "./kelp"
// through the fake host, so the agent is a real ko::ipc::client that the
// test ends with FakeHost::exitChild.
class FakeSteps : public WorkerSteps {
 public:
  bool DownloadBundle(UpdateService&, const std::string& location, std::string& bundlePath) override {
    record("DownloadBundle " + location);
    bundlePath = "downloads/bundle.zip";
    return downloadSucceeds;
  }
  bool VerifyBundleChecksum(UpdateService&, const std::string& bundlePath, const std::string& checksum) override {
    record("VerifyBundleChecksum " + bundlePath + " " + checksum);
    return checksumMatches;
  }
  void InstallBundle(UpdateService&, const std::string& bundlePath) override { record("InstallBundle " + bundlePath); }
  void Decommission(UpdateService&) override { record("Decommission"); }
  void StartAgent(UpdateService& service, const std::string& drives, AgentRequestRecord& request) override {
    record("StartAgent " + drives + " " + std::to_string(request.Port));
    if (onStartAgent) onStartAgent(service, request);
  }
  void StartReset(UpdateService& service, const std::string& drives, AgentRequestRecord& request) override {
    record("StartReset " + drives + " " + request.PasswordToken);
    if (onStartReset) onStartReset(service, request);
  }
  void StopAgent(UpdateService&, std::shared_ptr<ko::ipc::client>& handle, uint32_t exitCode) override {
    record(std::string("StopAgent ") + (handle ? "client" : "null") + " " + std::to_string(exitCode));
  }

  std::vector<std::string> calls() const {
    std::lock_guard<std::mutex> lock(mu_);
    return calls_;
  }
  bool waitForCalls(size_t count, std::chrono::seconds limit = kTestDeadline) const {
    std::unique_lock<std::mutex> lock(mu_);
    return cv_.wait_for(lock, limit, [&] { return calls_.size() >= count; });
  }

  // Starts "./kelp" through the fake host; the host must script it.
  static void spawnAgent(UpdateService& service, AgentRequestRecord&) {
    service.agentClient = ko::ipc::spawn(std::vector<std::string>{"./kelp"});
    if (service.agentClient->state() != ko::ipc::ClientState::Running) service.agentClient.reset();
  }

  bool downloadSucceeds = true;
  bool checksumMatches = true;
  std::function<void(UpdateService&, AgentRequestRecord&)> onStartAgent = spawnAgent;
  std::function<void(UpdateService&, AgentRequestRecord&)> onStartReset = spawnAgent;

 private:
  void record(const std::string& call) {
    {
      std::lock_guard<std::mutex> lock(mu_);
      calls_.push_back(call);
    }
    cv_.notify_all();
  }

  mutable std::mutex mu_;
  mutable std::condition_variable cv_;
  std::vector<std::string> calls_;
};

// A worker wait whose time-outs happen only when the test fires them. It
// records the period of every wait and lets the test wait (with a deadline)
// until the worker sleeps again.
class DrivenWait : public WorkerWait {
 public:
  bool waitForWork(UpdateService& s, std::chrono::seconds timeout) override NO_THREAD_SAFETY_ANALYSIS {
    periods_.push_back(timeout);
    sleeping_ = true;
    s.wakeCondition.signalAll();  // tell waitUntilSleeping
    while (!s.workerShouldWake() && firedTimeouts_ == 0) s.waitForWake();
    sleeping_ = false;
    if (s.workerShouldWake()) return true;
    --firedTimeouts_;
    return false;
  }

  // True once the worker sleeps for the `count`-th time (1-based).
  bool waitUntilSleeping(UpdateService& s, size_t count) NO_THREAD_SAFETY_ANALYSIS {
    const auto deadline = saturatingDeadline(kTestDeadline);
    MutexLock lock(&s.stateMutex);
    while (!(sleeping_ && periods_.size() >= count)) {
      if (!s.waitForWakeUntil(deadline)) return sleeping_ && periods_.size() >= count;
    }
    return true;
  }

  // Ends the current sleep as a time-out (the worker must be sleeping).
  void fireTimeout(UpdateService& s) NO_THREAD_SAFETY_ANALYSIS {
    {
      MutexLock lock(&s.stateMutex);
      ++firedTimeouts_;
    }
    s.wakeCondition.signalAll();
  }

  // Fires one time-out and waits until the worker has run the pass and sleeps again.
  bool runTimedOutPass(UpdateService& s) {
    const size_t next = periodCount(s) + 1;
    fireTimeout(s);
    return waitUntilSleeping(s, next);
  }

  std::vector<std::chrono::seconds> periods(UpdateService& s) NO_THREAD_SAFETY_ANALYSIS {
    MutexLock lock(&s.stateMutex);
    return periods_;
  }
  size_t periodCount(UpdateService& s) { return periods(s).size(); }

 private:
  // Guarded by the service's stateMutex.
  std::vector<std::chrono::seconds> periods_;
  bool sleeping_ = false;
  int firedTimeouts_ = 0;
};

// Runs UpdateService::runWorker on its own thread; stops and joins it on
// destruction. A watchdog stops the worker if the test hangs.
class WorkerThread {
 public:
  explicit WorkerThread(UpdateService& service)
      : service_(service), watchdog_(std::chrono::seconds(20), [&service] { service.requestStop(); }), thread_([&service] {
          service.runWorker();
        }) {}
  ~WorkerThread() { stop(); }
  void stop() {
    if (!thread_.joinable()) return;
    service_.requestStop();
    thread_.join();
  }
  bool finished() const { return !thread_.joinable(); }

 private:
  UpdateService& service_;
  Watchdog watchdog_;
  std::thread thread_;
};

// Texts of the logged lines, in order.
inline std::vector<std::string> logTexts(const FakeHost& host) {
  std::vector<std::string> texts;
  for (const LogRecord& r : host.logs()) texts.push_back(r.text);
  return texts;
}

inline std::vector<std::string> documentTexts(const FakeHost& host, uint32_t target) {
  std::vector<std::string> texts;
  for (const DocumentRecord& d : host.documents()) {
    if (d.target == target) texts.push_back(d.text);
  }
  return texts;
}

}  // namespace sorvik::testing
