#pragma once

// Last step of an update: run the installation script on the bundle and
// turn its end into an update status.

#include <string>

namespace sorvik {

class UpdateService;

// Has the host run scripts/update.ps1 with `bundlePath`, marks the update as
// pending in the persisted state and waits up to the service's Timeout.
// Never reports success: that is seen only after the module restarts.
void InstallBundle(UpdateService& service, const std::string& bundlePath);

}  // namespace sorvik
