#pragma once

// <dlfcn.h> for code that loads the plug-in in the Windows build of the
// tests: the POSIX loader calls over LoadLibrary. Declared without
// <windows.h> so that its macros stay out of the including file.

#ifdef __cplusplus
extern "C" {
#endif

#define RTLD_LAZY 1
#define RTLD_NOW 2
#define RTLD_GLOBAL 0x100
#define RTLD_LOCAL 0

void* dlopen(const char* file, int mode);
void* dlsym(void* handle, const char* name);
int dlclose(void* handle);
const char* dlerror(void);

#ifdef __cplusplus
}
#endif
