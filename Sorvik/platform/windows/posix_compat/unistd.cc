#include <unistd.h>

#include <windows.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

extern "C" {

int setenv(const char* name, const char* value, int overwrite) {
  if (name == nullptr || *name == '\0' || std::strchr(name, '=') != nullptr) {
    errno = EINVAL;
    return -1;
  }
  if (!overwrite && std::getenv(name) != nullptr) return 0;
  return _putenv_s(name, value) == 0 ? 0 : -1;
}

int unsetenv(const char* name) { return _putenv_s(name, "") == 0 ? 0 : -1; }

char* mkdtemp(char* pattern) {
  const size_t length = std::strlen(pattern);
  if (length < 6 || std::strcmp(pattern + length - 6, "XXXXXX") != 0) {
    errno = EINVAL;
    return nullptr;
  }
  static const char kLetters[] = "abcdefghijklmnopqrstuvwxyz0123456789";
  unsigned long seed = ::GetTickCount() ^ (::GetCurrentProcessId() << 16);
  for (int attempt = 0; attempt < 100; ++attempt) {
    for (size_t i = length - 6; i < length; ++i) {
      seed = seed * 1103515245u + 12345u;
      pattern[i] = kLetters[(seed >> 16) % (sizeof kLetters - 1)];
    }
    if (::CreateDirectoryA(pattern, nullptr)) return pattern;
    const DWORD error = ::GetLastError();
    if (error == ERROR_PATH_NOT_FOUND && attempt == 0) {
      char* slash = std::strrchr(pattern, '/');
      if (slash == nullptr) slash = std::strrchr(pattern, '\\');
      if (slash != nullptr && slash != pattern) {
        const char saved = *slash;
        *slash = '\0';
        ::CreateDirectoryA(pattern, nullptr);
        *slash = saved;
        continue;
      }
    }
    if (error != ERROR_ALREADY_EXISTS && error != ERROR_PATH_NOT_FOUND) break;
  }
  errno = EEXIST;
  return nullptr;
}

}  // extern "C"
