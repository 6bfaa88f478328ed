#include "Sorvik/platform/windows/windows_files.h"

#include <windows.h>

#include <cstdint>

#include "Sorvik/platform/windows/win32_errno.h"

namespace sorvik::platform::windows {

std::string writeFileThrough(const std::string& path, const std::string& bytes) {
  // No sharing: nobody reads a half-written file or replaces it under us.
  // The handle is not inheritable, so no child keeps the file open.
  HANDLE file = ::CreateFileA(path.c_str(), GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS,
                              FILE_ATTRIBUTE_NORMAL | FILE_FLAG_WRITE_THROUGH, nullptr);
  if (file == INVALID_HANDLE_VALUE) return "create error " + std::to_string(::GetLastError());

  std::string error;
  // One WriteFile moves at most 4 GiB; anything beyond is reported short.
  const DWORD wanted = bytes.size() > MAXDWORD ? MAXDWORD : static_cast<DWORD>(bytes.size());
  DWORD written = 0;
  if (!::WriteFile(file, bytes.data(), wanted, &written, nullptr)) {
    error = "write error " + std::to_string(::GetLastError());
  } else if (!::FlushFileBuffers(file)) {
    // Write-through covers the data; the flush also commits the file's size.
    error = "write error " + std::to_string(::GetLastError());
  }
  if (!::CloseHandle(file) && error.empty()) error = "close error " + std::to_string(::GetLastError());
  if (error.empty() && written < bytes.size()) {
    error = "only wrote " + std::to_string(written) + " of " + std::to_string(bytes.size()) + " bytes";
  }
  return error;
}

int replaceFile(const std::string& from, const std::string& to) {
  // MOVEFILE_WRITE_THROUGH returns only once the rename is on disk.
  if (::MoveFileExA(from.c_str(), to.c_str(), MOVEFILE_REPLACE_EXISTING | MOVEFILE_WRITE_THROUGH)) return 0;
  return errnoFromWin32Error(::GetLastError());
}

bool removeFile(const std::string& path) { return ::DeleteFileA(path.c_str()) != 0; }

}  // namespace sorvik::platform::windows
