#pragma once

// The host program's POSIX console plumbing: signals turned into bytes on
// a pipe (the handler does nothing else), and line input that a quit
// request can interrupt.

#include <string>

namespace sorvik::host {

// Process-wide: SIGHUP, SIGINT and SIGTERM are delivered as bytes on one
// pipe. Install once, before any thread starts.
class SignalPipe {
 public:
  static bool install(std::string* error);
  // Blocks until a signal arrives or `stopFd` becomes readable; returns the
  // signal number, or 0 when stopped.
  static int next(int stopFd);
};

enum class ReadResult { Line, EndOfInput, Interrupted };

// Reads lines from `fd` without stdio so that `stopFd` can interrupt.
// Thread-compatible: used by the one input thread.
class LineReader {
 public:
  LineReader(int fd, int stopFd) : fd_(fd), stopFd_(stopFd) {}
  ReadResult next(std::string* line);

 private:
  const int fd_;
  const int stopFd_;
  std::string buffer_;
  bool eof_ = false;
};

// A pipe whose read end becomes readable once `raise` was called.
// Thread-safe: `raise` is one write(2), and the descriptors never change.
class StopPipe {
 public:
  StopPipe();
  ~StopPipe();
  StopPipe(const StopPipe&) = delete;
  StopPipe& operator=(const StopPipe&) = delete;
  int fd() const { return fds_[0]; }
  void raise();

 private:
  int fds_[2] = {-1, -1};
};

bool isTerminal(int fd);

}  // namespace sorvik::host
