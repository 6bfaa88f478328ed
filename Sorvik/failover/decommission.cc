#include "Sorvik/failover/decommission.h"

#include <memory>

#include "Sorvik/ipc/client.h"
#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/module.h"
#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/service/update_service.h"

namespace sorvik {
namespace {

constexpr char kFailoverScript[] = "scripts/failover.ps1";
// An empty leading text, and no close of the script's input at the first wait:
// the script reads nothing, and the flags are part of the host contract.
constexpr uint32_t kScriptFlags = ko::ipc::kSpawnNoAutoClose | ko::ipc::kSpawnTextA;

void setFailoverStatus(UpdateService& service, int32_t status) {
  MutexLock lock(&service.stateMutex);
  service.FailoverReport.FailoverStatus = status;
}

}  // namespace

void Decommission(UpdateService& service) {
  using namespace ko::core;
  log(kLogProgress, "Attempting to decommission server");
  service.emitFailoverStatus(DECOMMISSION_PENDING, stampTime());
  setFailoverStatus(service, DECOMMISSION_PENDING);

  ko::ipc::SpawnOptions options;
  options.args = {kFailoverScript};
  options.flags = kScriptFlags;
  std::shared_ptr<ko::ipc::client> script = ko::ipc::spawn(options);

  if (script->state() == ko::ipc::ClientState::Failed) {
    service.emitFailoverStatus(DECOMMISSION_ERROR, stampTime());
    log(kLogRejected, "Failover failed (failed to locate or execute script). Emit status DECOMMISSION_ERROR (-103)");
    setFailoverStatus(service, DECOMMISSION_ERROR);
    return;
  }

  log(kLogProgress, "Failover started.");
  // Saved before the wait so that a restart caused by the script still knows
  // a decommission was under way.
  service.persistState();

  const bool exited = script->wait_for(service.timeoutSeconds());
  if (!service.isWorkerRunning()) return;

  if (!exited) {
    log(kLogRejected, "Failover timeout, process may still be running...");
  } else {
    // Widened: negating the lowest 32-bit exit code would overflow.
    log(kLogRejected, "Failover failed (%lld):", -static_cast<long long>(script->wait()));
  }
  service.emitFailoverStatus(DECOMMISSION_ERROR, stampTime());
  {
    MutexLock lock(&service.stateMutex);
    service.FailoverReport.FailoverState = PROTECTED;
    service.FailoverReport.FailoverStatus = DECOMMISSION_ERROR;
  }
  service.persistState();
  // A script that outlived its time is left alone.
}

}  // namespace sorvik
