#include "host/sorvik_host_events.h"

namespace sorvik::host {

EventPattern EventPattern::substring(std::string text) {
  EventPattern p;
  p.source_ = std::move(text);
  return p;
}

bool EventPattern::regex(const std::string& expression, EventPattern* out, std::string* error) {
  try {
    EventPattern p;
    p.source_ = expression;
    p.isRegex_ = true;
    p.regex_ = std::regex(expression, std::regex::ECMAScript);
    *out = std::move(p);
    return true;
  } catch (const std::regex_error& e) {
    *error = e.what();
    return false;
  }
}

bool EventPattern::matches(const Event& event) const {
  if (isRegex_) return std::regex_search(event.text, regex_);
  return event.text.find(source_) != std::string::npos;
}

void EventLog::add(Event event) {
  MutexLock lock(&mu_);
  pending_.push_back(std::move(event));
  if (pending_.size() > kMaxPending) {
    pending_.pop_front();
    if (examined_ > 0) --examined_;
  }
  changed_.signalAll();
}

bool EventLog::takeMatch(const EventPattern& pattern, Event* matched) {
  for (; examined_ < pending_.size(); ++examined_) {
    if (!pattern.matches(pending_[examined_])) continue;
    if (matched != nullptr) *matched = pending_[examined_];
    pending_.erase(pending_.begin(), pending_.begin() + static_cast<std::ptrdiff_t>(examined_) + 1);
    examined_ = 0;
    return true;
  }
  return false;
}

WaitResult EventLog::waitFor(const EventPattern& pattern, std::chrono::steady_clock::time_point deadline,
                             Event* matched) {
  MutexLock lock(&mu_);
  examined_ = 0;
  while (true) {
    if (takeMatch(pattern, matched)) return WaitResult::Matched;
    if (interrupted_) return WaitResult::Interrupted;
    if (!waitChangeUntil(deadline) && std::chrono::steady_clock::now() >= deadline) {
      // An event may have arrived together with the timeout.
      return takeMatch(pattern, matched) ? WaitResult::Matched : WaitResult::TimedOut;
    }
  }
}

void EventLog::interrupt() {
  MutexLock lock(&mu_);
  interrupted_ = true;
  changed_.signalAll();
}

}  // namespace sorvik::host
