#pragma once

// The development host as a live child process: a test writes instructions
// to its standard input while it runs and waits for what it prints, so that
// it can act between steps (connect to an agent's port, inspect files).

#include <sys/types.h>

#include <chrono>
#include <map>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "Sorvik/platform/mutex.h"

namespace sorvik::testing {

class HostSession {
 public:
  // Starts `hostProgram` with -C workdir, the extra arguments and the library.
  HostSession(const std::string& hostProgram, const std::string& library, const std::string& workdir,
              const std::vector<std::string>& extraArgs, const std::map<std::string, std::string>& env);
  // Kills the host if it still runs.
  ~HostSession();
  HostSession(const HostSession&) = delete;
  HostSession& operator=(const HostSession&) = delete;

  bool started() const { return pid_ > 0; }
  void send(const std::string& line);
  // Waits until the output from `from` on matches; fills the first capture
  // group and the offset just past the match when asked. False on timeout
  // or when the host ended first.
  bool waitFor(const std::string& regex, std::chrono::milliseconds timeout, std::string* group = nullptr,
               size_t from = 0, size_t* matchEnd = nullptr);
  // Closes the host's input, waits for its exit (killing it after
  // `timeout`) and returns its exit code, or -1 when it had to be killed.
  int finish(std::chrono::milliseconds timeout);
  std::string output() const;

 private:
  void readLoop(int fd);

  pid_t pid_ = -1;
  int stdinFd_ = -1;
  std::thread reader_;
  mutable Mutex mu_;
  CondVar changed_{&mu_};
  std::string output_ GUARDED_BY(mu_);
  bool ended_ GUARDED_BY(mu_) = false;
};

}  // namespace sorvik::testing
