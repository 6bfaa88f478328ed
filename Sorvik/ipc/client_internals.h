#pragma once

// The guarded state behind one ko::ipc::client, shared by the client's own
// operations and the registry that routes the host's packets to it.

#include <cstdint>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/output_buffer.h"
#include "Sorvik/platform/mutex.h"

namespace ko::ipc {

struct client::Internals {
  sorvik::Mutex mu;
  // Broadcast on every accepted packet and when shutdown ends the client.
  sorvik::CondVar changed{&mu};
  ClientState state GUARDED_BY(mu) = ClientState::Pending;
  uint32_t id GUARDED_BY(mu) = 0;
  int32_t value GUARDED_BY(mu) = 0;
  bool closePending GUARDED_BY(mu) = false;
  bool overflowReported GUARDED_BY(mu) = false;
  // Index 0 standard output (no carriage returns), 1 standard error.
  OutputBuffer output[2] GUARDED_BY(mu);

  // `changed` is bound to `mu`, which the analysis cannot see through.
  void wait() REQUIRES(mu) NO_THREAD_SAFETY_ANALYSIS { changed.wait(); }
  bool waitUntil(sorvik::CondVar::Clock::time_point deadline) REQUIRES(mu) NO_THREAD_SAFETY_ANALYSIS {
    return changed.waitUntil(deadline);
  }
};

}  // namespace ko::ipc
