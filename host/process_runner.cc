#include "host/process_runner.h"

#include "Sorvik/ipc/client.h"

namespace sorvik::host {

bool decodeStartPayload(const unsigned char* data, size_t length, uint32_t flags, StartPayload* out) {
  const std::string payload(reinterpret_cast<const char*>(data), length);
  size_t pos = 0;
  auto takeText = [&](std::string* text) {
    const size_t nul = payload.find('\0', pos);
    if (nul == std::string::npos) return false;
    *text = payload.substr(pos, nul - pos);
    pos = nul + 1;
    return true;
  };
  StartPayload result;
  if ((flags & ko::ipc::kSpawnTextA) != 0 && !takeText(&result.textA)) return false;
  if ((flags & ko::ipc::kSpawnTextB) != 0 && !takeText(&result.textB)) return false;
  // The arguments are NUL-separated without a final NUL.
  while (true) {
    const size_t nul = payload.find('\0', pos);
    if (nul == std::string::npos) {
      result.args.push_back(payload.substr(pos));
      break;
    }
    result.args.push_back(payload.substr(pos, nul - pos));
    pos = nul + 1;
  }
  if (result.args.front().empty()) return false;
  *out = std::move(result);
  return true;
}

}  // namespace sorvik::host
