#pragma once

// Turning a child's argument list into what CreateProcess takes: one
// command line that the child's C runtime splits back into the same
// arguments, the program's path, and an environment block.

#include <string>
#include <vector>

namespace sorvik::host {

// `arg` quoted so that CommandLineToArgv and the C runtime read it back
// unchanged (backslashes are literal except before a double quote).
std::string quoteWindowsArgument(const std::string& arg);

// The quoted arguments joined with single spaces.
std::string windowsCommandLine(const std::vector<std::string>& args);

// The program a child runs, as a path: "./kelp" and "scripts/update.ps1" are
// taken relative to `directory`; a program without an extension that does
// not exist as named gets ".exe". A bare name ("curl") is looked up in
// `directory` and then left to CreateProcess's own search. Returns 0 or an
// errno value when there is nothing to run.
int resolveWindowsProgram(const std::string& program, const std::string& directory, std::string* path);

// The interpreter's arguments before the script path: PowerShell gets
// what runs a script file non-interactively; other interpreters nothing.
std::vector<std::string> ps1InterpreterArguments(const std::string& interpreter);

// The current environment with `extra` "NAME=value" entries set (names
// compare without case, as Windows does), as a double-NUL-terminated block.
std::string windowsEnvironmentBlock(const std::vector<std::string>& extra);

}  // namespace sorvik::host
