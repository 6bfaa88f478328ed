#include "host/sorvik_host_script.h"

#include <cstdlib>
#include <ctime>
#include <fstream>
#include <sstream>
#include <thread>

#include "host/sorvik_host_documents.h"

namespace sorvik::host {
namespace {

// The instruction word and the untouched text after it.
void splitHead(const std::string& line, std::string* head, std::string* rest) {
  const size_t begin = line.find_first_not_of(" \t");
  if (begin == std::string::npos) {
    head->clear();
    rest->clear();
    return;
  }
  const size_t end = line.find_first_of(" \t", begin);
  *head = line.substr(begin, end == std::string::npos ? std::string::npos : end - begin);
  const size_t restBegin = end == std::string::npos ? std::string::npos : line.find_first_not_of(" \t", end);
  *rest = restBegin == std::string::npos ? std::string() : line.substr(restBegin);
  while (!rest->empty() && (rest->back() == ' ' || rest->back() == '\t' || rest->back() == '\r')) rest->pop_back();
}

bool readFile(const std::string& path, std::string* text) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return false;
  std::ostringstream buffer;
  buffer << in.rdbuf();
  *text = buffer.str();
  return true;
}

bool parseSeconds(const std::string& text, std::chrono::milliseconds* out) {
  char* end = nullptr;
  const double seconds = std::strtod(text.c_str(), &end);
  if (text.empty() || *end != '\0' || !(seconds >= 0) || seconds > 864000) return false;
  *out = std::chrono::milliseconds(static_cast<int64_t>(seconds * 1000));
  return true;
}

StepResult fail(std::string* error, const std::string& why) {
  *error = why;
  return StepResult::Failed;
}

}  // namespace

bool splitWords(const std::string& line, std::vector<std::string>* words) {
  words->clear();
  std::string word;
  bool inWord = false;
  bool quoted = false;
  for (size_t i = 0; i < line.size(); ++i) {
    const char c = line[i];
    if (quoted) {
      if (c == '\\' && i + 1 < line.size() && (line[i + 1] == '"' || line[i + 1] == '\\')) {
        word += line[++i];
      } else if (c == '"') {
        quoted = false;
      } else {
        word += c;
      }
    } else if (c == '"') {
      quoted = true;
      inWord = true;
    } else if (c == ' ' || c == '\t' || c == '\r' || c == '\n') {
      if (inWord) words->push_back(word);
      word.clear();
      inWord = false;
    } else {
      word += c;
      inWord = true;
    }
  }
  if (quoted) return false;
  if (inWord) words->push_back(word);
  return true;
}

std::string maskInstruction(const std::string& line) {
  std::string head;
  std::string rest;
  splitHead(line, &head, &rest);
  if (head == "agent-start" || head == "agent-reset") {
    std::vector<std::string> words;
    if (splitWords(line, &words) && words.size() >= 4) {
      words[3] = "***";
      std::string out;
      for (const std::string& w : words) out += (out.empty() ? "" : " ") + w;
      return out;
    }
  }
  return maskSecrets(line);
}

const char* instructionHelp() {
  return R"(Instructions (one per line; '#' starts a comment line):
  write XML                      send a command document (Write)
  write-file PATH                send the file's content as a command document
  config XML                     send a configuration document (IOCTL code 2)
  config-file PATH               send the file's content as a configuration document
  update LOCATION [CHECKSUM]     request an update from LOCATION (a URL), with MD5 CHECKSUM
  failover STATE                 request a failover state: PROTECTED, DECOMMISSION_FAILOVER,
                                 DECOMMISSION_ACTIVE, COMMISSIONED, RESERVE_SPARE or a number
  drives [NAME...]               configure the enabled storage drives (none: no drive)
  network-storage                announce network storage (disables failover)
  agent-start START END TOKEN [PORT]
                                 start the failback agent for the failover period START..END
  agent-reset START END [TOKEN]  start the agent in spare-reset mode (empties the drives)
  agent-stop                     stop the failback agent
                                 START/END: now, now-N, now+N (seconds), seconds since 1970,
                                 or YYYY-MM-DDTHH:MM:SSZ
  wait [-t SECONDS] [-r] PATTERN wait until a log line, document or host notice contains
                                 PATTERN (-r: PATTERN is a regular expression). Everything
                                 that arrived since the previous successful wait counts.
                                 A wait that times out fails the script.
  level LEVEL                    log threshold: DETAIL, PROGRESS, FAILED, REJECTED,
                                 INTERNAL or a number (0..100)
  restart                        restart the plug-in like a service restart
  sleep SECONDS                  pause
  echo TEXT                      print TEXT
  help                           this text
  quit                           close the plug-in and exit
Words may be put in double quotes to include blanks.)";
}

StepResult ScriptRunner::execute(const std::string& line, std::string* error) {
  std::string head;
  std::string rest;
  splitHead(line, &head, &rest);
  if (head.empty() || head[0] == '#') return StepResult::Continue;
  std::vector<std::string> words;
  if (!splitWords(line, &words)) return fail(error, "unterminated quote");
  const size_t args = words.size() - 1;

  if (head == "quit" || head == "exit") return StepResult::Quit;
  if (head == "help") {
    display_->say(instructionHelp());
    return StepResult::Continue;
  }
  if (head == "echo") {
    display_->say(rest);
    return StepResult::Continue;
  }
  if (head == "write" || head == "config") {
    if (rest.empty()) return fail(error, head + " needs a document");
    return head == "write" ? sendCommand(rest, error) : sendConfiguration(rest, error);
  }
  if (head == "write-file" || head == "config-file") {
    std::string text;
    if (args != 1) return fail(error, head + " needs one path");
    if (!readFile(words[1], &text)) return fail(error, "cannot read " + words[1]);
    return head == "write-file" ? sendCommand(text, error) : sendConfiguration(text, error);
  }
  if (head == "update") {
    if (args < 1 || args > 2) return fail(error, "usage: update LOCATION [CHECKSUM]");
    return sendCommand(updateRequestDocument(words[1], args == 2 ? words[2] : ""), error);
  }
  if (head == "failover") {
    int32_t state = 0;
    if (args != 1 || !parseFailoverState(words[1], &state)) return fail(error, "usage: failover STATE");
    return sendConfiguration(failoverStateDocument(state), error);
  }
  if (head == "drives") {
    return sendConfiguration(storageDrivesDocument(std::vector<std::string>(words.begin() + 1, words.end())), error);
  }
  if (head == "network-storage") return sendConfiguration(networkStorageDocument(), error);
  if (head == "agent-start" || head == "agent-reset" || head == "agent-stop") return agent(words, error);
  if (head == "wait") return wait(rest, error);
  if (head == "level") {
    int32_t level = 0;
    if (args != 1 || !parseLogLevel(words[1], &level)) return fail(error, "usage: level LEVEL");
    session_->setLogThreshold(level);
    return StepResult::Continue;
  }
  if (head == "restart") {
    std::string why;
    if (!session_->restart(&why)) return fail(error, "restart failed: " + why);
    return StepResult::Continue;
  }
  if (head == "sleep") {
    std::chrono::milliseconds pause{0};
    if (args != 1 || !parseSeconds(words[1], &pause)) return fail(error, "usage: sleep SECONDS");
    std::this_thread::sleep_for(pause);
    return StepResult::Continue;
  }
  return fail(error, "unknown instruction '" + head + "' (try help)");
}

StepResult ScriptRunner::sendCommand(const std::string& xml, std::string* error) {
  if (!session_->sendCommand(xml)) return fail(error, "no plug-in is loaded");
  return StepResult::Continue;
}

StepResult ScriptRunner::sendConfiguration(const std::string& xml, std::string* error) {
  if (!session_->sendConfiguration(xml)) return fail(error, "no plug-in is loaded");
  return StepResult::Continue;
}

StepResult ScriptRunner::agent(const std::vector<std::string>& words, std::string* error) {
  const std::string& head = words[0];
  const size_t args = words.size() - 1;
  if (head == "agent-stop") {
    if (args != 0) return fail(error, "usage: agent-stop");
    return sendCommand(agentStopDocument(), error);
  }
  const bool reset = head == "agent-reset";
  if (reset ? (args < 2 || args > 3) : (args < 3 || args > 4)) {
    return fail(error, reset ? "usage: agent-reset START END [TOKEN]" : "usage: agent-start START END TOKEN [PORT]");
  }
  const int64_t now = static_cast<int64_t>(std::time(nullptr));
  int64_t start = 0;
  int64_t end = 0;
  if (!parseUtcTime(words[1], now, &start)) return fail(error, "bad START time '" + words[1] + "'");
  if (!parseUtcTime(words[2], now, &end)) return fail(error, "bad END time '" + words[2] + "'");
  const std::string token = args >= 3 ? words[3] : "";
  if (reset) return sendCommand(agentResetDocument(start, end, token), error);
  return sendCommand(agentStartDocument(start, end, token, args == 4 ? words[4] : ""), error);
}

StepResult ScriptRunner::wait(const std::string& rest, std::string* error) {
  std::chrono::milliseconds limit = defaultWait_;
  bool regex = false;
  std::string pattern = rest;
  while (true) {
    std::string option;
    std::string after;
    splitHead(pattern, &option, &after);
    if (option == "-r") {
      regex = true;
      pattern = after;
    } else if (option == "-t") {
      std::string value;
      std::string remaining;
      splitHead(after, &value, &remaining);
      if (!parseSeconds(value, &limit)) return fail(error, "wait: bad time limit '" + value + "'");
      pattern = remaining;
    } else {
      break;
    }
  }
  if (pattern.empty()) return fail(error, "usage: wait [-t SECONDS] [-r] PATTERN");
  EventPattern matcher = EventPattern::substring(pattern);
  std::string why;
  if (regex && !EventPattern::regex(pattern, &matcher, &why)) return fail(error, "wait: bad pattern: " + why);
  Event matched;
  switch (events_->waitFor(matcher, std::chrono::steady_clock::now() + limit, &matched)) {
    case WaitResult::Matched:
      return StepResult::Continue;
    case WaitResult::Interrupted:
      return fail(error, "wait for '" + pattern + "' interrupted");
    case WaitResult::TimedOut:
      break;
  }
  const auto seconds = std::chrono::duration<double>(limit).count();
  std::ostringstream text;
  text << "wait for '" << pattern << "' timed out after " << seconds << " s";
  return fail(error, text.str());
}

}  // namespace sorvik::host
