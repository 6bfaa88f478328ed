#pragma once

// First step of an update: fetch the bundle named by a location URL into the
// download directory by having the host run curl.

#include <cstdint>
#include <string>

namespace sorvik {

class UpdateService;

// Runs the whole download on the calling (worker) thread. True exactly when
// curl ran and exited with 0; `bundlePath` is set as soon as the bundle's
// file name is known. Every failure has been reported as an update status.
bool DownloadBundle(UpdateService& service, const std::string& location, std::string& bundlePath);

// Removes every entry inside `directory`; the directory itself stays. Stops
// at the first error and logs it. Refuses (false, nothing removed) a
// filesystem root, the current directory or one of its ancestors.
bool clearDownloadDir(const std::string& directory);

// StatusCode for a curl exit code.
int32_t mapCurlExitCode(int32_t exitCode);

// `text` in double quotes, each character of `escapeSet` preceded by a backslash.
std::string quoteEscaped(const std::string& text, const std::string& escapeSet);

}  // namespace sorvik
