#pragma once

// Starting one child process on POSIX: program lookup, the .ps1
// interpreter, pipes or /dev/null for the standard streams, and a clean
// descriptor table and signal state in the child.

#include <sys/types.h>

#include <string>
#include <vector>

namespace sorvik::host {

struct SpawnCommand {
  std::vector<std::string> args;  // args[0] is the program as requested
  std::string workingDir;         // empty: the current directory
  std::string childDir;           // extra directory to enter, relative to workingDir
  std::string ps1Interpreter;
  bool piped = false;
  bool inheritOutput = true;
  std::vector<std::string> extraEnvironment;
};

struct SpawnedProcess {
  pid_t pid = -1;
  int stdinFd = -1;   // non-blocking write end, -1 without pipes
  int stdoutFd = -1;  // non-blocking read ends, -1 without pipes
  int stderrFd = -1;
};

// Resolves the program a child runs: a name with a slash is taken relative
// to `workingDir`; a bare name is looked up in `workingDir` first and then
// in PATH. Returns 0 or the errno that describes why there is nothing to run.
int resolveProgram(const std::string& program, const std::string& workingDir, std::string* path);

// True for a program run through the configured .ps1 interpreter.
bool isPs1Script(const std::string& program);

// Starts the child; returns 0 or the errno of the failed start (the exec's
// own errno when the program cannot be executed).
int spawnProcess(const SpawnCommand& command, SpawnedProcess* process);

}  // namespace sorvik::host
