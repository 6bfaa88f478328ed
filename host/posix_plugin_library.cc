#include "host/posix_plugin_library.h"

#include <dlfcn.h>

namespace sorvik::host {
namespace {

template <typename Fn>
bool bind(void* handle, const char* name, Fn* slot, std::string* error) {
  void* symbol = ::dlsym(handle, name);
  if (symbol == nullptr) {
    *error = std::string("entry point ") + name + " not found";
    return false;
  }
  *slot = reinterpret_cast<Fn>(symbol);
  return true;
}

}  // namespace

PluginLibrary::~PluginLibrary() { close(); }

bool PluginLibrary::open(const std::string& path, std::string* error) {
  close();
  handle_ = ::dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (handle_ == nullptr) {
    const char* reason = ::dlerror();
    *error = reason != nullptr ? reason : "cannot load " + path;
    return false;
  }
  PluginEntryPoints entry;
  if (!bind(handle_, "Load", &entry.load, error) || !bind(handle_, "Open", &entry.open, error) ||
      !bind(handle_, "IOCTL", &entry.ioctl, error) || !bind(handle_, "Write", &entry.write, error) ||
      !bind(handle_, "Close", &entry.close, error) || !bind(handle_, "Unload", &entry.unload, error)) {
    close();
    return false;
  }
  entry_ = entry;
  return true;
}

void PluginLibrary::close() {
  if (handle_ != nullptr) ::dlclose(handle_);
  handle_ = nullptr;
  entry_ = PluginEntryPoints();
}

}  // namespace sorvik::host
