#include <algorithm>
#include <chrono>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/client_internals.h"

namespace ko::ipc {

namespace {

constexpr int64_t kMaxWaitSeconds = 864000;  // ten days

bool validStream(int stream) { return stream == 0 || stream == 1; }

}  // namespace

client::client() : internals_(std::make_unique<Internals>()) {}
client::~client() = default;

namespace {

// Sends the deferred close of a script's standard input. Called with the
// client's mutex held; releases it around the send so that a host answering
// from inside its callback cannot deadlock against this client.
void sendPendingClose(client::Internals& in) REQUIRES(in.mu) {
  if (!in.closePending) return;
  in.closePending = false;
  const uint32_t id = in.id;
  in.mu.unlock();
  send(id, static_cast<uint32_t>(PacketType::StdinData), kStdinClose, nullptr, 0);
  in.mu.lock();
}

}  // namespace

int32_t client::wait() {
  Internals& in = *internals_;
  sorvik::MutexLock lock(&in.mu);
  if (in.state == ClientState::Running) {
    sendPendingClose(in);
    while (in.state == ClientState::Running) in.wait();
  }
  return in.value;
}

bool client::wait_for(int64_t seconds) {
  Internals& in = *internals_;
  sorvik::MutexLock lock(&in.mu);
  if (in.state == ClientState::Running) {
    sendPendingClose(in);
    if (seconds >= 1) {
      const auto deadline = sorvik::saturatingDeadline(std::chrono::seconds(std::min(seconds, kMaxWaitSeconds)));
      while (in.state == ClientState::Running) {
        if (!in.waitUntil(deadline)) break;
      }
    }
  }
  return in.state == ClientState::Exited;
}

void client::write(const std::string& data, uint32_t flags) {
  Internals& in = *internals_;
  uint32_t id;
  {
    sorvik::MutexLock lock(&in.mu);
    if (flags & kStdinClose) in.closePending = false;
    id = in.id;
  }
  send(id, static_cast<uint32_t>(PacketType::StdinData), flags, data.data(), data.size());
}

bool client::read_until(std::string& out, int stream, char delimiter) {
  if (!validStream(stream)) return false;
  Internals& in = *internals_;
  sorvik::MutexLock lock(&in.mu);
  OutputBuffer& buffer = in.output[stream];
  while (true) {
    if (buffer.takeUntil(delimiter, &out)) return true;
    if (in.state != ClientState::Running) {
      if (buffer.empty()) return false;
      buffer.takeAll(&out);
      return true;
    }
    in.wait();
  }
}

bool client::read_line(std::string& out, int stream, int64_t timeout_ms) {
  if (!validStream(stream)) return false;
  Internals& in = *internals_;
  sorvik::MutexLock lock(&in.mu);
  OutputBuffer& buffer = in.output[stream];
  // The clock is read only when there is something to wait for: a reader
  // draining buffered lines pays nothing for its time limit.
  bool haveDeadline = false;
  sorvik::CondVar::Clock::time_point deadline;
  while (true) {
    if (buffer.takeUntil('\n', &out, /*dropCarriageReturnBefore=*/true)) return true;
    if (in.state != ClientState::Running) {
      if (buffer.empty()) return false;
      buffer.takeAll(&out);
      return true;
    }
    if (timeout_ms < 1) return false;
    if (!haveDeadline) {
      deadline = sorvik::saturatingDeadline(std::chrono::milliseconds(timeout_ms));
      haveDeadline = true;
    } else if (sorvik::CondVar::Clock::now() >= deadline) {
      return false;
    }
    in.waitUntil(deadline);
  }
}

ClientState client::state() const {
  sorvik::MutexLock lock(&internals_->mu);
  return internals_->state;
}

uint32_t client::id() const {
  sorvik::MutexLock lock(&internals_->mu);
  return internals_->id;
}

int32_t client::value() const {
  sorvik::MutexLock lock(&internals_->mu);
  return internals_->value;
}

}  // namespace ko::ipc
