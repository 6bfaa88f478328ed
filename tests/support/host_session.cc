#include "tests/support/host_session.h"

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>

namespace sorvik::testing {

HostSession::HostSession(const std::string& hostProgram, const std::string& library, const std::string& workdir,
                         const std::vector<std::string>& extraArgs, const std::map<std::string, std::string>& env) {
  std::vector<std::string> args = {hostProgram, "-C", workdir};
  args.insert(args.end(), extraArgs.begin(), extraArgs.end());
  args.push_back(library);
  int in[2], out[2];
  if (::pipe2(in, O_CLOEXEC) != 0) return;
  if (::pipe2(out, O_CLOEXEC) != 0) {
    ::close(in[0]);
    ::close(in[1]);
    return;
  }
  pid_ = ::fork();
  if (pid_ == 0) {
    ::dup2(in[0], 0);
    ::dup2(out[1], 1);
    ::dup2(out[1], 2);
    for (const auto& [key, value] : env) ::setenv(key.c_str(), value.c_str(), 1);
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    ::execv(argv[0], argv.data());
    ::_exit(127);
  }
  ::close(in[0]);
  ::close(out[1]);
  if (pid_ < 0) {
    ::close(in[1]);
    ::close(out[0]);
    return;
  }
  stdinFd_ = in[1];
  reader_ = std::thread([this, fd = out[0]] { readLoop(fd); });
}

HostSession::~HostSession() {
  if (pid_ > 0) finish(std::chrono::milliseconds(0));
}

void HostSession::readLoop(int fd) {
  char buf[16384];
  for (;;) {
    const ssize_t n = ::read(fd, buf, sizeof buf);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    MutexLock lock(&mu_);
    output_.append(buf, static_cast<size_t>(n));
    changed_.signalAll();
  }
  ::close(fd);
  MutexLock lock(&mu_);
  ended_ = true;
  changed_.signalAll();
}

void HostSession::send(const std::string& line) {
  if (stdinFd_ < 0) return;
  const std::string text = line + "\n";
  size_t done = 0;
  while (done < text.size()) {
    const ssize_t n = ::write(stdinFd_, text.data() + done, text.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;
    done += static_cast<size_t>(n);
  }
}

bool HostSession::waitFor(const std::string& regex, std::chrono::milliseconds timeout, std::string* group,
                          size_t from, size_t* matchEnd) {
  const std::regex pattern(regex);
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  MutexLock lock(&mu_);
  for (;;) {
    std::smatch match;
    const std::string tail = from < output_.size() ? output_.substr(from) : std::string();
    if (std::regex_search(tail, match, pattern)) {
      if (group != nullptr && match.size() > 1) *group = match[1].str();
      if (matchEnd != nullptr) *matchEnd = from + static_cast<size_t>(match.position(0) + match.length(0));
      return true;
    }
    if (ended_) return false;
    if (!changed_.waitUntil(deadline)) return false;
  }
}

int HostSession::finish(std::chrono::milliseconds timeout) {
  if (stdinFd_ >= 0) {
    ::close(stdinFd_);
    stdinFd_ = -1;
  }
  if (pid_ <= 0) return -1;
  bool ended = false;
  {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    MutexLock lock(&mu_);
    while (!ended_ && changed_.waitUntil(deadline)) {
    }
    ended = ended_;
  }
  // Its output closes as it exits; only a host that is still talking is killed.
  const bool killed = !ended;
  if (killed) ::kill(pid_, SIGKILL);
  int status = 0;
  while (::waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
  }
  pid_ = -1;
  if (reader_.joinable()) reader_.join();
  if (killed || !WIFEXITED(status)) return -1;
  return WEXITSTATUS(status);
}

std::string HostSession::output() const {
  MutexLock lock(&mu_);
  return output_;
}

}  // namespace sorvik::testing
