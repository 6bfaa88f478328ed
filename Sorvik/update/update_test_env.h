#pragma once

// Shared setting for the update pipeline tests: a private working directory
// (the service keeps "update.xml" there and the steps resolve "./data",
// "logs/update.log" and the download directory against it), the fake host,
// one service object with its worker marked as running, and a watchdog that
// aborts a hung test. Test code only.

#include <tinyxml.h>
#include <unistd.h>

#include <boost/filesystem.hpp>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "Sorvik/service/update_service.h"
#include "host/fake_host.h"

namespace sorvik::testing {

// Aborts the process when a test is still running after `limit`, so that a
// lost wake-up fails the run instead of hanging it.
class UpdateWatchdog {
 public:
  explicit UpdateWatchdog(std::chrono::seconds limit = std::chrono::seconds(30)) {
    thread_ = std::thread([this, limit] {
      std::unique_lock<std::mutex> lock(mu_);
      if (!cv_.wait_for(lock, limit, [this] { return done_; })) {
        const auto* info = ::testing::UnitTest::GetInstance()->current_test_info();
        std::fprintf(stderr, "watchdog: %s hung\n", info != nullptr ? info->name() : "?");
        std::abort();
      }
    });
  }
  ~UpdateWatchdog() {
    {
      std::lock_guard<std::mutex> lock(mu_);
      done_ = true;
    }
    cv_.notify_all();
    thread_.join();
  }

 private:
  std::mutex mu_;
  std::condition_variable cv_;
  bool done_ = false;
  std::thread thread_;
};

struct UpdateStatusReport {
  int32_t status = 0;
  int32_t progress = -1;  // -1: not in the document
};

class UpdateStepTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/sorvik-update-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    dir_ = boost::filesystem::canonical(pattern);
    oldDir_ = boost::filesystem::current_path();
    boost::filesystem::current_path(dir_);
    boost::filesystem::create_directory(dir_ / "downloads");
    host_ = std::make_unique<FakeHost>();
    host_->install();
    service_ = std::make_unique<UpdateService>(nullptr);
    MutexLock lock(&service_->stateMutex);
    service_->workerRunning = true;
    service_->DownloadDir = (dir_ / "downloads").string();
  }

  void TearDown() override {
    service_.reset();
    host_.reset();
    boost::filesystem::current_path(oldDir_);
    boost::system::error_code ignored;
    boost::filesystem::remove_all(dir_, ignored);
  }

  static void writeFile(const boost::filesystem::path& path, const std::string& bytes) {
    std::ofstream out(path.string(), std::ios::binary | std::ios::trunc);
    out << bytes;
    ASSERT_TRUE(out.good()) << path;
  }

  static std::string readFile(const boost::filesystem::path& path) {
    std::ifstream in(path.string(), std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
  }

  // Update status documents (target 4 with a Status attribute), in order.
  std::vector<UpdateStatusReport> updateReports() const {
    std::vector<UpdateStatusReport> reports;
    for (const DocumentRecord& doc : host_->documents()) {
      if (doc.target != 4) continue;
      TiXmlDocument xml;
      xml.Parse(doc.text.c_str());
      const TiXmlElement* root = xml.RootElement();
      const TiXmlElement* update = root != nullptr ? root->FirstChildElement("Update") : nullptr;
      UpdateStatusReport report;
      if (update == nullptr || update->QueryIntAttribute("Status", &report.status) != TIXML_SUCCESS) continue;
      update->QueryIntAttribute("Progress", &report.progress);
      reports.push_back(report);
    }
    return reports;
  }

  std::vector<int32_t> statuses() const {
    std::vector<int32_t> codes;
    for (const UpdateStatusReport& report : updateReports()) codes.push_back(report.status);
    return codes;
  }

  // Log lines containing `text`.
  std::vector<LogRecord> logsWith(const std::string& text) const {
    std::vector<LogRecord> found;
    for (const LogRecord& record : host_->logs()) {
      if (record.text.find(text) != std::string::npos) found.push_back(record);
    }
    return found;
  }

  // Every byte that left the plug-in, apart from standard input of children
  // (the one place credentials are meant to go): logs, documents, start requests.
  std::string everythingShown() const {
    std::string all;
    for (const LogRecord& record : host_->logs()) all += record.text + "\n";
    for (const DocumentRecord& doc : host_->documents()) all += doc.text + "\n";
    for (const StartRecord& start : host_->starts()) {
      for (const std::string& arg : start.args) all += arg + "\n";
    }
    return all;
  }

  UpdateService& service() { return *service_; }
  FakeHost& host() { return *host_; }
  const boost::filesystem::path& dir() const { return dir_; }

  UpdateWatchdog watchdog_;
  std::unique_ptr<FakeHost> host_;
  std::unique_ptr<UpdateService> service_;

 private:
  boost::filesystem::path dir_;
  boost::filesystem::path oldDir_;
};

}  // namespace sorvik::testing
