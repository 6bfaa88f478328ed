// Feeds arbitrary bytes to the configuration intake. The first byte chooses
// the server's starting role (bits 0-2) and whether failover is available
// (bit 3 clear), so every row of the role table is reachable; the rest is the
// document. Seeds in corpus/configuration start with a printable selector
// ('0' = PROTECTED with failover, '4' = COMMISSIONED, '5' = RESERVE_SPARE,
// '8' = PROTECTED without failover).

#include <stdlib.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <string>
#include <vector>

#include "Sorvik/plugin/host_callback.h"
#include "Sorvik/service/update_service.h"

namespace {

std::string gDirectory;
sorvik::UpdateService* gService = nullptr;

int32_t discardHostMessage(void* /*message*/, uint64_t /*reserved*/) { return 0; }

void removeDirectory() {
  if (gDirectory.empty()) return;
  std::remove((gDirectory + "/update.xml").c_str());
  std::remove((gDirectory + "/update.xml.pending").c_str());
  ::rmdir(gDirectory.c_str());
}

// The fuzzer reads its arguments after this hook: corpus paths and the
// crash artifact prefix are pinned to the directory it was started in before
// we move to a private one.
void anchorArguments(int* argc, char*** argv, const std::string& startDir) {
  static std::vector<std::string> texts;
  static std::vector<char*> pointers;
  bool hasArtifactPrefix = false;
  for (int i = 0; i < *argc; ++i) {
    std::string arg = (*argv)[i];
    if (arg.rfind("-artifact_prefix=", 0) == 0) hasArtifactPrefix = true;
    if (i > 0 && !arg.empty() && arg[0] != '-' && arg[0] != '/') arg = startDir + "/" + arg;
    texts.push_back(arg);
  }
  if (!hasArtifactPrefix) texts.push_back("-artifact_prefix=" + startDir + "/");
  for (std::string& text : texts) pointers.push_back(text.data());
  pointers.push_back(nullptr);
  *argc = static_cast<int>(texts.size());
  *argv = pointers.data();
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int* argc, char*** argv) {
  char startDir[4096];
  if (::getcwd(startDir, sizeof(startDir)) == nullptr) ::abort();
  anchorArguments(argc, argv, startDir);
  // The service saves "update.xml" in the current directory.
  char pattern[] = "/tmp/sorvik-configuration-fuzz-XXXXXX";
  if (::mkdtemp(pattern) == nullptr || ::chdir(pattern) != 0) ::abort();
  gDirectory = pattern;
  std::atexit(removeDirectory);
  ko::core::setHostCallback(&discardHostMessage);
  gService = new sorvik::UpdateService(nullptr);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  static const int32_t kRoles[] = {100, 101, 102, 103, 104, 105, -1, 0};
  {
    sorvik::MutexLock lock(&gService->stateMutex);
    gService->FailoverReport.FailoverState = kRoles[data[0] & 7];
    gService->HasFailover = (data[0] & 8) == 0;
    gService->decommissionRequested = false;
    gService->postedAction = sorvik::action_none;
  }
  gService->processConfiguration(data + 1, size - 1);
  return 0;
}
