#include "Sorvik/service/status_documents.h"

#include <chrono>
#include <ctime>
#include <string>

#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/module.h"
#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/plugin/xml_envelope.h"
#include "Sorvik/service/state_file.h"

namespace sorvik {
namespace {

using ko::core::kLogProgress;
using ko::core::log;

// Unsigned fields (times, ports) must not wrap to negative text.
void setUnsigned(TiXmlElement* element, const char* name, uint32_t value) {
  element->SetAttribute(name, std::to_string(value));
}

void sendStatus(const TiXmlDocument& doc) {
  ko::core::sendXmlToHost(ko::core::kTargetStatus, ko::core::printCompact(doc));
}

}  // namespace

TimeStamp stampTime() {
  // 100 ns ticks since 1970, the resolution the host's time stamps assume.
  const auto since = std::chrono::system_clock::now().time_since_epoch();
  int64_t ticks = std::chrono::duration_cast<std::chrono::nanoseconds>(since).count() / 100;
  if (ticks < 0) ticks = 0;  // a clock set before 1970
  const int64_t seconds = ticks / 10000000;
  TimeStamp stamp;
  stamp.seconds = static_cast<uint32_t>(seconds);
  stamp.milliseconds = static_cast<uint32_t>((ticks - seconds * 10000000) / 10000);
  return stamp;
}

void buildFailoverStatusDocument(TiXmlDocument& doc, int32_t code, TimeStamp when) {
  TiXmlElement* update = ko::core::buildEnvelope(doc, false);
  update->SetAttribute("FailoverStatus", code);
  setUnsigned(update, "Time", when.seconds);
  setUnsigned(update, "Milliseconds", when.milliseconds);
}

void buildFailbackStatusDocument(TiXmlDocument& doc, int32_t status, TimeStamp when, uint32_t port) {
  TiXmlElement* update = ko::core::buildEnvelope(doc, true);
  update->SetAttribute("FailbackStatus", status);
  if (status == ko::core::AGENT_READY) setUnsigned(update, "Port", port);
  setUnsigned(update, "Time", when.seconds);
  setUnsigned(update, "Milliseconds", when.milliseconds);
}

void buildSpareResetStatusDocument(TiXmlDocument& doc, int32_t status, TimeStamp when) {
  TiXmlElement* update = ko::core::buildEnvelope(doc, true);
  update->SetAttribute("SpareResetStatus", status);
  setUnsigned(update, "Time", when.seconds);
  setUnsigned(update, "Milliseconds", when.milliseconds);
}

void UpdateService::buildStateDocument(TiXmlDocument& doc, bool statusForm) {
  bool hasFailover = false;
  int32_t failoverState = 0;
  int32_t failoverStatus = 0;
  std::string downloadDir;
  int32_t timeout = 0;
  int32_t status = 0;
  int32_t progress = 0;
  uint32_t time = 0;
  {
    MutexLock lock(&stateMutex);
    hasFailover = HasFailover;
    failoverState = FailoverReport.FailoverState;
    failoverStatus = FailoverReport.FailoverStatus;
    downloadDir = DownloadDir;
    timeout = Timeout;
    status = Status;
    progress = Progress;
    time = Time;
  }
  if (statusForm) {
    TiXmlElement* update = ko::core::buildEnvelope(doc, false);
    update->SetAttribute("Status", status);
    if (status == ko::core::BUNDLE_DOWNLOAD) update->SetAttribute("Progress", progress);
    update->SetAttribute("FailoverStatus", failoverStatus);
    setUnsigned(update, "Time", time);
    return;
  }
  TiXmlElement* update = ko::core::buildEnvelope(doc, true);
  update->SetAttribute("HasFailover", hasFailover ? 1 : 0);
  if (hasFailover) update->SetAttribute("FailoverState", failoverState);
  update->SetAttribute("HasFailback", hasFailover ? 1 : 0);
  update->SetAttribute("DownloadDir", downloadDir);
  update->SetAttribute("Timeout", timeout);
  if (status == ko::core::PENDING_UPDATE) {
    update->SetAttribute("PendingUpdate", "1");
  } else if (failoverStatus == ko::core::DECOMMISSION_PENDING) {
    update->SetAttribute("PendingFailover", failoverStatus);
  }
}

void UpdateService::emitState() {
  TiXmlDocument doc;
  buildStateDocument(doc, false);
  std::string error;
  if (!saveDocument(doc, kStateFileName, &error)) {
    log(ko::core::kLogStepFailed, "Could not save %s: %s", kStateFileName, error.c_str());
  }
  std::string packageType;
  {
    MutexLock lock(&stateMutex);
    packageType = PackageType;
  }
  if (TiXmlElement* update = doc.RootElement() ? doc.RootElement()->FirstChildElement("Update") : nullptr) {
    update->SetAttribute("PackageType", packageType);
  }
  ko::core::sendXmlToHost(ko::core::kTargetState, ko::core::printCompact(doc));
}

void UpdateService::emitUpdateStatus(int32_t code) {
  {
    MutexLock lock(&stateMutex);
    Status = code;
    Time = static_cast<uint32_t>(std::time(nullptr));
  }
  log(kLogProgress, "Emit update status: (%s)", ko::core::statusCodeName(code));
  TiXmlDocument doc;
  buildStateDocument(doc, true);
  sendStatus(doc);
}

void UpdateService::emitFailoverStatus(int32_t code, TimeStamp when) {
  TiXmlDocument doc;
  buildFailoverStatusDocument(doc, code, when);
  log(kLogProgress, "Emit failover status: %s (%d)", ko::core::statusCodeName(code), code);
  sendStatus(doc);
}

void UpdateService::emitFailbackStatus(int32_t status, TimeStamp when, uint32_t port) {
  TiXmlDocument doc;
  buildFailbackStatusDocument(doc, status, when, port);
  log(kLogProgress, "Emit Failback status: %s (%d)", ko::core::agentStatusName(status), status);
  sendStatus(doc);
}

void UpdateService::emitSpareResetStatus(int32_t status) {
  TiXmlDocument doc;
  buildSpareResetStatusDocument(doc, status, stampTime());
  log(kLogProgress, "Emit Spare Reset status: %s (%d)", ko::core::agentStatusName(status), status);
  sendStatus(doc);
}

namespace {

// Reports keep their last stamp in Time and Milliseconds; a Time of 0 means
// "never stamped", so a real stamp is never 0.
TimeStamp nonZeroStamp() {
  TimeStamp now = stampTime();
  if (now.seconds == 0) now = stampTime();
  return now;
}

template <typename Report>
void restamp(Report& report, TimeStamp now, bool onlyIfNeverStamped) {
  if (onlyIfNeverStamped && report.Time != 0) return;
  report.Time = now.seconds;
  report.Milliseconds = now.milliseconds;
}

void emitFailbackReport(UpdateService& service, bool onlyIfNeverStamped, const uint32_t* port) {
  const TimeStamp now = nonZeroStamp();
  FailbackReportRecord report;
  {
    MutexLock lock(&service.stateMutex);
    restamp(service.FailbackReport, now, onlyIfNeverStamped);
    if (port != nullptr) service.FailbackReport.Port = *port;
    report = service.FailbackReport;
  }
  service.emitFailbackStatus(report.FailbackStatus, TimeStamp{report.Time, report.Milliseconds}, report.Port);
}

void emitFailoverReport(UpdateService& service, bool onlyIfNeverStamped) {
  const TimeStamp now = nonZeroStamp();
  FailoverReportRecord report;
  {
    MutexLock lock(&service.stateMutex);
    restamp(service.FailoverReport, now, onlyIfNeverStamped);
    report = service.FailoverReport;
  }
  service.emitFailoverStatus(report.FailoverState, TimeStamp{report.Time, report.Milliseconds});
}

}  // namespace

void emitFailbackReport(UpdateService& service, uint32_t port) { emitFailbackReport(service, false, &port); }

void emitFailbackReportUnchanged(UpdateService& service) { emitFailbackReport(service, true, nullptr); }

void emitFailoverReportRestamped(UpdateService& service) { emitFailoverReport(service, false); }

void emitFailoverReportUnchanged(UpdateService& service) { emitFailoverReport(service, true); }

}  // namespace sorvik
