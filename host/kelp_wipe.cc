#include "host/kelp_wipe.h"

#include <filesystem>
#include <system_error>

namespace sorvik::kelp {
namespace fs = std::filesystem;

namespace {

bool checkDrive(const std::string& drive, std::string* report) {
  std::error_code ec;
  const fs::path canonical = fs::canonical(drive, ec);
  if (ec || !fs::is_directory(canonical, ec)) {
    *report += "refusing " + drive + ": not a directory\n";
    return false;
  }
  if (canonical == canonical.root_path()) {
    *report += "refusing " + drive + ": a file system root\n";
    return false;
  }
  const fs::file_status marker = fs::symlink_status(canonical / kSpareMarker, ec);
  if (ec || !fs::is_regular_file(marker)) {
    *report += "refusing " + drive + ": no " + kSpareMarker + " marker file\n";
    return false;
  }
  return true;
}

}  // namespace

WipeResult wipeDrives(const std::vector<std::string>& drives, std::string* report) {
  bool allMarked = !drives.empty();
  for (const std::string& drive : drives) allMarked = checkDrive(drive, report) && allMarked;
  if (!allMarked) return WipeResult::Refused;
  bool failed = false;
  for (const std::string& drive : drives) {
    std::error_code ec;
    const fs::path root = fs::canonical(drive, ec);
    // Listed first: removing while reading a directory may skip entries.
    std::vector<fs::path> entries;
    fs::directory_iterator it(root, ec);
    for (; !ec && it != fs::directory_iterator(); it.increment(ec)) {
      if (it->path().filename() != kSpareMarker) entries.push_back(it->path());
    }
    for (const fs::path& entry : entries) {
      std::error_code removeError;
      fs::remove_all(entry, removeError);
      if (removeError) {
        *report += "cannot remove " + entry.string() + ": " + removeError.message() + "\n";
        failed = true;
      }
    }
    if (ec) {
      *report += "cannot list " + drive + ": " + ec.message() + "\n";
      failed = true;
    }
  }
  return failed ? WipeResult::RemoveFailed : WipeResult::Done;
}

}  // namespace sorvik::kelp
