#pragma once

// Giving up this server's failover role: runs the decommission script
// through the host and records the outcome.

namespace sorvik {

class UpdateService;

// Worker thread only. Reports DECOMMISSION_PENDING, runs
// scripts/failover.ps1 and waits up to the service's Timeout. Any end of the
// script that is seen while the plug-in is open (start failure, exit, time
// limit) is reported as DECOMMISSION_ERROR; a close during the wait ends it
// silently with the pending failover kept in "update.xml".
void Decommission(UpdateService& service);

}  // namespace sorvik
