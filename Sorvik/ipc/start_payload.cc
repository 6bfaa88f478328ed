#include "Sorvik/ipc/start_payload.h"

namespace ko::ipc {

std::string encodeStartPayload(const SpawnOptions& options) {
  std::string payload;
  if (options.flags & kSpawnTextA) {
    payload += options.text_a;
    payload.push_back('\0');
  }
  if (options.flags & kSpawnTextB) {
    payload += options.text_b;
    payload.push_back('\0');
  }
  for (size_t i = 0; i < options.args.size(); ++i) {
    if (i > 0) payload.push_back('\0');
    payload += options.args[i];
  }
  return payload;
}

namespace {

// Takes the text up to the next NUL; false when there is none.
bool takeTerminated(const std::string& payload, size_t* pos, std::string* out) {
  const size_t nul = payload.find('\0', *pos);
  if (nul == std::string::npos) return false;
  out->assign(payload, *pos, nul - *pos);
  *pos = nul + 1;
  return true;
}

}  // namespace

bool decodeStartPayload(const std::string& payload, uint32_t flags, SpawnOptions* options) {
  options->flags = flags;
  options->text_a.clear();
  options->text_b.clear();
  options->args.clear();
  size_t pos = 0;
  if ((flags & kSpawnTextA) && !takeTerminated(payload, &pos, &options->text_a)) return false;
  if ((flags & kSpawnTextB) && !takeTerminated(payload, &pos, &options->text_b)) return false;
  // An empty remainder is one empty argument, as encoding {""} produces.
  while (true) {
    const size_t nul = payload.find('\0', pos);
    if (nul == std::string::npos) {
      options->args.emplace_back(payload, pos);
      return true;
    }
    options->args.emplace_back(payload, pos, nul - pos);
    pos = nul + 1;
  }
}

}  // namespace ko::ipc
