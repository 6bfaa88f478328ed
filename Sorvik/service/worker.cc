#include "Sorvik/service/worker.h"

#include <exception>
#include <utility>

#include <boost/filesystem.hpp>

#include "Sorvik/ipc/client.h"
#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/service/install_log.h"
#include "Sorvik/service/status_documents.h"
#include "Sorvik/service/worker_wait.h"

namespace sorvik {
namespace {

using ko::core::kLogInternal;
using ko::core::kLogProgress;
using ko::core::kLogRejected;
using ko::core::kLogStepFailed;
using ko::core::log;

// Keeps the worker alive when a step throws (out of memory, a regex engine
// failure): the step has failed, the next pass goes on.
template <typename Step>
void runGuarded(const char* what, Step&& step) {
  try {
    step();
  } catch (const std::exception& e) {
    log(kLogInternal, "%s failed: %s", what, e.what());
  } catch (...) {
    log(kLogInternal, "%s failed", what);
  }
}

// Stand-in when the service was built without steps: nothing to carry out.
class NoSteps final : public WorkerSteps {
 public:
  bool DownloadBundle(UpdateService&, const std::string&, std::string&) override { return false; }
  bool VerifyBundleChecksum(UpdateService&, const std::string&, const std::string&) override { return false; }
  void InstallBundle(UpdateService&, const std::string&) override {}
  void Decommission(UpdateService&) override {}
  void StartAgent(UpdateService&, const std::string&, AgentRequestRecord&) override {}
  void StartReset(UpdateService&, const std::string&, AgentRequestRecord&) override {}
  void StopAgent(UpdateService&, std::shared_ptr<ko::ipc::client>&, uint32_t) override {}
};

WorkerSteps& stepsOrNone(WorkerSteps* steps) {
  static NoSteps none;
  return steps != nullptr ? *steps : none;
}

}  // namespace

std::chrono::seconds supervisionTimeout(int32_t currentAction, int32_t shutdownAttempts) {
  if (shutdownAttempts > 0 || currentAction == action_start_reset) return kStoppingWait;
  if (currentAction == action_start_agent) return kAgentWait;
  return kIdleWait;
}

Worker::Worker(UpdateService& service, WorkerSteps& steps, WorkerWait& wait)
    : service_(service), steps_(steps), wait_(wait) {}

void Worker::run() {
  {
    MutexLock lock(&service_.stateMutex);
    service_.workerRunning = true;
  }
  startUp();
  for (;;) {
    WorkerInputs inputs;
    if (!waitAndTake(&inputs)) break;
    log(kLogProgress, "WorkerThread awake action=%s, currentAction=%s", workerActionName(inputs.action),
        workerActionName(currentAction_));
    supervise();
    carryOut(inputs);
  }
  shutDown();
}

void Worker::startUp() {
  service_.ensureDownloadDir();
  service_.emitState();

  int32_t failoverState = 0;
  int32_t status = 0;
  {
    MutexLock lock(&service_.stateMutex);
    service_.FailoverReport.FailoverStatus = service_.FailoverReport.FailoverState;
    failoverState = service_.FailoverReport.FailoverState;
    status = service_.Status;
  }
  log(kLogProgress, "Emit failover status: %s (%d)", ko::core::statusCodeName(failoverState), failoverState);
  service_.emitUpdateStatus(status);
  if (status == ko::core::INSTALL_ERROR) {
    log(kLogRejected, "Update failed:");
    for (const std::string& line : readInstallLogLines()) log(kLogRejected, "  %s", line.c_str());
  }

  emitFailbackReport(service_, 0);
  int32_t spareReset = 0;
  {
    MutexLock lock(&service_.stateMutex);
    spareReset = service_.SpareResetStatus;
  }
  service_.emitSpareResetStatus(spareReset);
  currentAction_ = action_none;
  shutdownAttempts_ = 0;
}

bool Worker::waitAndTake(WorkerInputs* inputs) {
  const std::chrono::seconds timeout = supervisionTimeout(currentAction_, shutdownAttempts_);
  UpdateService& s = service_;
  MutexLock lock(&s.stateMutex);
  if (!wait_.waitForWork(s, timeout)) return true;  // time-out: supervise only
  if (!s.workerRunning) return false;
  inputs->location = std::move(s.Location);
  s.Location.clear();
  inputs->checksum = std::move(s.Checksum);
  s.Checksum.clear();
  inputs->decommission = std::exchange(s.decommissionRequested, false);
  inputs->action = std::exchange(s.postedAction, action_none);
  inputs->request = std::exchange(s.AgentRequest, AgentRequestRecord{});
  inputs->drives = s.storageDrives;
  return true;
}

bool Worker::agentExited(int32_t* exitCode) const {
  if (!service_.agentClient || service_.agentClient->state() != ko::ipc::ClientState::Exited) return false;
  *exitCode = service_.agentClient->value();
  return true;
}

void Worker::supervise() {
  switch (currentAction_) {
    case action_start_reset:
      superviseReset();
      break;
    case action_start_agent:
      superviseAgent();
      break;
    case action_stop_agent:
      if (shutdownAttempts_ >= 1) superviseStop();
      break;
    default:
      break;
  }
}

void Worker::superviseReset() {
  if (!service_.agentClient) {
    log(kLogStepFailed, "Expected a valid IPC object for agent when current action is start_reset");
    currentAction_ = action_none;
    return;
  }
  int32_t exitCode = 0;
  if (!agentExited(&exitCode)) return;
  const int32_t status = exitCode == 0 ? ko::core::AGENT_COMPLETED : ko::core::AGENT_ERROR;
  {
    MutexLock lock(&service_.stateMutex);
    service_.SpareResetStatus = status;
  }
  log(kLogProgress, "Reset agent exited with code %d. Emit reset status %s (%d)", exitCode,
      ko::core::agentStatusName(status), status);
  service_.emitSpareResetStatus(status);
  service_.agentClient.reset();
  currentAction_ = action_none;
}

void Worker::superviseAgent() {
  if (!service_.agentClient) {
    log(kLogStepFailed, "Expected a valid IPC object for agent when current action is start_agent");
    currentAction_ = action_none;
    return;
  }
  int32_t exitCode = 0;
  if (!agentExited(&exitCode)) return;
  {
    MutexLock lock(&service_.stateMutex);
    service_.FailbackReport.FailbackStatus = ko::core::AGENT_ERROR;
  }
  log(kLogProgress, "Failback agent exited with code %d. Emit failback status %s (%d)", exitCode,
      ko::core::agentStatusName(ko::core::AGENT_ERROR), ko::core::AGENT_ERROR);
  emitFailbackReport(service_, 0);
  service_.agentClient.reset();
  currentAction_ = action_none;
}

void Worker::superviseStop() {
  log(kLogProgress, "Verifying the failback agent exited");
  int32_t exitCode = 0;
  if (agentExited(&exitCode)) {
    {
      MutexLock lock(&service_.stateMutex);
      service_.FailbackReport.FailbackStatus = ko::core::AGENT_NONE;
    }
    log(kLogProgress, "Failback agent exited. Emit status: FAILBACK_NONE (%d)", ko::core::AGENT_NONE);
  } else if (shutdownAttempts_ < kMaxShutdownAttempts && service_.agentClient) {
    log(kLogProgress, "Killing agent process");
    steps_.StopAgent(service_, service_.agentClient, 9);
    ++shutdownAttempts_;
    return;
  } else {
    {
      MutexLock lock(&service_.stateMutex);
      service_.FailbackReport.FailbackStatus = ko::core::AGENT_NONE;
    }
    log(kLogProgress, "Abandon agent ipc.  Shutdown attempts %d, ipc object is %s", shutdownAttempts_,
        service_.agentClient ? "valid" : "null");
  }
  finishStop();
}

void Worker::finishStop() {
  emitFailbackReport(service_, 0);
  service_.agentClient.reset();
  shutdownAttempts_ = 0;
  currentAction_ = action_none;
}

void Worker::carryOut(WorkerInputs& inputs) {
  if (inputs.decommission) {
    runGuarded("Decommission", [&] { steps_.Decommission(service_); });
    return;
  }
  if (inputs.action != action_none) {
    const int32_t previous = currentAction_;
    currentAction_ = inputs.action;
    switch (inputs.action) {
      case action_start_agent:
        // A new agent ends the watch over one that was being stopped.
        shutdownAttempts_ = 0;
        runGuarded("StartAgent", [&] { startAgent(inputs, previous); });
        break;
      case action_stop_agent:
        runGuarded("StopAgent", [&] { steps_.StopAgent(service_, service_.agentClient, 15); });
        ++shutdownAttempts_;
        break;
      case action_start_reset:
        shutdownAttempts_ = 0;
        runGuarded("StartReset", [&] { steps_.StartReset(service_, inputs.drives, inputs.request); });
        break;
      default:
        log(kLogInternal, "Worker thread received unknown action");
        break;
    }
    return;
  }
  if (!inputs.location.empty()) runGuarded("Update", [&] { runUpdate(inputs); });
}

void Worker::startAgent(WorkerInputs& inputs, int32_t previousAction) {
  if (previousAction == action_start_agent) {
    log(kLogRejected, "Agent is already running. Expecting stop_agent command first");
    emitFailbackReportUnchanged(service_);
    return;
  }
  service_.emitFailbackStatus(ko::core::AGENT_PENDING, stampTime(), 0);
  steps_.StartAgent(service_, inputs.drives, inputs.request);
  {
    MutexLock lock(&service_.stateMutex);
    if (!service_.workerRunning) return;
    service_.FailbackReport.FailbackStatus = service_.agentClient ? ko::core::AGENT_READY : ko::core::AGENT_ERROR;
  }
  if (!service_.agentClient) currentAction_ = action_none;
  emitFailbackReport(service_, inputs.request.Port);
}

void Worker::runUpdate(const WorkerInputs& inputs) {
  std::string bundlePath;
  if (!steps_.DownloadBundle(service_, inputs.location, bundlePath)) return;
  if (!inputs.checksum.empty() && !steps_.VerifyBundleChecksum(service_, bundlePath, inputs.checksum)) return;
  steps_.InstallBundle(service_, bundlePath);
}

void Worker::shutDown() {
  service_.agentClient.reset();
  runGuarded("StopAgent", [&] { steps_.StopAgent(service_, service_.agentClient, 9); });
}

void UpdateService::runWorker() {
  bool alreadyActive = false;
  {
    MutexLock lock(&stateMutex);
    alreadyActive = std::exchange(workerActive_, true);
  }
  if (alreadyActive) {
    // A second worker would race the first over the agent and the steps.
    log(kLogInternal, "Worker thread is already running; second start ignored");
    return;
  }
  Worker worker(*this, stepsOrNone(steps_), *wait_);
  worker.run();
  MutexLock lock(&stateMutex);
  workerActive_ = false;
}

void UpdateService::requestStop() {
  std::shared_ptr<ko::ipc::client> none;
  runGuarded("StopAgent", [&] { stepsOrNone(steps_).StopAgent(*this, none, 15); });
  {
    MutexLock lock(&stateMutex);
    workerRunning = false;
    Location.clear();
    decommissionRequested = false;
  }
  wakeCondition.signalAll();
}

void UpdateService::ensureDownloadDir() {
  namespace fs = boost::filesystem;
  const std::string configured = downloadDir();
  try {
    const fs::path dir = configured.empty() ? fs::current_path() / "downloads" : fs::path(configured);
    if (!fs::exists(dir) && !fs::create_directories(dir)) {
      log(kLogRejected, "Could not create bundle directory.");
    }
    const std::string native = dir.string();
    MutexLock lock(&stateMutex);
    DownloadDir = native;
  } catch (const std::exception&) {
    log(kLogRejected, "Unable to create Downloads subdirectory");
  }
}

}  // namespace sorvik
