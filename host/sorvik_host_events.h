#pragma once

// What the plug-in (and the host itself) reported, kept for the script's
// `wait` instruction. A wait looks at everything that arrived after the
// previous successful wait, so an event that comes in between two
// instructions is never missed.

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <regex>
#include <string>

#include "Sorvik/platform/mutex.h"

namespace sorvik::host {

enum class EventKind { Log, Document, Notice };

struct Event {
  EventKind kind = EventKind::Notice;
  int32_t level = 0;    // log lines
  uint32_t target = 0;  // documents
  std::string text;
  std::chrono::system_clock::time_point when;
};

// A substring, or an ECMAScript regular expression searched in the text.
class EventPattern {
 public:
  static EventPattern substring(std::string text);
  // False with a reason when `expression` is not a valid regular expression.
  static bool regex(const std::string& expression, EventPattern* out, std::string* error);

  bool matches(const Event& event) const;
  const std::string& source() const { return source_; }

 private:
  std::string source_;
  bool isRegex_ = false;
  std::regex regex_;
};

enum class WaitResult { Matched, TimedOut, Interrupted };

// Thread-safe: events arrive on plug-in and runner threads while the script
// thread waits; all state is guarded by mu_.
class EventLog {
 public:
  // Oldest unexamined events are dropped beyond this many.
  static constexpr size_t kMaxPending = 100000;

  void add(Event event);
  // Waits until an event after the previous match matches `pattern`; on a
  // match everything up to it is consumed. One waiter at a time (the
  // script thread).
  WaitResult waitFor(const EventPattern& pattern, std::chrono::steady_clock::time_point deadline, Event* matched);
  // Ends current and future waits (the host is quitting).
  void interrupt();

 private:
  bool takeMatch(const EventPattern& pattern, Event* matched) REQUIRES(mu_);
  // CondVar's annotation names its own mutex pointer, which the analysis
  // cannot equate with mu_.
  bool waitChangeUntil(std::chrono::steady_clock::time_point deadline) REQUIRES(mu_) NO_THREAD_SAFETY_ANALYSIS {
    return changed_.waitUntil(deadline);
  }

  Mutex mu_;
  CondVar changed_{&mu_};
  std::deque<Event> pending_ GUARDED_BY(mu_);
  size_t examined_ GUARDED_BY(mu_) = 0;  // pending_ entries already tested by the current wait
  bool interrupted_ GUARDED_BY(mu_) = false;
};

}  // namespace sorvik::host
