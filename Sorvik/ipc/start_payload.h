#pragma once

// The payload of a StartRequest: optional leading texts chosen by flag bits
// 3 and 4, then the arguments, all joined by single NUL bytes (no NUL after
// the last argument).

#include <cstdint>
#include <string>

#include "Sorvik/ipc/client.h"

namespace ko::ipc {

std::string encodeStartPayload(const SpawnOptions& options);

// Inverse of encodeStartPayload for the flags it was built with; `options`
// gets flags, texts and args. False when a leading text the flags announce
// is missing.
bool decodeStartPayload(const std::string& payload, uint32_t flags, SpawnOptions* options);

}  // namespace ko::ipc
