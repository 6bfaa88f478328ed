#include <cstdlib>

#include "Sorvik/platform/platform.h"
#include "Sorvik/platform/windows/windows_files.h"
#include "Sorvik/platform/windows/windows_processes.h"

namespace sorvik::platform {
namespace {

class WindowsPlatform final : public Platform {
 public:
  std::string writeFileThrough(const std::string& path, const std::string& bytes) override {
    return windows::writeFileThrough(path, bytes);
  }
  int replaceFile(const std::string& from, const std::string& to) override {
    return windows::replaceFile(from, to);
  }
  bool removeFile(const std::string& path) override { return windows::removeFile(path); }
  bool findProcessesByName(const std::set<std::string>& names, std::vector<uint32_t>* ids) override {
    return windows::findProcessesByName(names, ids);
  }
  bool terminateProcess(uint32_t pid, uint32_t exitCode) override {
    return windows::terminateProcess(pid, exitCode);
  }
  // SORVIK_AGENT_IMAGE_NAME gives a test run's agents a name of their own,
  // so that stopping agents by name never reaches another run's agent.
  std::string agentImageName() override {
    const char* name = std::getenv("SORVIK_AGENT_IMAGE_NAME");
    return name != nullptr && *name != '\0' ? name : "kelp.exe";
  }
};

}  // namespace

Platform& native() {
  static WindowsPlatform instance;
  return instance;
}

const char* packageTypeName() { return "windows-x64"; }

const char* pathSeparator() { return "\\"; }

}  // namespace sorvik::platform
