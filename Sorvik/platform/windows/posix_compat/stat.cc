#include <sys/stat.h>

#include <windows.h>

#include <cerrno>
#include <string>

int lstat(const wchar_t* path, struct stat* info) {
  const int needed = ::WideCharToMultiByte(CP_ACP, 0, path, -1, nullptr, 0, nullptr, nullptr);
  if (needed <= 0) {
    errno = EINVAL;
    return -1;
  }
  std::string narrow(static_cast<size_t>(needed), '\0');
  ::WideCharToMultiByte(CP_ACP, 0, path, -1, &narrow[0], needed, nullptr, nullptr);
  return stat(narrow.c_str(), info);
}
