#pragma once

// The operator's view of the plug-in: one time-stamped line per log line,
// document and host notice, and a progress bar for a running download when
// the output is a terminal.

#include <cstdint>
#include <cstdio>
#include <string>

#include "Sorvik/platform/mutex.h"
#include "host/sorvik_host_events.h"

namespace sorvik::host {

// "DETAIL", "PROGRESS", "FAILED", "REJECTED", "INTERNAL", or "LEVEL<n>".
std::string logLevelName(int32_t level);
// Parses a level name or number; false when it is neither.
bool parseLogLevel(const std::string& text, int32_t* level);
// "status", "state", or "target<n>".
std::string documentTargetName(uint32_t target);
// The download percentage of an update status document (an Update element
// with Status="1" and a Progress attribute); false for any other text.
bool parseDownloadProgress(const std::string& xml, int* percent);
// One output line without the line feed: time stamp, kind, text.
std::string formatEvent(const Event& event);

// Thread-safe: events are shown from any thread; output is serialised by mu_.
class Display {
 public:
  Display(std::FILE* out, bool terminal) : out_(out), terminal_(terminal) {}

  void show(const Event& event);
  // A line of the host's own (prompt answers, errors), without time stamp.
  void say(const std::string& text);
  // Shows the prompt; on a terminal, lines that arrive while it waits are
  // printed above it and the prompt is drawn again.
  void prompt(const std::string& text);

 private:
  void endProgressLine() REQUIRES(mu_);
  void clearPrompt() REQUIRES(mu_);
  void redrawPrompt() REQUIRES(mu_);

  std::FILE* const out_;
  const bool terminal_;
  Mutex mu_;
  bool progressShown_ GUARDED_BY(mu_) = false;
  std::string prompt_ GUARDED_BY(mu_);  // shown and waiting for input when not empty
};

}  // namespace sorvik::host
