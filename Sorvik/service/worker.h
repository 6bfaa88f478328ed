#pragma once

// The worker loop that UpdateService::runWorker runs on the host's dedicated
// thread: start-up reports, then one pass per wake-up that takes the pending
// work, supervises the failback agent and carries out at most one new piece
// of work through WorkerSteps.
//
// Thread-safety: a Worker lives on the worker thread only. Everything it
// shares with host threads is in UpdateService, read and written under
// stateMutex for single reads and writes; steps and sends run unlocked.

#include <chrono>
#include <cstdint>
#include <string>

#include "Sorvik/service/update_service.h"

namespace sorvik {

class WorkerWait;

// Supervision periods: idle, while an agent runs, while stopping an agent or
// watching a spare reset.
inline constexpr std::chrono::seconds kIdleWait{3420};
inline constexpr std::chrono::seconds kAgentWait{30};
inline constexpr std::chrono::seconds kStoppingWait{1};

// Termination requests after which an agent that does not exit is abandoned.
inline constexpr int32_t kMaxShutdownAttempts = 3;

// What a pass takes out of UpdateService under stateMutex.
struct WorkerInputs {
  int32_t action = action_none;
  bool decommission = false;
  std::string location;
  std::string checksum;
  AgentRequestRecord request;
  std::string drives;
};

// The period the worker sleeps for, given what it supervises.
std::chrono::seconds supervisionTimeout(int32_t currentAction, int32_t shutdownAttempts);

class Worker {
 public:
  Worker(UpdateService& service, WorkerSteps& steps, WorkerWait& wait);
  Worker(const Worker&) = delete;
  Worker& operator=(const Worker&) = delete;

  // Returns once a stop has been requested and noticed.
  void run();

 private:
  void startUp();
  // False when the worker is to stop; `inputs` is left empty on a time-out.
  bool waitAndTake(WorkerInputs* inputs);
  void supervise();
  void superviseReset();
  void superviseAgent();
  void superviseStop();
  void finishStop();
  void carryOut(WorkerInputs& inputs);
  void startAgent(WorkerInputs& inputs, int32_t previousAction);
  void runUpdate(const WorkerInputs& inputs);
  void shutDown();
  bool agentExited(int32_t* exitCode) const;

  UpdateService& service_;
  WorkerSteps& steps_;
  WorkerWait& wait_;
  int32_t currentAction_ = action_none;
  int32_t shutdownAttempts_ = 0;
};

}  // namespace sorvik
