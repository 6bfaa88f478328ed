#pragma once

// Second step of an update: compare the bundle's MD5 digest with the
// checksum the update request carried.

#include <string>

namespace sorvik {

class UpdateService;

// True when the MD5 of the file at `bundlePath`, as lower-case hex, equals
// `checksum` (compared case-insensitively). Any refusal is reported as
// CHECKSUM_FAILED.
bool VerifyBundleChecksum(UpdateService& service, const std::string& bundlePath, const std::string& checksum);

}  // namespace sorvik
