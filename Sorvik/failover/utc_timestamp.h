#pragma once

#include <cstdint>
#include <string>

namespace sorvik {

// "YYYY-MM-DDTHH:MM:SSZ" for `seconds` since 1970-01-01 UTC. Valid for every
// 32-bit value, negative ones included (1901-12-13T20:45:52Z to
// 2038-01-19T03:14:07Z); does not depend on the C library's gmtime.
std::string format_utc_timestamp(int32_t seconds);

}  // namespace sorvik
