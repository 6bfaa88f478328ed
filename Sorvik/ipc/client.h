#pragma once

// The plug-in's handle on one child process that the host runs for it, and
// the registry operations that start children and route the host's packets.

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "Sorvik/platform/mutex.h"

namespace ko::ipc {

enum class ClientState : int32_t { Pending = 0, Running = 1, Exited = 2, Failed = -1 };

enum class PacketType : uint32_t {
  StdinData = 0,
  StdoutData = 1,
  StderrData = 2,
  Started = 3,
  StartFailed = 4,
  Exited = 5,
  StartRequest = 6,
};

inline constexpr uint32_t kStdinClose = 1;        // StdinData value bit 0
inline constexpr uint32_t kSpawnPiped = 2;        // flag bit 1
inline constexpr uint32_t kSpawnNoAutoClose = 4;  // flag bit 2
inline constexpr uint32_t kSpawnTextA = 8;        // flag bit 3
inline constexpr uint32_t kSpawnTextB = 16;       // flag bit 4

using Transport = std::function<bool(const unsigned char* bytes, uint64_t length)>;

struct SpawnOptions {
  std::vector<std::string> args;
  uint32_t flags = kSpawnPiped;
  std::string text_a;
  std::string text_b;
};

// One host-run child. Thread-safe: every field is guarded by the client's own
// mutex; the registry mutex is always taken before it.
class client {
 public:
  // Blocks while Running; returns the value (exit code, error number, 0).
  int32_t wait();
  // Waits at most `seconds` (capped at ten days) for a Running child; true
  // when the state is Exited on return.
  bool wait_for(int64_t seconds);
  // Sends `data` as StdinData with `flags` as value (bit 0 closes stdin).
  void write(const std::string& data, uint32_t flags);
  // Blocking read of one piece of stream 0 (stdout) or 1 (stderr) ending at
  // `delimiter`; false once the child has ended and the buffer is empty.
  bool read_until(std::string& out, int stream, char delimiter);
  // One line of `stream` within `timeout_ms`; false on timeout or when ended and empty.
  bool read_line(std::string& out, int stream, int64_t timeout_ms);

  ClientState state() const;
  uint32_t id() const;
  int32_t value() const;

  // Internal: used by the registry.
  struct Internals;
  Internals& internals() { return *internals_; }
  client();
  ~client();
  client(const client&) = delete;
  client& operator=(const client&) = delete;

 private:
  std::unique_ptr<Internals> internals_;
};

// Registry operations (one registry per loaded module).
void set_transport(uint32_t id_base, Transport transport);
bool send(uint32_t id, uint32_t type, uint32_t value, const void* data, uint64_t length);
bool receive(const unsigned char* packet, uint64_t length);
void shutdown(bool closed);
std::shared_ptr<client> spawn(const SpawnOptions& options);
std::shared_ptr<client> spawn(const std::vector<std::string>& args);
std::shared_ptr<client> spawn(const std::vector<std::string>& args, const std::string& last);

}  // namespace ko::ipc
