#pragma once

// The process-wide state of the child-process layer: the transport to the
// host, the id counter and the map of children that may still get packets.

#include <cstdint>
#include <map>
#include <memory>

#include "Sorvik/ipc/client.h"
#include "Sorvik/platform/mutex.h"

namespace ko::ipc {

// Thread-safe: the map, the counter and `closed` are guarded by `mu`, which
// is always taken before a client's mutex. The transport has its own mutex
// so that send() works while `mu` is held (spawn sends under it); that mutex
// is innermost and never held while the transport runs.
class Registry {
 public:
  static Registry& instance();

  sorvik::Mutex mu;
  uint32_t idBase GUARDED_BY(mu) = 0;
  uint32_t lastId GUARDED_BY(mu) = 0;
  bool closed GUARDED_BY(mu) = false;
  std::map<uint32_t, std::shared_ptr<client>> clients GUARDED_BY(mu);

  void setTransport(Transport transport);
  // The installed transport, or null; safe to call without `mu`.
  std::shared_ptr<const Transport> transport();

  // Next free id after lastId, or false when all 2^20 are taken.
  bool allocateId(uint32_t* id) REQUIRES(mu);

 private:
  sorvik::Mutex transportMu_;
  std::shared_ptr<const Transport> transport_ GUARDED_BY(transportMu_);
};

// Test hook: makes `last` the most recently handed-out id.
void setLastIdForTesting(uint32_t last);

}  // namespace ko::ipc
