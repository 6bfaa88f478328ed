#include "Sorvik/update/download_dir.h"

#include <algorithm>
#include <boost/filesystem.hpp>
#include <vector>

#include "Sorvik/platform/platform.h"
#include "Sorvik/plugin/host_log.h"
#include "Sorvik/update/download.h"

namespace sorvik {

namespace fs = boost::filesystem;

bool isProtectedDirectory(const std::string& directory) {
  boost::system::error_code ec;
  const fs::path cwd = fs::canonical(fs::current_path(ec), ec);
  if (ec) return true;  // cannot tell what would be lost: assume the worst
  const fs::path target = fs::canonical(directory.empty() ? fs::path(".") : fs::path(directory), ec);
  if (ec) return false;
  if (target == target.root_path() || !target.has_relative_path()) return true;
  // An ancestor (or the directory itself) is a prefix of the current directory.
  auto t = target.begin();
  auto c = cwd.begin();
  for (; t != target.end() && c != cwd.end(); ++t, ++c) {
    if (*t != *c) return false;
  }
  return t == target.end();
}

bool clearDownloadDir(const std::string& directory) {
  if (isProtectedDirectory(directory)) {
    ko::core::log(ko::core::kLogRejected, "Refusing to clear download directory (%s): it holds the server's own files.",
                  directory.c_str());
    return false;
  }
  boost::system::error_code ec;
  std::vector<fs::path> entries;
  for (fs::directory_iterator it(directory, ec), end; !ec && it != end; it.increment(ec)) {
    entries.push_back(it->path());
  }
  for (const fs::path& entry : entries) {
    if (ec) break;
    // remove_all removes a link, never what it points to.
    fs::remove_all(entry, ec);
  }
  if (ec) ko::core::log(ko::core::kLogStepFailed, "Failed to clear download directory");
  return true;
}

bool ensureDataDirectory() {
  boost::system::error_code ec;
  fs::create_directory(kDataDirectory, ec);
  return !ec;
}

std::string joinBundlePath(const std::string& directory, const std::string& name) {
  const std::string separator = platform::pathSeparator();
  auto endsWith = [&directory](const std::string& suffix) {
    return directory.size() >= suffix.size() &&
           directory.compare(directory.size() - suffix.size(), suffix.size(), suffix) == 0;
  };
  const bool endsWithSeparator = !directory.empty() && (endsWith("/") || endsWith(separator));
  return endsWithSeparator ? directory + name : directory + separator + name;
}

}  // namespace sorvik
