#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <string>

#include "Sorvik/platform/platform.h"

namespace sorvik::platform {
namespace {

std::string parentDirectory(const std::string& path) {
  const auto slash = path.find_last_of('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

// A rename is durable only once the directory entry is on disk.
int syncDirectory(const std::string& dir) {
  const int fd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return errno;
  int err = 0;
  if (::fsync(fd) != 0) err = errno;
  ::close(fd);
  return err;
}

// Executable file name of a process: the target of /proc/<pid>/exe, or its
// short command name when the link cannot be read (another user's process).
bool processImageName(const std::string& pid, std::string* name) {
  char buf[4096];
  const std::string base = "/proc/" + pid;
  const ssize_t n = ::readlink((base + "/exe").c_str(), buf, sizeof(buf) - 1);
  if (n > 0) {
    std::string target(buf, static_cast<size_t>(n));
    const std::string deleted = " (deleted)";
    if (target.size() > deleted.size() &&
        target.compare(target.size() - deleted.size(), deleted.size(), deleted) == 0) {
      target.resize(target.size() - deleted.size());
    }
    *name = target.substr(target.find_last_of('/') + 1);
    return true;
  }
  const int fd = ::open((base + "/comm").c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  const ssize_t m = ::read(fd, buf, sizeof(buf) - 1);
  ::close(fd);
  if (m <= 0) return false;
  name->assign(buf, static_cast<size_t>(m));
  if (!name->empty() && name->back() == '\n') name->pop_back();
  return true;
}

class PosixPlatform final : public Platform {
 public:
  std::string writeFileThrough(const std::string& path, const std::string& bytes) override {
    const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) return "create error " + std::to_string(errno);
    std::string error;
    ssize_t written = 0;
    size_t done = 0;
    // POSIX write may be partial; keep going so "only wrote" means a real short write.
    while (done < bytes.size()) {
      written = ::write(fd, bytes.data() + done, bytes.size() - done);
      if (written < 0) {
        if (errno == EINTR) continue;
        error = "write error " + std::to_string(errno);
        break;
      }
      if (written == 0) break;
      done += static_cast<size_t>(written);
    }
    if (error.empty() && ::fsync(fd) != 0) error = "write error " + std::to_string(errno);
    if (::close(fd) != 0 && error.empty()) error = "close error " + std::to_string(errno);
    if (error.empty() && done < bytes.size()) {
      error = "only wrote " + std::to_string(done) + " of " + std::to_string(bytes.size()) + " bytes";
    }
    return error;
  }

  int replaceFile(const std::string& from, const std::string& to) override {
    if (::rename(from.c_str(), to.c_str()) != 0) return errno;
    return syncDirectory(parentDirectory(to));
  }

  bool removeFile(const std::string& path) override { return ::unlink(path.c_str()) == 0; }

  bool findProcessesByName(const std::set<std::string>& names, std::vector<uint32_t>* ids) override {
    DIR* proc = ::opendir("/proc");
    if (proc == nullptr) return false;
    while (const dirent* entry = ::readdir(proc)) {
      char* end = nullptr;
      const unsigned long pid = std::strtoul(entry->d_name, &end, 10);
      if (end == entry->d_name || *end != '\0' || pid == 0 || pid > UINT32_MAX) continue;
      std::string name;
      if (processImageName(entry->d_name, &name) && names.count(name) != 0) {
        ids->push_back(static_cast<uint32_t>(pid));
      }
    }
    ::closedir(proc);
    return true;
  }

  bool terminateProcess(uint32_t pid, uint32_t exitCode) override {
    if (pid == 0 || pid > static_cast<uint32_t>(INT32_MAX)) return false;
    return ::kill(static_cast<pid_t>(pid), static_cast<int>(exitCode)) == 0;
  }

  // SORVIK_AGENT_IMAGE_NAME lets a test run give its agent a name of its own,
  // so that stopping agents by name never reaches another run's agent.
  std::string agentImageName() override {
    const char* name = std::getenv("SORVIK_AGENT_IMAGE_NAME");
    return name != nullptr && *name != '\0' ? name : "kelp";
  }
};

}  // namespace

Platform& native() {
  static PosixPlatform instance;
  return instance;
}

const char* packageTypeName() {
#if defined(__x86_64__)
  return "linux-x64";
#elif defined(__aarch64__)
  return "linux-aarch64";
#elif defined(__arm__)
  return "linux-arm";
#else
  return "linux";
#endif
}

const char* pathSeparator() { return "/"; }

}  // namespace sorvik::platform
