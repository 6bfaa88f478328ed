// sorvik-load: loads a plug-in library the way the host does, runs it
// through Load, Open, Close and Unload, and prints what it sends back.
// Exits 0 only when the module announced itself with the expected text.
//
//   sorvik-load LIBRARY EXPECTED_VERSION

#include <dlfcn.h>

#include <cstdint>
#include <cstdio>
#include <mutex>
#include <string>
#include <vector>

#include "Sorvik/plugin/host_records.h"
#include "Sorvik/plugin/module.h"

namespace {

using ko::core::HostMessage;

std::mutex printMutex;
std::vector<std::string> announcements;

int32_t hostCallback(void* raw, uint64_t) {
  const HostMessage m = ko::core::copyHostMessage(raw);
  if (m.type() == ko::core::kTypeLogLevelQuery) return 0;
  const std::string text(static_cast<const char*>(m.data()), m.length());
  std::lock_guard<std::mutex> lock(printMutex);
  if (m.type() == ko::core::kTypeLogLine) {
    std::printf("log %3d  %s\n", m.logLevel(), text.c_str());
  } else if (m.type() == ko::core::kTypeXmlDocument) {
    std::printf("doc %4u %s\n", m.target(), text.c_str());
    if (m.target() == ko::core::kTargetState && text.find("<Modules>") != std::string::npos) {
      announcements.push_back(text);
    }
  }
  return 0;
}

template <typename Fn>
Fn symbol(void* library, const char* name) {
  void* p = dlsym(library, name);
  if (p == nullptr) {
    std::fprintf(stderr, "sorvik-load: %s is not exported\n", name);
    std::exit(2);
  }
  return reinterpret_cast<Fn>(p);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 3) {
    std::fprintf(stderr, "usage: %s LIBRARY EXPECTED_VERSION\n", argv[0]);
    return 2;
  }
  void* library = dlopen(argv[1], RTLD_NOW | RTLD_LOCAL);
  if (library == nullptr) {
    std::fprintf(stderr, "sorvik-load: %s\n", dlerror());
    return 2;
  }
  using EntryWithArgs = int32_t (*)(void*, void*);
  using EntryNoArgs = int32_t (*)();
  auto load = symbol<EntryWithArgs>(library, "Load");
  auto open = symbol<EntryNoArgs>(library, "Open");
  auto close = symbol<EntryNoArgs>(library, "Close");
  auto unload = symbol<EntryNoArgs>(library, "Unload");

  unsigned char parmsIn[64] = {};
  unsigned char parmsOut[64] = {};
  ko::core::writePointer(parmsIn + 16, reinterpret_cast<const void*>(&hostCallback));
  load(parmsIn, parmsOut);
  std::printf("Load: module id 0x%x\n", ko::core::readU32(parmsOut + 8));
  open();
  close();
  unload();
  dlclose(library);

  const std::string expected = std::string("<?xml ?><Qora Delta=\"0\"><Modules><Module Name=\"Sorvik\" ID=\"3670016\" Version=\"") +
                               argv[2] + "\" /></Modules></Qora>";
  if (announcements.size() != 1 || announcements[0] != expected) {
    std::fprintf(stderr, "sorvik-load: expected the announcement\n  %s\n", expected.c_str());
    return 1;
  }
  std::printf("announcement OK: Sorvik %s\n", argv[2]);
  return 0;
}
