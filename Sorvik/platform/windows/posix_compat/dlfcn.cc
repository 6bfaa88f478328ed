#include "dlfcn.h"

#include <windows.h>

#include <cstdio>

namespace {
thread_local char lastError[128];
thread_local bool haveError = false;

void recordError(const char* what) {
  std::snprintf(lastError, sizeof lastError, "%s failed, error %lu", what, ::GetLastError());
  haveError = true;
}
}  // namespace

extern "C" {

void* dlopen(const char* file, int /*mode*/) {
  HMODULE module = ::LoadLibraryA(file);
  if (module == nullptr) recordError("LoadLibrary");
  return reinterpret_cast<void*>(module);
}

void* dlsym(void* handle, const char* name) {
  FARPROC symbol = ::GetProcAddress(static_cast<HMODULE>(handle), name);
  if (symbol == nullptr) recordError("GetProcAddress");
  return reinterpret_cast<void*>(symbol);
}

int dlclose(void* handle) {
  if (::FreeLibrary(static_cast<HMODULE>(handle))) return 0;
  recordError("FreeLibrary");
  return -1;
}

const char* dlerror(void) {
  if (!haveError) return nullptr;
  haveError = false;
  return lastError;
}

}  // extern "C"
