#pragma once

// One loaded plug-in driven the way the recording server drives it: Load,
// Open, IOCTL code 1 on a dedicated worker thread, commands and
// configuration from the caller, child-process packets through the process
// runner, and Close, join, Unload on the way out or for a restart.

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <thread>

#include "Sorvik/platform/mutex.h"
#include "host/posix_plugin_library.h"
#include "host/process_runner.h"
#include "host/sorvik_host_events.h"

namespace sorvik::host {

struct SessionOptions {
  std::string libraryPath;  // absolute, so a restart finds it again
  RunnerOptions runner;
  int32_t logThreshold = 25;
};

// Thread-safe. lifecycleMu_ serialises the load/unload sequences with the
// calls that need a loaded plug-in (it is held through a whole restart, by
// design). Deliveries from the runner thread do not take it: they pass a
// gate (gateMu_) that a restart closes only after the worker has returned,
// because the worker may be waiting for an answer to a start request.
class HostSession {
 public:
  using EventSink = std::function<void(Event)>;

  HostSession(SessionOptions options, EventSink sink);
  ~HostSession();
  HostSession(const HostSession&) = delete;
  HostSession& operator=(const HostSession&) = delete;

  // Starts the runner, loads the plug-in and starts its worker.
  bool start(std::string* error);
  // Close, join, Unload, reload the library, Load, Open, worker again.
  // Children keep running but are no longer connected to the plug-in.
  bool restart(std::string* error);
  // Close, join, Unload; stops the runner. Children keep running.
  void shutdown();

  // Write with a command document; false when no plug-in is loaded.
  bool sendCommand(const std::string& xml);
  // IOCTL code 2 with a configuration document.
  bool sendConfiguration(const std::string& xml);

  void setLogThreshold(int32_t level) { threshold_.store(level); }
  int32_t logThreshold() const { return threshold_.load(); }

 private:
  static int32_t callback(void* message, uint64_t reserved);
  int32_t onMessage(const void* message);
  void notice(const std::string& text);
  void deliver(const unsigned char* packet, size_t length);

  bool loadPlugin(std::string* error) REQUIRES(lifecycleMu_);
  // CondVar's annotation names its own mutex pointer, which the analysis
  // cannot equate with gateMu_.
  void waitGateIdle() REQUIRES(gateMu_) NO_THREAD_SAFETY_ANALYSIS { gateIdle_.wait(); }
  void unloadPlugin() REQUIRES(lifecycleMu_);

  const SessionOptions options_;
  const EventSink sink_;
  std::atomic<int32_t> threshold_;
  std::atomic<bool> runnerUp_{false};
  std::unique_ptr<ProcessRunner> runner_;

  Mutex lifecycleMu_;
  PluginLibrary library_ GUARDED_BY(lifecycleMu_);
  std::thread worker_ GUARDED_BY(lifecycleMu_);
  bool loaded_ GUARDED_BY(lifecycleMu_) = false;

  // The worker's progress. The plug-in sets its running flag when IOCTL
  // code 1 enters, so a Close that comes earlier would be undone: the host
  // waits for the worker's first callback (it reports its state at once)
  // before closing, and repeats Close while the worker has not returned.
  bool waitWorker(bool* flag, std::chrono::milliseconds limit) EXCLUDES(workerMu_);
  void waitWorkerChange(std::chrono::steady_clock::time_point deadline) REQUIRES(workerMu_)
      NO_THREAD_SAFETY_ANALYSIS {
    workerChanged_.waitUntil(deadline);
  }
  Mutex workerMu_;
  CondVar workerChanged_{&workerMu_};
  std::thread::id workerId_ GUARDED_BY(workerMu_);
  bool workerEntered_ GUARDED_BY(workerMu_) = false;
  bool workerDone_ GUARDED_BY(workerMu_) = false;

  Mutex gateMu_;
  CondVar gateIdle_{&gateMu_};
  int32_t (*gateIoctl_)(void*) GUARDED_BY(gateMu_) = nullptr;
  int inFlight_ GUARDED_BY(gateMu_) = 0;
};

}  // namespace sorvik::host
