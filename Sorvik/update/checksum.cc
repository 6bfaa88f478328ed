#include "Sorvik/update/checksum.h"

#include <locale>

#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/service/update_service.h"
#include "Sorvik/update/file_digest.h"

namespace sorvik {
namespace {

// Lower-cased as the process's global locale classifies characters; nothing
// else (no trimming), so a stray blank still fails the comparison.
std::string normalisedChecksum(std::string checksum) {
  const auto& ctype = std::use_facet<std::ctype<char>>(std::locale());
  ctype.tolower(checksum.data(), checksum.data() + checksum.size());
  return checksum;
}

}  // namespace

bool VerifyBundleChecksum(UpdateService& service, const std::string& bundlePath, const std::string& checksum) {
  using namespace ko::core;
  const FileDigest digest = md5OfFile(bundlePath);
  switch (digest.outcome) {
    case FileDigest::Outcome::Ok:
      break;
    case FileDigest::Outcome::MappingFailed:
      log(kLogRejected, "Unable to map file (%s) for checksum. Error: %s", bundlePath.c_str(), digest.error.c_str());
      service.emitUpdateStatus(CHECKSUM_FAILED);
      return false;
    case FileDigest::Outcome::NoData:
      log(kLogRejected, "Unable to map file (%s) for checksum.", bundlePath.c_str());
      service.emitUpdateStatus(CHECKSUM_FAILED);
      return false;
    case FileDigest::Outcome::Failed:
      // A checksum was asked for; installing an unverified bundle would defeat it.
      log(kLogRejected, "Unable to get the checksum of the file (%s). Update refused.", digest.error.c_str());
      service.emitUpdateStatus(CHECKSUM_FAILED);
      return false;
  }

  const std::string expected = normalisedChecksum(checksum);
  if (digest.hex == expected) {
    log(kLogProgress, "Received checksum (%s).", digest.hex.c_str());
    return true;
  }
  log(kLogRejected, "Invalid checksum, received (%s) expected (%s).", expected.c_str(), digest.hex.c_str());
  service.emitUpdateStatus(CHECKSUM_FAILED);
  return false;
}

}  // namespace sorvik
