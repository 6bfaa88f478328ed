#pragma once

#include <cstdint>

namespace ko::core {

inline constexpr uint32_t kModuleId = 0x380000;  // 3670016
inline constexpr const char kModuleName[] = "Sorvik";

// Message targets and types of the host contract.
inline constexpr uint32_t kTargetStatus = 4;
inline constexpr uint32_t kTargetLog = 64;
inline constexpr uint32_t kTargetState = 256;
inline constexpr uint32_t kTargetChildProcess = 8192;

inline constexpr uint32_t kTypeLogLevelQuery = 0x1000001;
inline constexpr uint32_t kTypeLogLine = 0x1000002;
inline constexpr uint32_t kTypeXmlDocument = 0x1000010;
inline constexpr uint32_t kTypeChildProcessPacket = 0;

// Log levels.
inline constexpr int32_t kLogDetail = 0;
inline constexpr int32_t kLogProgress = 25;
inline constexpr int32_t kLogStepFailed = 50;
inline constexpr int32_t kLogRejected = 75;
inline constexpr int32_t kLogInternal = 100;

}  // namespace ko::core
