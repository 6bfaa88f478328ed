#pragma once

// MinGW's <sys/stat.h> plus lstat: Windows programs here meet no POSIX
// symbolic links, so it is stat. Paths from std::filesystem are wide.
#include_next <sys/stat.h>

#ifdef __cplusplus
extern "C++" {
inline int lstat(const char* path, struct stat* info) { return stat(path, info); }
int lstat(const wchar_t* path, struct stat* info);
}
#endif
