#include "Sorvik/service/install_log.h"

#include <fstream>

namespace sorvik {

std::vector<std::string> readInstallLogLines(const std::string& path) {
  std::vector<std::string> lines;
  std::ifstream in(path, std::ios::in | std::ios::binary);
  std::string line;
  while (in && std::getline(in, line)) {
    if (!line.empty() && line.back() == '\r') line.pop_back();
    lines.push_back(line);
  }
  return lines;
}

bool installLogReportsFailure(const std::string& path) {
  for (const std::string& line : readInstallLogLines(path)) {
    if (line.find("Update failed") != std::string::npos) return true;
  }
  return false;
}

}  // namespace sorvik
