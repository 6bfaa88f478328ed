#pragma once

// Shared setting for the failover tests: a private working directory (the
// service reads and writes "update.xml" there), the fake host, a fake process
// table in place of the machine's, and a watchdog that aborts a hung test.
// Test code only; has no .cc so that it never enters the library.

#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include <boost/filesystem.hpp>
#include <gtest/gtest.h>

#include "Sorvik/platform/platform.h"
#include "host/fake_host.h"
#include "host/test_temp_dir.h"
#include "host/test_watchdog.h"
#include "Sorvik/service/update_service.h"

namespace sorvik::testing {

// The machine's platform with a scripted process table and a record of
// every state-file write.
class FakeProcessPlatform : public platform::Platform {
 public:
  struct Termination {
    uint32_t pid;
    uint32_t code;
  };

  FakeProcessPlatform() : real_(platform::native()) {}

  void addProcess(uint32_t pid, std::string name) {
    std::lock_guard<std::mutex> lock(mu_);
    table_[pid] = std::move(name);
  }
  void failProcessWalk() {
    std::lock_guard<std::mutex> lock(mu_);
    walkFails_ = true;
  }
  std::vector<Termination> terminations() const {
    std::lock_guard<std::mutex> lock(mu_);
    return terminations_;
  }
  // Contents of every "update.xml" save, in order.
  std::vector<std::string> stateSaves() const {
    std::lock_guard<std::mutex> lock(mu_);
    return stateSaves_;
  }

  std::string writeFileThrough(const std::string& path, const std::string& bytes) override {
    if (path.find("update.xml") != std::string::npos) {
      std::lock_guard<std::mutex> lock(mu_);
      stateSaves_.push_back(bytes);
    }
    return real_.writeFileThrough(path, bytes);
  }
  int replaceFile(const std::string& from, const std::string& to) override { return real_.replaceFile(from, to); }
  bool removeFile(const std::string& path) override { return real_.removeFile(path); }
  bool findProcessesByName(const std::set<std::string>& names, std::vector<uint32_t>* ids) override {
    std::lock_guard<std::mutex> lock(mu_);
    if (walkFails_) return false;
    for (const auto& [pid, name] : table_) {
      if (names.count(name) != 0) ids->push_back(pid);
    }
    return true;
  }
  bool terminateProcess(uint32_t pid, uint32_t exitCode) override {
    std::lock_guard<std::mutex> lock(mu_);
    terminations_.push_back({pid, exitCode});
    return table_.erase(pid) != 0;
  }
  // Fixed, so that the process table below is the whole truth.
  std::string agentImageName() override { return "kelp"; }

 private:
  platform::Platform& real_;
  mutable std::mutex mu_;
  std::map<uint32_t, std::string> table_;
  bool walkFails_ = false;
  std::vector<Termination> terminations_;
  std::vector<std::string> stateSaves_;
};

// Fixture: private directory, fake platform, fake host, one service object
// with its worker marked as running.
class FailoverTest : public ::testing::Test {
 protected:
  void SetUp() override {
    previousPlatform_ = platform::setForTesting(&platform_);
    host_ = std::make_unique<FakeHost>();
    host_->install();
    service_ = std::make_unique<UpdateService>(nullptr);
    MutexLock lock(&service_->stateMutex);
    service_->workerRunning = true;
  }

  void TearDown() override {
    service_.reset();
    host_.reset();
    platform::setForTesting(previousPlatform_);
  }

  // Every log line whose text contains `text`.
  std::vector<LogRecord> logsWith(const std::string& text) const {
    std::vector<LogRecord> found;
    for (const LogRecord& record : host_->logs()) {
      if (record.text.find(text) != std::string::npos) found.push_back(record);
    }
    return found;
  }

  // Status documents (target 4), in the order sent.
  std::vector<std::string> statusDocuments() const {
    std::vector<std::string> found;
    for (const DocumentRecord& doc : host_->documents()) {
      if (doc.target == 4) found.push_back(doc.text);
    }
    return found;
  }

  UpdateService& service() { return *service_; }
  FakeHost& host() { return *host_; }

  FakeProcessPlatform platform_;
  Watchdog watchdog_;
  std::unique_ptr<FakeHost> host_;
  std::unique_ptr<UpdateService> service_;

 private:
  platform::Platform* previousPlatform_ = nullptr;
  ScopedTempCwd cwd_;
};

}  // namespace sorvik::testing
