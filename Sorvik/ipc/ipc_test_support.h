#pragma once

// Test helpers for the child-process layer: a transport-level host stand-in
// with its own delivering thread, and a watchdog that turns a hang into a
// failure.

#include <gtest/gtest.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <string>
#include <thread>
#include <vector>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/packet.h"
#include "Sorvik/platform/mutex.h"
#include "host/test_watchdog.h"

namespace ko::ipc::testing {

// A stuck wait on a child is ended by emptying the registry.
class Watchdog : public sorvik::testing::Watchdog {
 public:
  explicit Watchdog(std::chrono::seconds limit = std::chrono::seconds(10))
      : sorvik::testing::Watchdog(limit, [] { ko::ipc::shutdown(false); }) {}
};


inline constexpr uint32_t kIdBase = 0x380000;

inline std::string makePacket(PacketType type, uint32_t id, uint32_t value, const std::string& payload = {}) {
  std::string packet(kPacketHeaderSize, '\0');
  PacketHeader header;
  header.total_length = static_cast<uint32_t>(kPacketHeaderSize + payload.size());
  header.id = id;
  header.type = static_cast<uint32_t>(type);
  header.value = value;
  encodePacketHeader(header, reinterpret_cast<unsigned char*>(&packet[0]));
  return packet + payload;
}

inline bool deliverNow(const std::string& packet) {
  return receive(reinterpret_cast<const unsigned char*>(packet.data()), packet.size());
}

// Installs a lambda transport that records every packet and answers start
// requests from a delivering thread of its own (never inside the transport
// call, where the registry mutex is held). Thread-safe: all members are
// guarded by `mu_`.
class LoopbackHost {
 public:
  enum class StartAnswer { Started, StartFailed, Exited, None };

  LoopbackHost() {
    thread_ = std::thread([this] { deliverLoop(); });
    set_transport(kIdBase, [this](const unsigned char* bytes, uint64_t length) { return onPacket(bytes, length); });
  }
  ~LoopbackHost() {
    shutdown(false);
    set_transport(kIdBase, nullptr);
    {
      sorvik::MutexLock lock(&mu_);
      stopping_ = true;
      cv_.signalAll();
    }
    thread_.join();
  }

  void setStartAnswer(StartAnswer answer, uint32_t value = 0) {
    sorvik::MutexLock lock(&mu_);
    answer_ = answer;
    answerValue_ = value;
  }
  void setAccept(bool accept) {
    sorvik::MutexLock lock(&mu_);
    accept_ = accept;
  }
  std::vector<std::string> sent() const {
    sorvik::MutexLock lock(&mu_);
    return sent_;
  }
  // True once at least `count` packets have been sent.
  bool waitSent(size_t count, std::chrono::seconds timeout = std::chrono::seconds(5)) {
    const auto deadline = sorvik::saturatingDeadline(timeout);
    sorvik::MutexLock lock(&mu_);
    while (sent_.size() < count) {
      if (!waitForWorkUntil(deadline)) return sent_.size() >= count;
    }
    return true;
  }
  void clearSent() {
    sorvik::MutexLock lock(&mu_);
    sent_.clear();
  }
  // Delivered later by the delivering thread, in order.
  void deliver(const std::string& packet) {
    sorvik::MutexLock lock(&mu_);
    queue_.push_back(packet);
    cv_.signalAll();
  }

 private:
  bool onPacket(const unsigned char* bytes, uint64_t length) {
    sorvik::MutexLock lock(&mu_);
    sent_.emplace_back(reinterpret_cast<const char*>(bytes), static_cast<size_t>(length));
    PacketHeader header;
    if (accept_ && decodePacketHeader(bytes, static_cast<size_t>(length), &header) &&
        header.type == static_cast<uint32_t>(PacketType::StartRequest)) {
      if (answer_ == StartAnswer::Started) {
        queue_.push_back(makePacket(PacketType::Started, header.id, answerValue_));
      } else if (answer_ == StartAnswer::StartFailed) {
        queue_.push_back(makePacket(PacketType::StartFailed, header.id, answerValue_));
      } else if (answer_ == StartAnswer::Exited) {
        queue_.push_back(makePacket(PacketType::Exited, header.id, answerValue_));
      }
    }
    cv_.signalAll();
    return accept_;
  }
  void deliverLoop() {
    while (true) {
      std::string packet;
      {
        sorvik::MutexLock lock(&mu_);
        while (queue_.empty() && !stopping_) waitForWork();
        if (stopping_) return;
        packet = std::move(queue_.front());
        queue_.pop_front();
      }
      deliverNow(packet);
    }
  }
  void waitForWork() REQUIRES(mu_) NO_THREAD_SAFETY_ANALYSIS { cv_.wait(); }
  bool waitForWorkUntil(sorvik::CondVar::Clock::time_point deadline) REQUIRES(mu_) NO_THREAD_SAFETY_ANALYSIS {
    return cv_.waitUntil(deadline);
  }

  mutable sorvik::Mutex mu_;
  sorvik::CondVar cv_{&mu_};
  std::vector<std::string> sent_ GUARDED_BY(mu_);
  std::deque<std::string> queue_ GUARDED_BY(mu_);
  StartAnswer answer_ GUARDED_BY(mu_) = StartAnswer::Started;
  uint32_t answerValue_ GUARDED_BY(mu_) = 4321;
  bool accept_ GUARDED_BY(mu_) = true;
  bool stopping_ GUARDED_BY(mu_) = false;
  std::thread thread_;
};

inline PacketHeader headerOf(const std::string& packet) {
  PacketHeader header;
  decodePacketHeader(reinterpret_cast<const unsigned char*>(packet.data()), packet.size(), &header);
  return header;
}

}  // namespace ko::ipc::testing
