#pragma once

#include <cstdint>

#include "Sorvik/plugin/host_records.h"

namespace ko::core {

// The process-wide callback slot. Written by Load and Unload only, read by
// every sender on any thread.
HostCallback hostCallback();
void setHostCallback(HostCallback callback);

// Passes a message to the host callback; 0 when no callback is installed.
int32_t callHost(HostMessage& message);

}  // namespace ko::core
