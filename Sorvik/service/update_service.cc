#include "Sorvik/service/update_service.h"

#include "Sorvik/platform/platform.h"
#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/module.h"
#include "Sorvik/plugin/xml_envelope.h"
#include "Sorvik/service/install_log.h"
#include "Sorvik/service/state_file.h"
#include "Sorvik/service/worker_wait.h"

namespace sorvik {

using ko::core::log;

const char* const kPlatformNames[kPlatformNameCount] = {
    "unknown",       "linux",          "linux-x64",       "linux-arm",   "linux-armhf", "linux-aarch64",
    "windows",       "windows-x64",    "artpec3",         "artpec4",     "artpec8",     "iqa",
    "isd",           "vivotek-mozart", "vivotek-vivaldi", "samsung",     "axis-arm",    "axis-armhf",
    "marlo-610",     "marlo-825",      "marlo-aarch64",   "",
};

const char* workerActionName(int32_t action) {
  switch (action) {
    case action_none:
      return "none";
    case action_update:
      return "update";
    case action_decommission:
      return "decommission";
    case action_start_agent:
      return "start_agent";
    case action_stop_agent:
      return "stop_agent";
    case action_start_reset:
      return "start_reset";
    default:
      return "unknown";
  }
}

UpdateService::UpdateService(WorkerSteps* steps) : steps_(steps), wait_(&steadyClockWait()) {
  {
    // The host must only ever be offered bundles built for this platform.
    MutexLock lock(&stateMutex);
    PackageType = platform::packageTypeName();
  }
  TiXmlDocument doc;
  if (loadDocument(doc, kStateFileName)) {
    loadPersistedState(doc);
    std::string packageType;
    {
      MutexLock lock(&stateMutex);
      packageType = PackageType;
    }
    if (!isKnownPlatform(packageType)) {
      log(ko::core::kLogRejected, "Invalid platform type (%s)", packageType.c_str());
      MutexLock lock(&stateMutex);
      PackageType = kPlatformNames[0];
    }
  }
  MutexLock lock(&stateMutex);
  if (FailoverReport.FailoverState == -1) FailoverReport.FailoverState = ko::core::PROTECTED;
}

UpdateService::~UpdateService() = default;

void UpdateService::loadPersistedState(TiXmlDocument& doc) {
  const TiXmlElement* root = doc.RootElement();
  const TiXmlElement* update = root != nullptr ? root->FirstChildElement("Update") : nullptr;
  if (update == nullptr) return;
  int32_t id = 0;
  if (!ko::core::readIntAttribute(update, "ID", &id) || id != static_cast<int32_t>(ko::core::kModuleId)) return;

  if (const char* dir = update->Attribute("DownloadDir")) {
    MutexLock lock(&stateMutex);
    DownloadDir = dir;
  }

  int32_t pendingFailover = 0;
  if (!ko::core::readIntAttribute(update, "PendingFailover", &pendingFailover)) pendingFailover = 0;
  {
    MutexLock lock(&stateMutex);
    FailoverReport.FailoverStatus = pendingFailover;
  }
  // After a failed decommission the state on file is the one that failed;
  // the server starts over as PROTECTED.
  int32_t failoverState = 0;
  if (pendingFailover != ko::core::DECOMMISSION_ERROR &&
      ko::core::readIntAttribute(update, "FailoverState", &failoverState)) {
    MutexLock lock(&stateMutex);
    FailoverReport.FailoverState = failoverState;
  }

  int32_t timeout = 0;
  if (!ko::core::readIntAttribute(update, "Timeout", &timeout) || timeout < 300) timeout = 600;
  {
    MutexLock lock(&stateMutex);
    Timeout = timeout;
  }

  int32_t pendingUpdate = 0;
  if (!ko::core::readIntAttribute(update, "PendingUpdate", &pendingUpdate) || pendingUpdate == 0) return;
  // The host went down while the install script ran; its log tells how it ended.
  const int32_t outcome = installLogReportsFailure() ? ko::core::INSTALL_ERROR : ko::core::UPDATE_SUCCESS;
  MutexLock lock(&stateMutex);
  Status = outcome;
}

void UpdateService::persistState() {
  TiXmlDocument doc;
  buildStateDocument(doc, false);
  std::string error;
  if (!saveDocument(doc, kStateFileName, &error)) {
    log(ko::core::kLogStepFailed, "Could not save %s: %s", kStateFileName, error.c_str());
  }
}

bool UpdateService::isKnownPlatform(const std::string& name) const {
  for (const char* known : kPlatformNames) {
    if (name == known) return true;
  }
  return false;
}

bool UpdateService::isWorkerRunning() {
  MutexLock lock(&stateMutex);
  return workerRunning;
}

int32_t UpdateService::timeoutSeconds() {
  MutexLock lock(&stateMutex);
  return Timeout;
}

std::string UpdateService::downloadDir() {
  MutexLock lock(&stateMutex);
  return DownloadDir;
}

void UpdateService::setWorkerWaitForTesting(WorkerWait* wait) {
  wait_ = wait != nullptr ? wait : &steadyClockWait();
}

}  // namespace sorvik
