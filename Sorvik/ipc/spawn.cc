// Starting a child: the start request, id allocation and registration, and
// the wait for the host's answer.

#include <memory>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/client_internals.h"
#include "Sorvik/ipc/registry.h"
#include "Sorvik/ipc/start_payload.h"
#include "Sorvik/plugin/host_log.h"

namespace ko::ipc {

namespace {

bool endsWithPs1(const std::string& program) {
  static constexpr char kSuffix[] = ".ps1";
  constexpr size_t kSuffixLength = sizeof(kSuffix) - 1;
  return program.size() > kSuffixLength &&
         program.compare(program.size() - kSuffixLength, kSuffixLength, kSuffix) == 0;
}

void markFailed(client::Internals& in) {
  sorvik::MutexLock lock(&in.mu);
  in.state = ClientState::Failed;
  in.value = 0;
}

}  // namespace

std::shared_ptr<client> spawn(const SpawnOptions& options) {
  auto child = std::make_shared<client>();
  client::Internals& in = child->internals();
  if (options.args.empty()) {
    markFailed(in);
    ko::core::log(75, "Child start refused: no program given");
    return child;
  }
  const std::string& program = options.args[0];
  if (!(options.flags & kSpawnNoAutoClose) && endsWithPs1(program)) {
    sorvik::MutexLock lock(&in.mu);
    in.closePending = true;
  }
  const std::string payload = encodeStartPayload(options);

  const char* refusal = nullptr;
  {
    Registry& registry = Registry::instance();
    // Held until the client is registered, so that the host's answer,
    // delivered on another thread, finds it.
    sorvik::MutexLock registryLock(&registry.mu);
    uint32_t id = 0;
    if (registry.closed) {
      refusal = "child processes are shut down";
    } else if (!registry.allocateId(&id)) {
      refusal = "no free child id";
    } else {
      {
        sorvik::MutexLock lock(&in.mu);
        in.id = id;
      }
      if (!send(id, static_cast<uint32_t>(PacketType::StartRequest), options.flags, payload.data(),
                payload.size())) {
        refusal = "the host did not accept the start request";
      } else {
        registry.clients[id] = child;
      }
    }
    if (refusal != nullptr) markFailed(in);
  }
  if (refusal != nullptr) {
    ko::core::log(50, "Cannot start %s: %s", program.c_str(), refusal);
    return child;
  }

  sorvik::MutexLock lock(&in.mu);
  while (in.state == ClientState::Pending) in.wait();
  return child;
}

std::shared_ptr<client> spawn(const std::vector<std::string>& args) {
  SpawnOptions options;
  options.args = args;
  return spawn(options);
}

std::shared_ptr<client> spawn(const std::vector<std::string>& args, const std::string& last) {
  SpawnOptions options;
  options.args = args;
  options.args.push_back(last);
  return spawn(options);
}

}  // namespace ko::ipc
