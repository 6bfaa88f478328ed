#pragma once

// Finding and ending failback agent processes through the platform seam.

#include <cstdint>
#include <set>
#include <string>
#include <vector>

namespace sorvik {

// Ends process `pid` with `code`. False for pid 0 or when it cannot be ended.
bool terminate_process(uint32_t pid, uint32_t code);

// Appends the ids of processes whose executable file name equals one of
// `names` (exact, case-sensitive). False when the process table cannot be read.
bool find_processes_by_name(const std::set<std::string>& names, std::vector<uint32_t>& ids);

}  // namespace sorvik
