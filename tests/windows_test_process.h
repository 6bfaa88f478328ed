#pragma once

// A process a Windows test starts itself from an image path; ended (exit
// code 99) and released when the test is done, so nothing outlives it.

#include <windows.h>

#include <cstdint>
#include <filesystem>
#include <string>

namespace sorvik::testing {

class OwnedProcess {
 public:
  explicit OwnedProcess(const std::filesystem::path& image) {
    std::string cmd = "\"" + image.string() + "\"";
    STARTUPINFOA si{};
    si.cb = sizeof si;
    ok_ = ::CreateProcessA(nullptr, cmd.data(), nullptr, nullptr, FALSE, 0, nullptr, nullptr, &si, &pi_) != 0;
    if (ok_) ::CloseHandle(pi_.hThread);
  }
  ~OwnedProcess() {
    if (!ok_) return;
    ::TerminateProcess(pi_.hProcess, 99);  // no-op when the test already ended it
    ::WaitForSingleObject(pi_.hProcess, 10000);
    ::CloseHandle(pi_.hProcess);
  }
  OwnedProcess(const OwnedProcess&) = delete;
  OwnedProcess& operator=(const OwnedProcess&) = delete;

  bool ok() const { return ok_; }
  uint32_t pid() const { return pi_.dwProcessId; }
  // The exit code once the process has ended within 10 s, else -1.
  long exitCode() const {
    if (::WaitForSingleObject(pi_.hProcess, 10000) != WAIT_OBJECT_0) return -1;
    DWORD code = 0;
    ::GetExitCodeProcess(pi_.hProcess, &code);
    return static_cast<long>(code);
  }

 private:
  PROCESS_INFORMATION pi_{};
  bool ok_ = false;
};

}  // namespace sorvik::testing
