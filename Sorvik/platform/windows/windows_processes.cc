#include "Sorvik/platform/windows/windows_processes.h"

// The narrow-character snapshot entries, whatever the build's UNICODE says.
#undef UNICODE
#undef _UNICODE
#include <windows.h>
#include <tlhelp32.h>

#include <type_traits>

namespace sorvik::platform::windows {
namespace {

static_assert(std::is_same_v<std::remove_extent_t<decltype(PROCESSENTRY32::szExeFile)>, CHAR>,
              "process names are matched as narrow text");

class ScopedHandle {
 public:
  explicit ScopedHandle(HANDLE h) : h_(h) {}
  ~ScopedHandle() {
    if (valid()) ::CloseHandle(h_);
  }
  ScopedHandle(const ScopedHandle&) = delete;
  ScopedHandle& operator=(const ScopedHandle&) = delete;
  bool valid() const { return h_ != nullptr && h_ != INVALID_HANDLE_VALUE; }
  HANDLE get() const { return h_; }

 private:
  HANDLE h_;
};

}  // namespace

bool findProcessesByName(const std::set<std::string>& names, std::vector<uint32_t>* ids) {
  ScopedHandle snapshot(::CreateToolhelp32Snapshot(TH32CS_SNAPPROCESS, 0));
  if (!snapshot.valid()) return false;
  PROCESSENTRY32 entry{};
  entry.dwSize = sizeof(entry);
  if (!::Process32First(snapshot.get(), &entry)) return false;
  do {
    // szExeFile is the image's file name without a directory.
    if (names.count(entry.szExeFile) != 0) ids->push_back(entry.th32ProcessID);
  } while (::Process32Next(snapshot.get(), &entry));
  return true;
}

bool terminateProcess(uint32_t pid, uint32_t exitCode) {
  if (pid == 0) return false;
  ScopedHandle process(::OpenProcess(PROCESS_TERMINATE, FALSE, pid));
  if (!process.valid()) return false;
  return ::TerminateProcess(process.get(), exitCode) != 0;
}

}  // namespace sorvik::platform::windows
