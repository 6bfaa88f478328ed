#pragma once

// The directories a download writes into.

#include <string>

namespace sorvik {

inline constexpr const char kDataDirectory[] = "./data";

// Whether `directory` holds the server's own files: a filesystem root, the
// current directory or one of its ancestors (after resolving links). An
// empty text means the current directory. A directory that cannot be
// resolved is not protected; clearing it fails on its own.
bool isProtectedDirectory(const std::string& directory);

// Creates "./data" if it is missing (not its parents). True when it exists
// as a directory afterwards.
bool ensureDataDirectory();

// `directory` and `name` joined by the platform's separator, none added when
// the directory already ends with one.
std::string joinBundlePath(const std::string& directory, const std::string& name);

}  // namespace sorvik
