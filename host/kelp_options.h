#pragma once

// Command line of the failback agent kelp.
//   kelp [-x] -start UTC -end UTC -drives LIST -port N    serve a listing
//   kelp [-x] -delete [-start UTC -end UTC] -drives LIST  empty spare drives

#include <cstdint>
#include <string>
#include <vector>

namespace sorvik::kelp {

struct Options {
  bool deleteMode = false;
  int64_t start = 0;  // seconds since 1970 UTC
  int64_t end = 0;
  bool hasPeriod = false;
  std::vector<std::string> drives;
  int port = 0;  // 0: any free port
};

// "YYYY-MM-DDTHH:MM:SSZ" to seconds since 1970 UTC.
bool parseUtcTimestamp(const std::string& text, int64_t* seconds);

// Drive names are separated by commas; the plug-in doubles every run of
// backslashes, which is undone here. Empty names are dropped.
std::vector<std::string> splitDriveList(const std::string& list);

// False with a message for the user when the command line is unusable.
bool parseOptions(const std::vector<std::string>& args, Options* options, std::string* error);

}  // namespace sorvik::kelp
