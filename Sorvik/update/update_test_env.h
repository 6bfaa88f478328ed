#pragma once

// Setting for the update step tests: a private working directory (holding
// "update.xml", "./data", "logs/update.log" and "downloads"), the fake host,
// one service with its worker marked as running, and a watchdog that aborts
// a hung test. Test code only.

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
#include "host/test_temp_dir.h"
#include "host/test_watchdog.h"

namespace sorvik::testing {

class UpdateStepTest : public ::testing::Test {
 protected:
  void SetUp() override {
    boost::filesystem::create_directory(dir() / "downloads");
    host_ = std::make_unique<FakeHost>();
    host_->install();
    service_ = std::make_unique<UpdateService>(nullptr);
    MutexLock lock(&service_->stateMutex);
    service_->workerRunning = true;
    service_->DownloadDir = (dir() / "downloads").string();
  }

  void TearDown() override {
    service_.reset();
    host_.reset();
  }

  static void writeFile(const boost::filesystem::path& path, const std::string& bytes) {
    std::ofstream(path.string(), std::ios::binary | std::ios::trunc) << bytes;
  }
  static std::string readFile(const boost::filesystem::path& path) {
    std::ifstream in(path.string(), std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
  }

  // (Status, Progress) of each update status document, in order; Progress
  // is -1 where the document has none.
  std::vector<std::pair<int, int>> updateReports() const {
    std::vector<std::pair<int, int>> reports;
    for (const DocumentRecord& doc : host_->documents()) {
      TiXmlDocument xml;
      xml.Parse(doc.text.c_str());
      const TiXmlElement* update = xml.RootElement() ? xml.RootElement()->FirstChildElement("Update") : nullptr;
      int status = 0;
      int progress = -1;
      if (doc.target != 4 || !update || update->QueryIntAttribute("Status", &status) != TIXML_SUCCESS) continue;
      update->QueryIntAttribute("Progress", &progress);
      reports.emplace_back(status, progress);
    }
    return reports;
  }
  std::vector<int32_t> statuses() const {
    std::vector<int32_t> codes;
    for (const auto& report : updateReports()) codes.push_back(report.first);
    return codes;
  }

  std::vector<LogRecord> logsWith(const std::string& text) const {
    std::vector<LogRecord> found;
    for (const LogRecord& record : host_->logs()) {
      if (record.text.find(text) != std::string::npos) found.push_back(record);
    }
    return found;
  }

  UpdateService& service() { return *service_; }
  FakeHost& host() { return *host_; }
  const boost::filesystem::path& dir() const { return cwd_.path(); }

  Watchdog watchdog_;
  std::unique_ptr<FakeHost> host_;
  std::unique_ptr<UpdateService> service_;

 private:
  ScopedTempCwd cwd_;
};

}  // namespace sorvik::testing
