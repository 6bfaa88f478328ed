#include "host/windows_command_line.h"

#include <windows.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <map>

namespace sorvik::host {
namespace {

bool fileExists(const std::string& path) {
  const DWORD attributes = ::GetFileAttributesA(path.c_str());
  return attributes != INVALID_FILE_ATTRIBUTES && (attributes & FILE_ATTRIBUTE_DIRECTORY) == 0;
}

bool hasExtension(const std::string& path) {
  const size_t dot = path.find_last_of('.');
  const size_t separator = path.find_last_of("/\\");
  return dot != std::string::npos && (separator == std::string::npos || dot > separator + 1);
}

std::string upper(std::string text) {
  std::transform(text.begin(), text.end(), text.begin(), [](unsigned char c) { return std::toupper(c); });
  return text;
}

std::string baseName(const std::string& path) {
  const size_t separator = path.find_last_of("/\\");
  return separator == std::string::npos ? path : path.substr(separator + 1);
}

}  // namespace

std::string quoteWindowsArgument(const std::string& arg) {
  if (!arg.empty() && arg.find_first_of(" \t\n\v\"") == std::string::npos) return arg;
  std::string quoted = "\"";
  size_t backslashes = 0;
  for (char c : arg) {
    if (c == '\\') {
      ++backslashes;
      continue;
    }
    // Backslashes count double only in front of a quote.
    quoted.append(c == '"' ? backslashes * 2 + 1 : backslashes, '\\');
    backslashes = 0;
    quoted.push_back(c);
  }
  quoted.append(backslashes * 2, '\\');  // the closing quote follows
  quoted.push_back('"');
  return quoted;
}

std::string windowsCommandLine(const std::vector<std::string>& args) {
  std::string line;
  for (const std::string& arg : args) {
    if (!line.empty()) line.push_back(' ');
    line += quoteWindowsArgument(arg);
  }
  return line;
}

int resolveWindowsProgram(const std::string& program, const std::string& directory, std::string* path) {
  if (program.empty()) return ENOENT;
  const bool absolute = program.size() > 1 && (program[1] == ':' || (program[0] == '\\' && program[1] == '\\'));
  const bool hasDirectory = program.find_first_of("/\\") != std::string::npos;
  std::string relative = program;
  std::replace(relative.begin(), relative.end(), '/', '\\');
  while (relative.rfind(".\\", 0) == 0) relative.erase(0, 2);
  std::string candidate = absolute ? relative : program;
  if (!absolute && (hasDirectory || !directory.empty())) {
    candidate = (directory.empty() ? std::string(".") : directory) + "\\" + relative;
  }
  std::replace(candidate.begin(), candidate.end(), '/', '\\');
  if (fileExists(candidate)) {
    *path = candidate;
    return 0;
  }
  if (!hasExtension(program) && fileExists(candidate + ".exe")) {
    *path = candidate + ".exe";
    return 0;
  }
  if (absolute || hasDirectory) return ENOENT;
  // A bare name: CreateProcess searches the system directories and PATH.
  *path = program;
  return 0;
}

std::vector<std::string> ps1InterpreterArguments(const std::string& interpreter) {
  const std::string name = upper(baseName(interpreter));
  if (name == "POWERSHELL.EXE" || name == "POWERSHELL" || name == "PWSH.EXE" || name == "PWSH") {
    return {"-NoProfile", "-NonInteractive", "-ExecutionPolicy", "Bypass", "-File"};
  }
  return {};
}

std::string windowsEnvironmentBlock(const std::vector<std::string>& extra) {
  // Keyed by the upper-case name; the value keeps the entry as written.
  std::map<std::string, std::string> entries;
  if (char* block = ::GetEnvironmentStringsA()) {
    for (const char* p = block; *p != '\0'; p += std::char_traits<char>::length(p) + 1) {
      const std::string entry = p;
      // Entries such as "=C:=C:\dir" (per-drive directories) start with '='.
      const size_t eq = entry.find('=', 1);
      entries[upper(entry.substr(0, eq))] = entry;
    }
    ::FreeEnvironmentStringsA(block);
  }
  for (const std::string& entry : extra) {
    const size_t eq = entry.find('=', 1);
    if (eq == std::string::npos) continue;
    entries[upper(entry.substr(0, eq))] = entry;
  }
  std::string result;
  for (const auto& [name, entry] : entries) {
    result += entry;
    result.push_back('\0');
  }
  result.push_back('\0');
  if (entries.empty()) result.push_back('\0');
  return result;
}

}  // namespace sorvik::host
