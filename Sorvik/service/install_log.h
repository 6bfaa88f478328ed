#pragma once

// The log the installation script leaves in "logs/update.log". It outlives
// the plug-in (the script restarts the host), so it is how the next start
// learns whether a pending update failed.

#include <string>
#include <vector>

namespace sorvik {

inline constexpr const char kInstallLogPath[] = "logs/update.log";

// The lines of the file (line feeds removed, and a carriage return before
// one); empty when it cannot be read.
std::vector<std::string> readInstallLogLines(const std::string& path = kInstallLogPath);

// True when some line contains "Update failed".
bool installLogReportsFailure(const std::string& path = kInstallLogPath);

}  // namespace sorvik
