#pragma once

// Runs a test inside a fresh temporary directory: the plug-in resolves every
// relative path ("update.xml", "downloads", the scripts) against the current
// directory, so each test gets its own and leaves nothing behind.

#include <boost/filesystem.hpp>

namespace sorvik::testing {

class ScopedTempCwd {
 public:
  ScopedTempCwd() : previous_(boost::filesystem::current_path()) {
    dir_ = boost::filesystem::canonical(boost::filesystem::temp_directory_path()) /
           boost::filesystem::unique_path("sorvik-test-%%%%-%%%%-%%%%");
    boost::filesystem::create_directories(dir_);
    boost::filesystem::current_path(dir_);
  }
  ~ScopedTempCwd() {
    boost::system::error_code ignored;
    boost::filesystem::current_path(previous_, ignored);
    boost::filesystem::remove_all(dir_, ignored);
  }
  ScopedTempCwd(const ScopedTempCwd&) = delete;
  ScopedTempCwd& operator=(const ScopedTempCwd&) = delete;
  const boost::filesystem::path& path() const { return dir_; }

 private:
  boost::filesystem::path previous_;
  boost::filesystem::path dir_;
};

}  // namespace sorvik::testing
