#include "Sorvik/failover/agent_processes.h"

#include "Sorvik/platform/platform.h"

namespace sorvik {

bool terminate_process(uint32_t pid, uint32_t code) {
  if (pid == 0) return false;
  return platform::current().terminateProcess(pid, code);
}

bool find_processes_by_name(const std::set<std::string>& names, std::vector<uint32_t>& ids) {
  return platform::current().findProcessesByName(names, &ids);
}

}  // namespace sorvik
