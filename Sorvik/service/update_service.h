#pragma once

// The one service object: every piece of the plug-in's state, the lock that
// guards it and the condition through which host threads hand work to the
// worker thread.
//
// Thread-safety: members marked GUARDED_BY(stateMutex) are read and written
// only under stateMutex, held for short reads and writes; never across a log
// line, a document send, file I/O or a wait for a child. Members without the
// mark are touched by the worker thread only, or are fixed after construction.

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>

#include <tinyxml.h>

#include "Sorvik/ipc/client.h"
#include "Sorvik/platform/mutex.h"
#include "Sorvik/plugin/status_codes.h"

namespace sorvik {

class WorkerSteps;
class WorkerWait;

// Where the state survives restarts, relative to the host's current directory.
inline constexpr const char kStateFileName[] = "update.xml";

enum WorkerAction : int32_t {
  action_none = 0,
  action_update = 1,
  action_decommission = 2,
  action_start_agent = 3,
  action_stop_agent = 4,
  action_start_reset = 5,
};
const char* workerActionName(int32_t action);

struct FailoverReportRecord {
  int32_t FailoverState = -1;
  int32_t FailoverStatus = 0;
  uint32_t Time = 0;
  uint32_t Milliseconds = 0;
};

struct FailbackReportRecord {
  int32_t FailbackStatus = ko::core::AGENT_NONE;
  uint32_t Time = 0;
  uint32_t Milliseconds = 0;
  uint32_t Port = 0;
};

struct AgentRequestRecord {
  int32_t FailoverStart = 0;
  int32_t FailoverEnd = 0;
  std::string PasswordToken;
  uint32_t Port = 7066;
};

struct TimeStamp {
  uint32_t seconds = 0;
  uint32_t milliseconds = 0;
};
TimeStamp stampTime();

inline constexpr int kPlatformNameCount = 22;
extern const char* const kPlatformNames[kPlatformNameCount];

class UpdateService {
 public:
  // `steps` carries out the long work of the worker (download, checksum,
  // install, decommission, agent); tests pass fakes. Not owned; must outlive
  // the service.
  explicit UpdateService(WorkerSteps* steps);
  ~UpdateService();
  UpdateService(const UpdateService&) = delete;
  UpdateService& operator=(const UpdateService&) = delete;

  // Worker (runs on the host's dedicated thread until requestStop).
  void runWorker();
  void requestStop();
  void ensureDownloadDir();

  // Intake from host threads.
  void processCommand(const unsigned char* data, size_t length);
  void processAgentCommand(const TiXmlElement& element);
  void processConfiguration(const unsigned char* data, size_t length);

  // Persisted state and status documents.
  void buildStateDocument(TiXmlDocument& doc, bool statusForm);
  void persistState();
  void emitState();
  void emitUpdateStatus(int32_t code);
  void emitFailoverStatus(int32_t code, TimeStamp when);
  void emitFailbackStatus(int32_t status, TimeStamp when, uint32_t port);
  void emitSpareResetStatus(int32_t status);

  bool isKnownPlatform(const std::string& name) const;

  // The worker's wake test: an update is pending, an action was posted, or
  // the worker is asked to stop.
  bool workerShouldWake() REQUIRES(stateMutex) {
    return !Location.empty() || postedAction != action_none || !workerRunning;
  }
  // Sleeps on wakeCondition, which is bound to stateMutex (the analysis
  // cannot see that binding). False once `deadline` has passed.
  bool waitForWakeUntil(CondVar::Clock::time_point deadline) REQUIRES(stateMutex) NO_THREAD_SAFETY_ANALYSIS {
    return wakeCondition.waitUntil(deadline);
  }
  void waitForWake() REQUIRES(stateMutex) NO_THREAD_SAFETY_ANALYSIS { wakeCondition.wait(); }
  // Replaces how the worker sleeps between passes (nullptr: the steady
  // clock). Tests use it to fire time-outs without waiting; set it before
  // runWorker starts.
  void setWorkerWaitForTesting(WorkerWait* wait);

  // Convenience readers that take stateMutex briefly.
  bool isWorkerRunning();
  int32_t timeoutSeconds();
  std::string downloadDir();

  Mutex stateMutex;
  bool workerRunning GUARDED_BY(stateMutex) = false;
  std::string PackageType GUARDED_BY(stateMutex);
  std::string DownloadDir GUARDED_BY(stateMutex);
  std::string Location GUARDED_BY(stateMutex);
  std::string Checksum GUARDED_BY(stateMutex);
  int32_t Status GUARDED_BY(stateMutex) = ko::core::NO_UPDATE;
  int32_t Progress GUARDED_BY(stateMutex) = 0;
  uint32_t Time GUARDED_BY(stateMutex) = 0;
  int32_t Timeout GUARDED_BY(stateMutex) = 600;
  CondVar wakeCondition{&stateMutex};
  bool HasFailover GUARDED_BY(stateMutex) = true;
  FailoverReportRecord FailoverReport GUARDED_BY(stateMutex);
  bool decommissionRequested GUARDED_BY(stateMutex) = false;
  int32_t postedAction GUARDED_BY(stateMutex) = action_none;
  FailbackReportRecord FailbackReport GUARDED_BY(stateMutex);
  int32_t SpareResetStatus GUARDED_BY(stateMutex) = ko::core::AGENT_NONE;
  AgentRequestRecord AgentRequest GUARDED_BY(stateMutex);
  // Worker thread only.
  std::shared_ptr<ko::ipc::client> agentClient;
  std::string storageDrives GUARDED_BY(stateMutex);

 private:
  void loadPersistedState(TiXmlDocument& doc);

  WorkerSteps* const steps_;
  WorkerWait* wait_;
  // True while some thread is inside runWorker: there is only ever one worker.
  bool workerActive_ GUARDED_BY(stateMutex) = false;
};

// The long-running steps the worker carries out, implemented by the update
// and failover layers (which sit above the service) and by fakes in tests.
class WorkerSteps {
 public:
  virtual ~WorkerSteps() = default;
  // The location as a log line may show it, its password as "***". The
  // update layer knows the location grammar; this fallback hides the whole
  // user and password.
  virtual std::string LocationForLog(const std::string& location);
  // True when the bundle was downloaded; `bundlePath` receives its path.
  virtual bool DownloadBundle(UpdateService& service, const std::string& location, std::string& bundlePath) = 0;
  virtual bool VerifyBundleChecksum(UpdateService& service, const std::string& bundlePath,
                                    const std::string& checksum) = 0;
  virtual void InstallBundle(UpdateService& service, const std::string& bundlePath) = 0;
  virtual void Decommission(UpdateService& service) = 0;
  // Outcome in service.agentClient (set or empty) and request.Port.
  virtual void StartAgent(UpdateService& service, const std::string& drives, AgentRequestRecord& request) = 0;
  virtual void StartReset(UpdateService& service, const std::string& drives, AgentRequestRecord& request) = 0;
  virtual void StopAgent(UpdateService& service, std::shared_ptr<ko::ipc::client>& handle, uint32_t exitCode) = 0;
};

}  // namespace sorvik
