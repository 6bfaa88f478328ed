#include "Sorvik/service/location_text.h"

#include "Sorvik/service/update_service.h"

namespace sorvik {

std::string locationForLog(const std::string& location) {
  const size_t schemeEnd = location.find("://");
  if (schemeEnd == std::string::npos) return location;
  const size_t userStart = schemeEnd + 3;
  // The last '@' is where the widest credentials a URL parser could see end.
  const size_t at = location.rfind('@');
  if (at == std::string::npos || at < userStart) return location;
  if (location.find(':', userStart) >= at) return location;
  return location.substr(0, userStart) + "****" + location.substr(at);
}

std::string WorkerSteps::LocationForLog(const std::string& location) { return locationForLog(location); }

}  // namespace sorvik
