#include "host/sorvik_host_display.h"

#include <tinyxml.h>

#include <cstdlib>
#include <ctime>

#include "Sorvik/plugin/module.h"

namespace sorvik::host {
namespace {

struct LevelName {
  int32_t level;
  const char* name;
};
constexpr LevelName kLevelNames[] = {
    {ko::core::kLogDetail, "DETAIL"},     {ko::core::kLogProgress, "PROGRESS"}, {ko::core::kLogStepFailed, "FAILED"},
    {ko::core::kLogRejected, "REJECTED"}, {ko::core::kLogInternal, "INTERNAL"},
};

std::string timeStamp(std::chrono::system_clock::time_point when) {
  const auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(when.time_since_epoch()).count();
  const std::time_t seconds = static_cast<std::time_t>(ms / 1000);
  std::tm utc{};
  ::gmtime_r(&seconds, &utc);
  char text[40];
  std::strftime(text, sizeof(text), "%Y-%m-%dT%H:%M:%S", &utc);
  char full[48];
  std::snprintf(full, sizeof(full), "%s.%03dZ", text, static_cast<int>(ms % 1000));
  return full;
}

std::string progressBar(int percent) {
  if (percent < 0) percent = 0;
  if (percent > 100) percent = 100;
  constexpr int kWidth = 40;
  const int filled = percent * kWidth / 100;
  return "download [" + std::string(static_cast<size_t>(filled), '#') +
         std::string(static_cast<size_t>(kWidth - filled), '.') + "] " + std::to_string(percent) + "%";
}

}  // namespace

std::string logLevelName(int32_t level) {
  for (const LevelName& n : kLevelNames) {
    if (n.level == level) return n.name;
  }
  return "LEVEL" + std::to_string(level);
}

bool parseLogLevel(const std::string& text, int32_t* level) {
  for (const LevelName& n : kLevelNames) {
    if (text == n.name) {
      *level = n.level;
      return true;
    }
  }
  if (text.empty()) return false;
  char* end = nullptr;
  const long value = std::strtol(text.c_str(), &end, 10);
  if (*end != '\0' || value < INT32_MIN || value > INT32_MAX) return false;
  *level = static_cast<int32_t>(value);
  return true;
}

std::string documentTargetName(uint32_t target) {
  if (target == ko::core::kTargetStatus) return "status";
  if (target == ko::core::kTargetState) return "state";
  return "target" + std::to_string(target);
}

bool parseDownloadProgress(const std::string& xml, int* percent) {
  TiXmlDocument document;
  document.Parse(xml.c_str());
  if (document.Error()) return false;
  const TiXmlElement* root = document.RootElement();
  const TiXmlElement* update = root != nullptr ? root->FirstChildElement("Update") : nullptr;
  if (update == nullptr) return false;
  const char* status = update->Attribute("Status");
  int progress = 0;
  if (status == nullptr || std::string(status) != "1") return false;
  if (update->QueryIntAttribute("Progress", &progress) != TIXML_SUCCESS) return false;
  *percent = progress;
  return true;
}

std::string formatEvent(const Event& event) {
  std::string line = timeStamp(event.when) + " ";
  switch (event.kind) {
    case EventKind::Log:
      line += logLevelName(event.level);
      break;
    case EventKind::Document:
      line += "DOC:" + documentTargetName(event.target);
      break;
    case EventKind::Notice:
      line += "HOST";
      break;
  }
  return line + " " + event.text;
}

void Display::show(const Event& event) {
  int percent = 0;
  const bool progress = terminal_ && event.kind == EventKind::Document && parseDownloadProgress(event.text, &percent);
  const std::string line = progress ? progressBar(percent) : formatEvent(event);
  MutexLock lock(&mu_);
  clearPrompt();
  if (progress) {
    std::fprintf(out_, "\r\033[K%s", line.c_str());
    progressShown_ = true;
  } else {
    endProgressLine();
    std::fprintf(out_, "%s\n", line.c_str());
    redrawPrompt();
  }
  std::fflush(out_);
}

void Display::prompt(const std::string& text) {
  MutexLock lock(&mu_);
  endProgressLine();
  prompt_ = text;
  std::fputs(text.c_str(), out_);
  std::fflush(out_);
}

void Display::say(const std::string& text) {
  MutexLock lock(&mu_);
  prompt_.clear();  // the user has answered it
  endProgressLine();
  std::fprintf(out_, "%s\n", text.c_str());
  std::fflush(out_);
}

void Display::clearPrompt() {
  if (terminal_ && !prompt_.empty()) std::fputs("\r\033[K", out_);
}

void Display::redrawPrompt() {
  if (terminal_ && !prompt_.empty()) std::fputs(prompt_.c_str(), out_);
}

void Display::endProgressLine() {
  if (!progressShown_) return;
  std::fputc('\n', out_);
  progressShown_ = false;
}

}  // namespace sorvik::host
