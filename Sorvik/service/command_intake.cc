#include <tinyxml.h>

#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/module.h"
#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/plugin/xml_envelope.h"
#include "Sorvik/service/location_text.h"
#include "Sorvik/service/update_service.h"

namespace sorvik {
namespace {

using ko::core::kLogProgress;
using ko::core::kLogRejected;
using ko::core::log;
using ko::core::readIntAttribute;

constexpr uint32_t kDefaultAgentPort = 7066;
// Handed to a reset agent when the host sent no token; the reset mode does
// not authenticate anyone.
constexpr const char kResetPlaceholderToken[] = "plinkowarb";

bool updateUnderWay(int32_t status) {
  return status == ko::core::BUNDLE_DOWNLOAD || status == ko::core::BUNDLE_INSTALL ||
         status == ko::core::PENDING_UPDATE || status == ko::core::BUNDLE_FILE;
}

bool isModuleElement(const TiXmlElement& element) {
  int32_t id = 0;
  return readIntAttribute(&element, "ID", &id) && id == static_cast<int32_t>(ko::core::kModuleId);
}

}  // namespace

void UpdateService::processCommand(const unsigned char* data, size_t length) {
  if (data == nullptr || length == 0) return;
  int32_t failoverStatus = 0;
  int32_t status = 0;
  {
    MutexLock lock(&stateMutex);
    failoverStatus = FailoverReport.FailoverStatus;
    status = Status;
  }
  // While an update or a decommission runs, every command is dropped.
  if (updateUnderWay(status) || failoverStatus == ko::core::DECOMMISSION_PENDING) return;

  TiXmlDocument doc;
  if (!ko::core::parseHostDocument(data, length, &doc)) return;
  const TiXmlElement* root = doc.FirstChildElement("Qora");
  if (root == nullptr) return;

  for (const TiXmlElement* element = root->FirstChildElement("Update"); element != nullptr;
       element = element->NextSiblingElement("Update")) {
    if (!isModuleElement(*element)) continue;
    const char* location = element->Attribute("Location");
    if (location == nullptr) {
      processAgentCommand(*element);
      continue;
    }
    const char* checksumText = element->Attribute("Checksum");
    const std::string checksum = checksumText != nullptr ? checksumText : "";
    if (*location == '\0') {
      log(kLogProgress, "Ignore update request with empty location.");
      continue;
    }
    log(kLogProgress, "Update to %s", (steps_ != nullptr ? steps_->LocationForLog(location) : locationForLog(location)).c_str());
    log(kLogProgress, "Update checksum %s", checksum.c_str());
    {
      MutexLock lock(&stateMutex);
      Location = location;
      Checksum = checksum;
    }
    wakeCondition.signalAll();
  }
}

void UpdateService::processAgentCommand(const TiXmlElement& element) {
  int32_t run = 0;
  if (!readIntAttribute(&element, "FailbackAgentRun", &run)) return;

  int32_t action = action_stop_agent;
  AgentRequestRecord request;
  if (run == 1) {
    std::string drives;
    int32_t failoverState = 0;
    {
      MutexLock lock(&stateMutex);
      drives = storageDrives;
      failoverState = FailoverReport.FailoverState;
    }
    if (drives.empty()) {
      log(kLogRejected, "No drives were found in storage config. Failback will not be possible");
      emitFailbackStatus(ko::core::AGENT_ERROR, stampTime(), 0);
      return;
    }
    if (failoverState != ko::core::RESERVE_SPARE) {
      log(kLogRejected, "Received request for data restore / reset spare.  Ignoring this request: current state %s",
          ko::core::statusCodeName(failoverState));
      emitFailbackStatus(ko::core::AGENT_ERROR, stampTime(), 0);
      return;
    }
    int32_t spareReset = 0;
    action = readIntAttribute(&element, "SpareReset", &spareReset) ? action_start_reset : action_start_agent;
    if (!readIntAttribute(&element, "FailoverStart", &request.FailoverStart) || request.FailoverStart == 0) return;
    if (!readIntAttribute(&element, "FailoverEnd", &request.FailoverEnd) || request.FailoverEnd == 0) return;
    if (const char* token = element.Attribute("PasswordToken")) request.PasswordToken = token;
    // The token travels to the agent as one line of its standard input; a
    // line break would let the sender feed the agent further lines.
    if (request.PasswordToken.find_first_of("\r\n") != std::string::npos) {
      log(kLogRejected, "PasswordToken for %s contains a line break; request ignored", workerActionName(action));
      return;
    }
    if (request.PasswordToken.empty()) {
      if (action == action_start_agent) {
        log(kLogRejected, "PasswordToken is needed for command to %s", workerActionName(action));
        return;
      }
      request.PasswordToken = kResetPlaceholderToken;
    }
    int32_t port = 0;
    if (readIntAttribute(&element, "Port", &port)) {
      if (port >= 1 && port <= 65535) {
        request.Port = static_cast<uint32_t>(port);
      } else {
        log(kLogRejected, "Agent port %d out of range, using %u", port, kDefaultAgentPort);
        request.Port = kDefaultAgentPort;
      }
    }
  } else if (run != 0) {
    return;
  }

  log(kLogProgress, "Received request to %s ", workerActionName(action));
  {
    MutexLock lock(&stateMutex);
    postedAction = action;
    AgentRequest = request;
  }
  wakeCondition.signalAll();
}

}  // namespace sorvik
