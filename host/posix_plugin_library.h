#pragma once

// The plug-in's shared library and its six entry points, loaded with
// dlopen(RTLD_NOW | RTLD_LOCAL) so that a missing symbol fails at load time
// and two loads never share symbols.

#include <cstdint>
#include <string>

namespace sorvik::host {

struct PluginEntryPoints {
  int32_t (*load)(void* parmsIn, void* parmsOut) = nullptr;
  int32_t (*open)() = nullptr;
  int32_t (*ioctl)(void* record) = nullptr;
  int32_t (*write)(void* record) = nullptr;
  int32_t (*close)() = nullptr;
  int32_t (*unload)() = nullptr;
};

// Not thread-safe: the session opens and closes it while no call is in flight.
class PluginLibrary {
 public:
  PluginLibrary() = default;
  ~PluginLibrary();
  PluginLibrary(const PluginLibrary&) = delete;
  PluginLibrary& operator=(const PluginLibrary&) = delete;

  // False with a readable reason when the library or an entry point is missing.
  bool open(const std::string& path, std::string* error);
  void close();
  bool isOpen() const { return handle_ != nullptr; }
  const PluginEntryPoints& entry() const { return entry_; }

 private:
  void* handle_ = nullptr;
  PluginEntryPoints entry_;
};

}  // namespace sorvik::host
