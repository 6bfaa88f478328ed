#include "host/kelp_options.h"

#include <cstdlib>
#include <ctime>

namespace sorvik::kelp {

bool parseUtcTimestamp(const std::string& text, int64_t* seconds) {
  std::tm utc{};
  const char* end = ::strptime(text.c_str(), "%Y-%m-%dT%H:%M:%SZ", &utc);
  if (end == nullptr || *end != '\0') return false;
  *seconds = static_cast<int64_t>(::timegm(&utc));
  return true;
}

std::vector<std::string> splitDriveList(const std::string& list) {
  std::vector<std::string> drives;
  std::string name;
  for (size_t i = 0; i <= list.size(); ++i) {
    if (i == list.size() || list[i] == ',') {
      if (!name.empty()) drives.push_back(name);
      name.clear();
      continue;
    }
    if (list[i] == '\\') {
      // A run of backslashes arrives doubled; keep half of it.
      size_t run = 0;
      while (i + run < list.size() && list[i + run] == '\\') ++run;
      name.append((run + 1) / 2, '\\');
      i += run - 1;
      continue;
    }
    name += list[i];
  }
  return drives;
}

bool parseOptions(const std::vector<std::string>& args, Options* options, std::string* error) {
  Options result;
  bool hasStart = false;
  bool hasEnd = false;
  bool hasDrives = false;
  for (size_t i = 0; i < args.size(); ++i) {
    const std::string& arg = args[i];
    auto value = [&](std::string* out) {
      if (i + 1 >= args.size()) {
        *error = arg + " needs a value";
        return false;
      }
      *out = args[++i];
      return true;
    };
    std::string text;
    if (arg == "-x") {
      continue;  // set by the plug-in; no effect here
    } else if (arg == "-delete") {
      result.deleteMode = true;
    } else if (arg == "-start" || arg == "-end") {
      if (!value(&text)) return false;
      int64_t& slot = arg == "-start" ? result.start : result.end;
      if (!parseUtcTimestamp(text, &slot)) {
        *error = "bad time for " + arg + ": '" + text + "' (expected YYYY-MM-DDTHH:MM:SSZ)";
        return false;
      }
      (arg == "-start" ? hasStart : hasEnd) = true;
    } else if (arg == "-drives") {
      if (!value(&text)) return false;
      result.drives = splitDriveList(text);
      hasDrives = true;
    } else if (arg == "-port") {
      if (!value(&text)) return false;
      char* end = nullptr;
      const long port = std::strtol(text.c_str(), &end, 10);
      // A port that cannot be used falls back to a free one, like a taken one.
      result.port = (text.empty() || *end != '\0' || port < 0 || port > 65535) ? 0 : static_cast<int>(port);
    } else {
      *error = "unknown argument '" + arg + "'";
      return false;
    }
  }
  if (!hasDrives || result.drives.empty()) {
    *error = "no drives given (-drives LIST)";
    return false;
  }
  result.hasPeriod = hasStart && hasEnd;
  if (!result.deleteMode) {
    if (!result.hasPeriod) {
      *error = "the failover period needs -start and -end";
      return false;
    }
    if (result.start > result.end) {
      *error = "the failover period ends before it starts";
      return false;
    }
  }
  *options = result;
  return true;
}

}  // namespace sorvik::kelp
