#pragma once

// The host's instruction language: one instruction per line, typed at the
// prompt or read from a script. See `instructionHelp()` for the full list.

#include <chrono>
#include <string>
#include <vector>

#include "host/sorvik_host_display.h"
#include "host/sorvik_host_events.h"
#include "host/sorvik_host_session.h"

namespace sorvik::host {

enum class StepResult { Continue, Quit, Failed };

// Splits a line into words; double quotes group words and \" or \\ inside
// them stand for the character. False on an unterminated quote.
bool splitWords(const std::string& line, std::vector<std::string>* words);

// The instruction as it may be shown: tokens and PasswordToken values masked.
std::string maskInstruction(const std::string& line);

const char* instructionHelp();

// Not thread-safe: one script thread executes instructions in order.
class ScriptRunner {
 public:
  ScriptRunner(HostSession* session, EventLog* events, Display* display, std::chrono::milliseconds defaultWait)
      : session_(session), events_(events), display_(display), defaultWait_(defaultWait) {}

  // Executes one line. On Failed, `error` says why.
  StepResult execute(const std::string& line, std::string* error);

 private:
  StepResult sendCommand(const std::string& xml, std::string* error);
  StepResult sendConfiguration(const std::string& xml, std::string* error);
  StepResult wait(const std::string& rest, std::string* error);
  StepResult agent(const std::vector<std::string>& words, std::string* error);

  HostSession* const session_;
  EventLog* const events_;
  Display* const display_;
  const std::chrono::milliseconds defaultWait_;
};

}  // namespace sorvik::host
