#pragma once

// The one seam between Sorvik and the operating system. Everything that
// differs between POSIX and Windows (durable file replacement, process lookup
// and termination, platform names) goes through Platform; tests swap in a
// fake that wraps the real one and injects faults.

#include <cstdint>
#include <set>
#include <string>
#include <vector>

namespace sorvik::platform {

class Platform {
 public:
  virtual ~Platform() = default;

  // Creates or truncates `path`, unshared and write-through (durable once
  // this returns), and writes `bytes` in one call. Returns "" on success or
  // the error text of the state-file contract: "create error N",
  // "write error N", "close error N" or "only wrote X of Y bytes".
  virtual std::string writeFileThrough(const std::string& path, const std::string& bytes) = 0;

  // Renames `from` onto `to`, replacing it, and makes the rename durable.
  // Returns 0 or the C library's error number.
  virtual int replaceFile(const std::string& from, const std::string& to) = 0;

  // Removes a file; false when it could not be removed.
  virtual bool removeFile(const std::string& path) = 0;

  // Appends the ids of processes whose executable file name (no directory)
  // equals one of `names` byte for byte. False when the process table cannot
  // be walked.
  virtual bool findProcessesByName(const std::set<std::string>& names, std::vector<uint32_t>* ids) = 0;

  // Ends process `pid` with `exitCode` (on POSIX the code is the signal).
  // False for pid 0 or when the process cannot be ended.
  virtual bool terminateProcess(uint32_t pid, uint32_t exitCode) = 0;

  // Executable file name of the failback agent as the process table shows it.
  virtual std::string agentImageName() = 0;
};

// The platform in use: the real one unless a test installed another.
Platform& current();

// The real implementation for this operating system.
Platform& native();

// Installs `replacement` (nullptr restores the native one); returns the
// previous platform. For tests only; not thread-safe against concurrent use.
Platform* setForTesting(Platform* replacement);

// Package platform name of this build ("linux-x64", "windows-x64", ...).
const char* packageTypeName();

// Native path separator as text.
const char* pathSeparator();

}  // namespace sorvik::platform
