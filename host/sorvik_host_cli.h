#pragma once

// What the POSIX and the Windows sorvik-host share around main(): the
// command line, the exit codes and the loop that feeds instructions to the
// script runner. The platform's main() owns everything OS-specific (signals
// or console events, how lines are read).

#include <chrono>
#include <cstdint>
#include <functional>
#include <string>

#include "host/sorvik_host_display.h"
#include "host/sorvik_host_script.h"
#include "host/sorvik_host_session.h"

namespace sorvik::host {

inline constexpr int kExitOk = 0;
inline constexpr int kExitScriptFailed = 1;
inline constexpr int kExitUsage = 2;
inline constexpr int kExitStartFailed = 3;

struct Options {
  std::string library;
  std::string workdir;
  std::string script;
  int32_t logLevel = 25;
  double waitSeconds = 30;
  std::string ps1Interpreter;  // the platform's default is set before parsing
  bool inheritChildOutput = true;
};

// `usage` is a printf format whose one %s receives the instruction list.
// Returns 0 to run, otherwise the exit code (help shown, or an error printed).
int parseOptions(int argc, char** argv, const char* usage, Options* options, bool* helpShown);

// The session the command line asks for. `library` and `workingDir` are
// absolute; children learn the host's id from SORVIK_HOST_PID.
SessionOptions sessionOptionsFor(const Options& options, const std::string& library, const std::string& workingDir,
                                 unsigned long hostPid);

// The default time limit of the wait instruction.
inline std::chrono::milliseconds waitLimit(const Options& options) {
  return std::chrono::milliseconds(static_cast<int64_t>(options.waitSeconds * 1000));
}

// Feeds lines from `nextLine` (false: end of input or a stop) to `runner`
// until quit. Reading a script, the first failing instruction ends the loop
// with kExitScriptFailed, named by `where` and its line number; at the
// prompt it is only reported.
int runInstructions(ScriptRunner& runner, Display& display, const std::function<bool(std::string*)>& nextLine,
                    bool interactive, const std::string& where);

}  // namespace sorvik::host
