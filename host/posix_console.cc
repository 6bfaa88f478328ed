#include "host/posix_console.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace sorvik::host {
namespace {

int g_signalWrite = -1;
int g_signalRead = -1;

extern "C" void onSignal(int signo) {
  const int saved = errno;
  const unsigned char byte = static_cast<unsigned char>(signo);
  // Non-blocking: a full pipe already holds enough wake-ups.
  if (::write(g_signalWrite, &byte, 1) < 0) {
  }
  errno = saved;
}

// Waits until `fd` or `stopFd` is readable; false when stopped.
bool waitReadable(int fd, int stopFd) {
  while (true) {
    pollfd fds[2] = {{fd, POLLIN, 0}, {stopFd, POLLIN, 0}};
    const int n = ::poll(fds, stopFd >= 0 ? 2 : 1, -1);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return false;
    if (stopFd >= 0 && fds[1].revents != 0) return false;
    if (fds[0].revents != 0) return true;
  }
}

}  // namespace

bool SignalPipe::install(std::string* error) {
  int fds[2];
  if (::pipe2(fds, O_CLOEXEC | O_NONBLOCK) != 0) {
    *error = std::string("cannot create signal pipe: ") + std::strerror(errno);
    return false;
  }
  g_signalRead = fds[0];
  g_signalWrite = fds[1];
  struct sigaction action;
  std::memset(&action, 0, sizeof(action));
  action.sa_handler = onSignal;
  sigemptyset(&action.sa_mask);
  action.sa_flags = SA_RESTART;
  for (int signo : {SIGHUP, SIGINT, SIGTERM}) {
    if (::sigaction(signo, &action, nullptr) != 0) {
      *error = std::string("cannot install signal handler: ") + std::strerror(errno);
      return false;
    }
  }
  return true;
}

int SignalPipe::next(int stopFd) {
  while (waitReadable(g_signalRead, stopFd)) {
    unsigned char byte = 0;
    const ssize_t n = ::read(g_signalRead, &byte, 1);
    if (n == 1) return byte;
  }
  return 0;
}

ReadResult LineReader::next(std::string* line) {
  while (true) {
    const size_t newline = buffer_.find('\n');
    if (newline != std::string::npos) {
      *line = buffer_.substr(0, newline);
      buffer_.erase(0, newline + 1);
      return ReadResult::Line;
    }
    if (eof_) {
      if (buffer_.empty()) return ReadResult::EndOfInput;
      line->swap(buffer_);
      buffer_.clear();
      return ReadResult::Line;
    }
    if (!waitReadable(fd_, stopFd_)) return ReadResult::Interrupted;
    char chunk[4096];
    const ssize_t n = ::read(fd_, chunk, sizeof(chunk));
    if (n < 0 && (errno == EINTR || errno == EAGAIN)) continue;
    if (n <= 0) {
      eof_ = true;
      continue;
    }
    buffer_.append(chunk, static_cast<size_t>(n));
  }
}

StopPipe::StopPipe() {
  if (::pipe2(fds_, O_CLOEXEC | O_NONBLOCK) != 0) fds_[0] = fds_[1] = -1;
}

StopPipe::~StopPipe() {
  for (int fd : fds_) {
    if (fd >= 0) ::close(fd);
  }
}

void StopPipe::raise() {
  const char byte = 1;
  if (fds_[1] >= 0 && ::write(fds_[1], &byte, 1) < 0) {
  }
}

bool isTerminal(int fd) { return ::isatty(fd) == 1; }

}  // namespace sorvik::host
