#pragma once

#include <cstdarg>
#include <cstdint>

#include "Sorvik/plugin/host_records.h"
#include "Sorvik/plugin/module.h"

namespace ko::core {

// Asks the host for its threshold, then formats and sends one log line.
// Returns 0 when nothing was sent, else the callback's result.
int32_t hostLog(uint32_t moduleId, HostCallback callback, int32_t level, const char* format, ...)
    __attribute__((format(printf, 4, 5)));
int32_t hostLogV(uint32_t moduleId, HostCallback callback, int32_t level, const char* format, va_list args)
    __attribute__((format(printf, 4, 0)));

// The form every caller in the plug-in uses: this module, the installed callback.
void log(int32_t level, const char* format, ...) __attribute__((format(printf, 2, 3)));

}  // namespace ko::core
