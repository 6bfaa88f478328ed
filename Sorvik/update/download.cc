#include "Sorvik/update/download.h"

#include <boost/filesystem.hpp>
#include <memory>
#include <vector>

#include "Sorvik/ipc/client.h"
#include "Sorvik/platform/mutex.h"
#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/service/update_service.h"
#include "Sorvik/update/curl_command.h"
#include "Sorvik/update/download_dir.h"
#include "Sorvik/update/location.h"

namespace sorvik {
namespace {

using namespace ko::core;

bool caBundlePresent() {
  boost::system::error_code ec;
  return boost::filesystem::exists(boost::filesystem::symlink_status(kCaBundleFile, ec));
}

void reportProgress(UpdateService& service, uint32_t percent) {
  {
    MutexLock lock(&service.stateMutex);
    service.Progress = static_cast<int32_t>(percent);
  }
  service.emitUpdateStatus(BUNDLE_DOWNLOAD);
}

// Feeds curl its credentials, turns its progress meter into status reports and
// returns its exit code together with the last piece of its standard error.
int32_t runCurl(UpdateService& service, ko::ipc::client& curl, const std::string& configLine,
                std::string* lastPiece) {
  curl.write(configLine, ko::ipc::kStdinClose);
  std::string piece;
  while (curl.read_until(piece, 1, '\r')) {
    const uint32_t percent = progressPercent(piece);
    if (percent != 0) reportProgress(service, percent);
    lastPiece->swap(piece);
  }
  return curl.wait();
}

}  // namespace

bool DownloadBundle(UpdateService& service, const std::string& location, std::string& bundlePath) {
  // Logs show the location with its password masked; only curl's standard
  // input ever sees the password.
  const std::string shownLocation = redactLocation(location);
  log(kLogDetail, "Location string: %s", shownLocation.c_str());
  {
    MutexLock lock(&service.stateMutex);
    service.Progress = 0;
  }
  service.emitUpdateStatus(BUNDLE_DOWNLOAD);

  // A NUL would split the URL into several curl arguments in the start request.
  BundleLocation parsed;
  if (location.find('\0') != std::string::npos || !parseLocation(location, &parsed)) {
    log(kLogRejected, "Not a valid URL: %s", shownLocation.c_str());
    service.emitUpdateStatus(INVALID_URI_LOCATION);
    return false;
  }
  log(kLogDetail, "scheme(%s) user:pass(%s:%s) host(%s) path(%s)", parsed.scheme.c_str(),
      redactUser(parsed.user).c_str(), parsed.password.empty() ? "" : "***", parsed.host.c_str(),
      parsed.path.c_str());
  if (parsed.host.empty()) {
    log(kLogRejected, "No host name in URI.");
    service.emitUpdateStatus(INVALID_HOST_NAME);
    return false;
  }
  if (parsed.path.empty()) {
    log(kLogRejected, "No path in URI.");
    service.emitUpdateStatus(INVALID_PATH_URI);
    return false;
  }
  const std::string fileName = bundleFileName(parsed.path);
  if (fileName.empty()) {
    log(kLogRejected, "Could not parse a filename, ignore request.");
    service.emitUpdateStatus(NO_BUNDLE_NAME);
    return false;
  }
  if (!isPlainFileName(fileName)) {
    log(kLogRejected, "Bundle file name (%s) is not a plain file name, ignore request.", fileName.c_str());
    service.emitUpdateStatus(NO_BUNDLE_NAME);
    return false;
  }

  const std::string downloadDir = service.downloadDir();
  if (!clearDownloadDir(downloadDir)) {
    service.emitUpdateStatus(DOWNLOAD_FILE_IO_ERROR);
    return false;
  }
  bundlePath = joinBundlePath(downloadDir, fileName);
  const std::string configLine = curlConfigLine(parsed.user, parsed.password);

  if (!ensureDataDirectory()) {
    log(kLogStepFailed, "Unable to create data directory.");
    // Left at BUNDLE_DOWNLOAD the module would refuse every later command.
    service.emitUpdateStatus(DOWNLOAD_FILE_IO_ERROR);
    return false;
  }

  const std::vector<std::string> args =
      curlArguments(bundlePath, parsed.host, trustedUpdateDomain(), caBundlePresent());
  log(kLogProgress, "Downloading %s", shownLocation.c_str());
  log(kLogProgress, "Writing %s", bundlePath.c_str());

  const std::shared_ptr<ko::ipc::client> curl = ko::ipc::spawn(args, locationWithoutCredentials(location, parsed));
  if (curl->state() == ko::ipc::ClientState::Failed) {
    service.emitUpdateStatus(DOWNLOAD_ERROR);
    log(kLogRejected, "Download failed (failed to locate or execute curl).");
    return false;
  }

  std::string lastPiece;
  const int32_t exitCode = runCurl(service, *curl, configLine, &lastPiece);
  if (exitCode == 0) {
    log(kLogProgress, "Download succeeded.");
    return true;
  }
  service.emitUpdateStatus(mapCurlExitCode(exitCode));
  log(kLogStepFailed, "Download failed (status %d): %s", exitCode, lastPiece.c_str());
  log(kLogStepFailed, "%s", commandLineText(args).c_str());
  return false;
}

}  // namespace sorvik
