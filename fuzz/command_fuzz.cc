// Feeds arbitrary bytes to the command intake. The first byte sets the
// state the command meets: bits 0-1 the update status (0 none, 1 success,
// 2 downloading, 3 pending install), bit 2 RESERVE_SPARE instead of
// PROTECTED, bit 3 no storage drives, bit 4 a decommission under way. The
// rest is the document. Seeds in corpus/command start with a printable
// selector ('@': PROTECTED with drives, nothing under way; 'D': RESERVE_SPARE;
// 'L': RESERVE_SPARE without drives; 'B': a download under way).

#include <cstddef>
#include <cstdint>

#include "Sorvik/plugin/host_callback.h"
#include "Sorvik/plugin/status_codes.h"
#include "Sorvik/service/update_service.h"

namespace {

int32_t discardHostMessage(void* /*message*/, uint64_t /*reserved*/) { return 0; }

sorvik::UpdateService& service() {
  // The constructor only reads update.xml; the intake writes no file.
  static sorvik::UpdateService* instance = [] {
    ko::core::setHostCallback(&discardHostMessage);
    return new sorvik::UpdateService(nullptr);
  }();
  return *instance;
}

void applySelector(sorvik::UpdateService& s, uint8_t selector) {
  static const int32_t kStatuses[] = {ko::core::NO_UPDATE, ko::core::UPDATE_SUCCESS, ko::core::BUNDLE_DOWNLOAD,
                                      ko::core::PENDING_UPDATE};
  sorvik::MutexLock lock(&s.stateMutex);
  s.Status = kStatuses[selector & 3];
  s.FailoverReport.FailoverState = (selector & 4) ? ko::core::RESERVE_SPARE : ko::core::PROTECTED;
  s.storageDrives = (selector & 8) ? "" : "C:\\\\,D:\\\\";
  s.FailoverReport.FailoverStatus = (selector & 16) ? ko::core::DECOMMISSION_PENDING : 0;
  s.Location.clear();
  s.Checksum.clear();
  s.postedAction = sorvik::action_none;
  s.AgentRequest = sorvik::AgentRequestRecord{};
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  sorvik::UpdateService& s = service();
  applySelector(s, data[0]);
  s.processCommand(data + 1, size - 1);
  return 0;
}
