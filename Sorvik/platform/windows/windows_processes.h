#pragma once

#include <cstdint>
#include <set>
#include <string>
#include <vector>

namespace sorvik::platform::windows {

// The Win32 halves of Platform's process lookup and termination; see
// platform.h for the contracts.
bool findProcessesByName(const std::set<std::string>& names, std::vector<uint32_t>* ids);
bool terminateProcess(uint32_t pid, uint32_t exitCode);

}  // namespace sorvik::platform::windows
