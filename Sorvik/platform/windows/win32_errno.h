#pragma once

#include <cstdint>

namespace sorvik::platform {

// The C library error number that the Windows C runtime sets for a failed
// file call with system error `win32Error`, so callers that print errno
// texts read the same on every platform. Unknown errors map to EIO; the
// result is never 0.
int errnoFromWin32Error(uint32_t win32Error);

}  // namespace sorvik::platform
