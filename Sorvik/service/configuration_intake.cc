#include "Sorvik/service/configuration_intake.h"

#include <new>
#include <regex>
#include <set>

#include <tinyxml.h>

#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/module.h"
#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/plugin/xml_envelope.h"
#include "Sorvik/service/status_documents.h"
#include "Sorvik/service/update_service.h"

namespace sorvik {
namespace {

using namespace ko::core;

constexpr int32_t kStorageId = 327680;

struct Transition {
  int32_t from;
  int32_t to;
  ConfigAction action;
};

// Every pair not listed is refused. COMMISSIONED -> RESERVE_SPARE is listed
// but depends on failover being available (see lookupTransition).
constexpr Transition kTransitions[] = {
    {PROTECTED, DECOMMISSION_FAILOVER, config_decommission},
    {PROTECTED, DECOMMISSION_ACTIVE, config_decommission},
    {DECOMMISSION_FAILOVER, PROTECTED, config_transition},
    {DECOMMISSION_FAILOVER, COMMISSIONED, config_transition},
    {DECOMMISSION_ACTIVE, PROTECTED, config_transition},
    {COMMISSIONED, PROTECTED, config_transition},
    {COMMISSIONED, DECOMMISSION_FAILOVER, config_decommission},
    {COMMISSIONED, RESERVE_SPARE, config_decommission},
    {RESERVE_SPARE, DECOMMISSION_FAILOVER, config_transition},
    {RESERVE_SPARE, COMMISSIONED, config_transition},
};

// Every run of backslashes becomes exactly two, the form the agent's
// command line parser expects for drive roots.
std::string doubleBackslashRuns(const std::string& text) {
  static const std::regex backslashRun("[\\\\]+", std::regex::ECMAScript);
  return std::regex_replace(text, backslashRun, "\\\\");
}

}  // namespace

ConfigAction lookupTransition(int32_t current, int32_t requested, bool hasFailover) {
  for (const Transition& t : kTransitions) {
    if (t.from != current || t.to != requested) continue;
    if (requested == RESERVE_SPARE && !hasFailover) return config_refuse;
    return t.action;
  }
  return config_refuse;
}

bool parseStorageDrives(const TiXmlElement* storage, std::string& drives) {
  try {
    std::set<std::string> names;
    for (const TiXmlElement* s = storage; s != nullptr; s = s->NextSiblingElement("Storage")) {
      int32_t id = 0;
      if (!readIntAttribute(s, "ID", &id) || id != kStorageId) return false;
      for (const TiXmlElement* drive = s->FirstChildElement("Drive"); drive != nullptr;
           drive = drive->NextSiblingElement("Drive")) {
        const char* name = drive->Attribute("Name");
        int32_t enabled = 0;
        if (name != nullptr && readIntAttribute(drive, "Enabled", &enabled) && enabled == 1) names.insert(name);
      }
    }
    std::string joined;
    for (const std::string& name : names) {
      if (!joined.empty() || name != *names.begin()) joined += ',';
      joined += name;
    }
    log(kLogProgress, "Found mounts: (%s)", joined.c_str());
    drives = doubleBackslashRuns(joined);
    return true;
  } catch (const std::exception&) {
    log(kLogRejected, "Failed to parse Storage config to extract Drives. Failback will not be possible");
    return false;
  }
}

void UpdateService::processConfiguration(const unsigned char* data, size_t length) {
  if (data == nullptr || length == 0) return;
  TiXmlDocument doc;
  // Also refuses documents nested deep enough to exhaust the parser's stack.
  if (!parseHostDocument(data, length, &doc)) return;
  const TiXmlElement* root = doc.FirstChildElement("Qora");
  if (root == nullptr) return;

  if (root->FirstChildElement("NetworkStorage") != nullptr) {
    bool cleared = false;
    {
      MutexLock lock(&stateMutex);
      cleared = HasFailover;
      HasFailover = false;
    }
    if (cleared) emitState();
    return;
  }

  int32_t delta = 0;
  if (!readIntAttribute(root, "Delta", &delta)) delta = 0;
  const TiXmlElement* storage = root->FirstChildElement("Storage");
  if (delta == 0 && storage != nullptr) {
    std::string drives;
    if (parseStorageDrives(storage, drives)) {
      log(kLogProgress, "Processed Storage config, new drives=(%s)", drives.c_str());
      MutexLock lock(&stateMutex);
      storageDrives = drives;
    }
  }

  const TiXmlElement* update = root->FirstChildElement("Update");
  int32_t id = 0;
  if (update == nullptr || !readIntAttribute(update, "ID", &id) || id != static_cast<int32_t>(kModuleId)) return;
  int32_t requested = 0;
  if (!readIntAttribute(update, "FailoverState", &requested)) {
    log(kLogProgress, "Ignoring request to update config: could not extract FailoverState");
    return;
  }

  int32_t current = 0;
  bool hasFailover = false;
  {
    MutexLock lock(&stateMutex);
    current = FailoverReport.FailoverState;
    hasFailover = HasFailover;
  }

  if (requested == current) {
    log(kLogProgress, "Ignoring request to change state %d, current state=%d", requested, current);
    emitFailoverReportUnchanged(*this);
    return;
  }

  switch (lookupTransition(current, requested, hasFailover)) {
    case config_decommission:
      if (requested == RESERVE_SPARE) log(kLogProgress, "Received request to reserve spare");
      log(kLogProgress, "Received decommissioning request with status %s (%d)", statusCodeName(requested), requested);
      {
        MutexLock lock(&stateMutex);
        FailoverReport.FailoverState = requested;
        decommissionRequested = true;
        postedAction = action_decommission;
      }
      wakeCondition.signalAll();
      return;
    case config_transition: {
      {
        MutexLock lock(&stateMutex);
        FailoverReport.FailoverState = requested;
        FailoverReport.FailoverStatus = requested;
      }
      log(kLogProgress, "Failover State transition from %s (%d) to %s (%d)", statusCodeName(current), current,
          statusCodeName(requested), requested);
      emitState();
      emitFailoverReportRestamped(*this);
      return;
    }
    case config_refuse:
      break;
  }
  log(kLogProgress, "State transition from %s (%d) to %s (%d) not possible", statusCodeName(current), current,
      statusCodeName(requested), requested);
  emitFailoverStatus(NOT_PERMITTED, stampTime());
}

}  // namespace sorvik
