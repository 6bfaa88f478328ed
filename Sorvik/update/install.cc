#include "Sorvik/update/install.h"

#include <memory>

#include "Sorvik/ipc/client.h"
#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/service/install_log.h"
#include "Sorvik/service/update_service.h"

namespace sorvik {
namespace {

using namespace ko::core;

constexpr char kInstallScript[] = "scripts/update.ps1";
constexpr char kNameWord[] = "Update";

// Flags 4 (no automatic stdin close) and 8 (empty leading text): the script
// is neither fed nor read.
constexpr uint32_t kScriptSpawnFlags = ko::ipc::kSpawnNoAutoClose | ko::ipc::kSpawnTextA;

// The script's exit code n is reported as -n; wrap-around keeps INT32_MIN
// defined.
int32_t negatedExitCode(int32_t exitCode) {
  return static_cast<int32_t>(0u - static_cast<uint32_t>(exitCode));
}

void copyInstallLogToHost() {
  for (const std::string& line : readInstallLogLines(kInstallLogPath)) {
    log(kLogRejected, "  %s", line.c_str());
  }
}

}  // namespace

void InstallBundle(UpdateService& service, const std::string& bundlePath) {
  service.emitUpdateStatus(BUNDLE_INSTALL);
  log(kLogProgress, "Attempting to install bundle: (%s)", bundlePath.c_str());

  ko::ipc::SpawnOptions options;
  options.args = {kInstallScript, bundlePath};
  options.flags = kScriptSpawnFlags;
  const std::shared_ptr<ko::ipc::client> script = ko::ipc::spawn(options);
  if (script->state() == ko::ipc::ClientState::Failed) {
    service.emitUpdateStatus(INSTALL_ERROR);
    log(kLogRejected, "%s failed (failed to locate or execute script).", kNameWord);
    return;
  }
  service.emitUpdateStatus(PENDING_UPDATE);
  log(kLogProgress, "%s started.", kNameWord);
  // If the script restarts the server, the next start finds this mark.
  service.persistState();

  const bool exited = script->wait_for(service.timeoutSeconds());
  // A close ends the wait; the outcome is then judged after the restart.
  if (!service.isWorkerRunning()) return;

  if (!exited) {
    // The script keeps running under the host; only the wait is over.
    service.emitUpdateStatus(INSTALL_TIMEOUT);
    log(kLogRejected, "%s timeout:", kNameWord);
  } else {
    const int32_t status = negatedExitCode(script->wait());
    service.emitUpdateStatus(status);
    log(kLogRejected, "%s failed (%d):", kNameWord, status);
  }
  copyInstallLogToHost();
  service.persistState();
}

}  // namespace sorvik
