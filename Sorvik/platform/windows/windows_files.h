#pragma once

#include <string>

namespace sorvik::platform::windows {

// The Win32 halves of Platform's durable save; see platform.h for the
// contracts. Error numbers in texts are GetLastError() values.
std::string writeFileThrough(const std::string& path, const std::string& bytes);
int replaceFile(const std::string& from, const std::string& to);
bool removeFile(const std::string& path);

}  // namespace sorvik::platform::windows
