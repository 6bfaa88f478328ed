#pragma once

// Runs the development host as a child process with a script, for
// end-to-end tests: everything it prints is collected, and a run that
// outlives its limit is killed and reported as timed out.

#include <chrono>
#include <map>
#include <string>
#include <vector>

namespace sorvik::testing {

struct HostRunResult {
  int exitCode = -1;  // the host's exit code, or -1 when killed
  bool timedOut = false;
  std::string output;  // stdout and stderr, interleaved as written

  bool contains(const std::string& text) const { return output.find(text) != std::string::npos; }
  size_t count(const std::string& text) const;
  // Offset of the first occurrence of `text` at or after `from`, or npos.
  size_t find(const std::string& text, size_t from = 0) const { return output.find(text, from); }
};

struct HostRunOptions {
  std::string hostProgram;                 // path of sorvik-host
  std::string library;                     // plug-in library path as given to the host
  std::string workdir;                     // the host's working directory
  std::string script;                      // instruction text, written to a file
  std::vector<std::string> extraArgs;      // before the library argument
  std::map<std::string, std::string> env;  // added to the host's environment
  std::chrono::seconds limit{60};
};

HostRunResult runHost(const HostRunOptions& options);

// A fresh directory under the system temp directory, removed by the caller.
std::string makeTempDir(const std::string& prefix);

}  // namespace sorvik::testing
