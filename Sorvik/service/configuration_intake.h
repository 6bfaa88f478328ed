#pragma once

// Intake of the host's configuration document: network storage, the storage
// drive list and the failover state machine. The entry point is
// UpdateService::processConfiguration.

#include <cstdint>
#include <string>

class TiXmlElement;

namespace sorvik {

enum ConfigAction : int32_t {
  config_refuse = 0,
  config_decommission = 1,
  config_transition = 2,
};

// What a request to move from `current` to `requested` leads to. Equal
// states are handled before the table is consulted and are refused here.
ConfigAction lookupTransition(int32_t current, int32_t requested, bool hasFailover);

// Fills `drives` from `storage` and its following Storage siblings: enabled
// drive names, de-duplicated, sorted byte-wise, joined with ",", and every
// run of backslashes doubled. False (drives untouched) when a Storage element
// has an ID other than 327680 or the text cannot be built.
bool parseStorageDrives(const TiXmlElement* storage, std::string& drives);

}  // namespace sorvik
