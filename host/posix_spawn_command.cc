#include "host/posix_spawn_command.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>

extern char** environ;

namespace sorvik::host {
namespace {

std::string joinPath(const std::string& dir, const std::string& name) {
  if (dir.empty() || (!name.empty() && name[0] == '/')) return name;
  return dir.back() == '/' ? dir + name : dir + "/" + name;
}

// Spawn file actions change directory before the exec, so the paths handed
// to it must not depend on the directory.
std::string absolutePath(const std::string& path) {
  if (!path.empty() && path[0] == '/') return path;
  char cwd[4096];
  if (::getcwd(cwd, sizeof(cwd)) == nullptr) return path;
  return joinPath(cwd, path);
}

std::vector<std::string> childEnvironment(const std::vector<std::string>& extra) {
  std::vector<std::string> env;
  for (char** e = environ; e != nullptr && *e != nullptr; ++e) {
    const std::string entry(*e);
    const std::string name = entry.substr(0, entry.find('='));
    bool replaced = false;
    for (const std::string& x : extra) replaced = replaced || x.compare(0, name.size() + 1, name + "=") == 0;
    if (!replaced) env.push_back(entry);
  }
  env.insert(env.end(), extra.begin(), extra.end());
  return env;
}

std::vector<char*> pointersTo(std::vector<std::string>& texts) {
  std::vector<char*> pointers;
  for (std::string& t : texts) pointers.push_back(&t[0]);
  pointers.push_back(nullptr);
  return pointers;
}

void closePair(int fds[2]) {
  for (int i = 0; i < 2; ++i) {
    if (fds[i] >= 0) ::close(fds[i]);
    fds[i] = -1;
  }
}

// Owns the spawn attributes, file actions and pipes until the start is done.
class SpawnSetup {
 public:
  SpawnSetup() {
    ::posix_spawn_file_actions_init(&actions_);
    ::posix_spawnattr_init(&attr_);
  }
  ~SpawnSetup() {
    ::posix_spawn_file_actions_destroy(&actions_);
    ::posix_spawnattr_destroy(&attr_);
    for (auto& p : pipes_) closePair(p);
  }
  SpawnSetup(const SpawnSetup&) = delete;
  SpawnSetup& operator=(const SpawnSetup&) = delete;

  int prepare(const SpawnCommand& command) {
    // The child starts with every signal at its default and none blocked:
    // the host ignores SIGPIPE, and children must not inherit that.
    sigset_t none;
    sigset_t all;
    sigemptyset(&none);
    sigfillset(&all);
    int rc = ::posix_spawnattr_setsigmask(&attr_, &none);
    if (rc == 0) rc = ::posix_spawnattr_setsigdefault(&attr_, &all);
    // A process group of its own: a Ctrl-C at the host's terminal is for the
    // host, which then closes the plug-in in order.
    if (rc == 0) rc = ::posix_spawnattr_setpgroup(&attr_, 0);
    if (rc == 0) {
      rc = ::posix_spawnattr_setflags(&attr_, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETPGROUP);
    }
    if (rc != 0) return rc;
    if (command.piped) {
      for (auto& p : pipes_) {
        if (::pipe2(p, O_CLOEXEC) != 0) return errno;
      }
      rc = ::posix_spawn_file_actions_adddup2(&actions_, pipes_[0][0], 0);
      if (rc == 0) rc = ::posix_spawn_file_actions_adddup2(&actions_, pipes_[1][1], 1);
      if (rc == 0) rc = ::posix_spawn_file_actions_adddup2(&actions_, pipes_[2][1], 2);
    } else {
      rc = ::posix_spawn_file_actions_addopen(&actions_, 0, "/dev/null", O_RDONLY, 0);
      if (rc == 0 && !command.inheritOutput) {
        rc = ::posix_spawn_file_actions_addopen(&actions_, 1, "/dev/null", O_WRONLY, 0);
        if (rc == 0) rc = ::posix_spawn_file_actions_adddup2(&actions_, 1, 2);
      }
    }
    if (rc != 0) return rc;
    if (!command.workingDir.empty()) rc = ::posix_spawn_file_actions_addchdir_np(&actions_, command.workingDir.c_str());
    if (rc == 0 && !command.childDir.empty()) {
      rc = ::posix_spawn_file_actions_addchdir_np(&actions_, command.childDir.c_str());
    }
    // Descriptors the plug-in or a library opened without CLOEXEC stay home.
    if (rc == 0) rc = ::posix_spawn_file_actions_addclosefrom_np(&actions_, 3);
    return rc;
  }

  int spawn(const std::string& path, std::vector<std::string> args, std::vector<std::string> env,
            SpawnedProcess* process) {
    std::vector<char*> argv = pointersTo(args);
    std::vector<char*> envp = pointersTo(env);
    pid_t pid = -1;
    const int rc = ::posix_spawn(&pid, path.c_str(), &actions_, &attr_, argv.data(), envp.data());
    if (rc != 0) return rc;
    process->pid = pid;
    if (pipes_[0][1] >= 0) {
      process->stdinFd = takeEnd(0, 1);
      process->stdoutFd = takeEnd(1, 0);
      process->stderrFd = takeEnd(2, 0);
      for (int fd : {process->stdinFd, process->stdoutFd, process->stderrFd}) {
        ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) | O_NONBLOCK);
      }
    }
    return 0;
  }

 private:
  int takeEnd(int pipe, int end) {
    const int fd = pipes_[pipe][end];
    pipes_[pipe][end] = -1;
    return fd;
  }

  posix_spawn_file_actions_t actions_;
  posix_spawnattr_t attr_;
  int pipes_[3][2] = {{-1, -1}, {-1, -1}, {-1, -1}};  // stdin, stdout, stderr
};

}  // namespace

int resolveProgram(const std::string& program, const std::string& workingDir, std::string* path) {
  if (program.empty()) return ENOENT;
  if (program.find('/') != std::string::npos) {
    *path = joinPath(workingDir, program);
    return 0;
  }
  const std::string local = joinPath(workingDir.empty() ? "." : workingDir, program);
  if (::access(local.c_str(), F_OK) == 0) {
    *path = local;
    return 0;
  }
  const char* searchPath = std::getenv("PATH");
  const std::string dirs = searchPath != nullptr ? searchPath : "/usr/local/bin:/usr/bin:/bin";
  size_t begin = 0;
  while (begin <= dirs.size()) {
    size_t end = dirs.find(':', begin);
    if (end == std::string::npos) end = dirs.size();
    const std::string dir = dirs.substr(begin, end - begin);
    if (!dir.empty()) {
      const std::string candidate = joinPath(dir, program);
      if (::access(candidate.c_str(), X_OK) == 0) {
        *path = candidate;
        return 0;
      }
    }
    begin = end + 1;
  }
  return ENOENT;
}

bool isPs1Script(const std::string& program) {
  return program.size() > 4 && program.compare(program.size() - 4, 4, ".ps1") == 0;
}

int spawnProcess(const SpawnCommand& command, SpawnedProcess* process) {
  if (command.args.empty()) return EINVAL;
  std::string program;
  int rc = resolveProgram(command.args[0], command.workingDir, &program);
  if (rc != 0) return rc;
  program = absolutePath(program);
  std::vector<std::string> args = command.args;
  std::string path = program;
  if (isPs1Script(command.args[0])) {
    rc = resolveProgram(command.ps1Interpreter, command.workingDir, &path);
    if (rc != 0) return rc;
    path = absolutePath(path);
    // A missing script must read as ENOENT, not as the interpreter's exit.
    if (::access(program.c_str(), F_OK) != 0) return errno;
    args[0] = program;
    args.insert(args.begin(), command.ps1Interpreter);
  }
  SpawnSetup setup;
  rc = setup.prepare(command);
  if (rc != 0) return rc;
  return setup.spawn(path, std::move(args), childEnvironment(command.extraEnvironment), process);
}

}  // namespace sorvik::host
