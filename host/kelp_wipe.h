#pragma once

// kelp -delete: empties the drives of a spare server. A directory is only
// emptied when it carries the marker file, so that a wrong drive list can
// never wipe a disk that was not prepared as a spare.

#include <string>
#include <vector>

namespace sorvik::kelp {

inline constexpr const char kSpareMarker[] = ".kelp-spare";

enum class WipeResult { Done = 0, RemoveFailed = 1, Refused = 3 };

// Checks every drive first (a directory that holds the marker as a regular
// file); when one fails the check nothing is touched. Then removes every
// entry but the marker, without following symbolic links. Problems are
// described in `report`, one line each.
WipeResult wipeDrives(const std::vector<std::string>& drives, std::string* report);

}  // namespace sorvik::kelp
