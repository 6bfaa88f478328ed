// The six functions the host calls. Each forwards to the service object and
// never lets an exception reach the host; all return 0.

#include <atomic>
#include <cstdint>
#include <exception>

#include "Sorvik/ipc/client.h"
#include "Sorvik/platform/export.h"
#include "Sorvik/plugin/host_callback.h"
#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/host_records.h"
#include "Sorvik/plugin/module.h"
#include "Sorvik/plugin/plugin_steps.h"
#include "Sorvik/plugin/xml_envelope.h"
#include "Sorvik/service/update_service.h"

// The build sets the version of each plug-in library it makes.
#ifndef SORVIK_MODULE_VERSION
#error "SORVIK_MODULE_VERSION must be defined"
#endif

namespace {

using ko::core::kLogInternal;

// Written only by Load and Unload, which the host never overlaps with other
// calls; atomic so that readers on other threads see a complete pointer.
std::atomic<sorvik::UpdateService*> theService{nullptr};

bool sendPacket(const unsigned char* bytes, uint64_t length) {
  if (ko::core::hostCallback() == nullptr) return false;
  ko::core::HostMessage message = ko::core::HostMessage::make(
      ko::core::kModuleId, ko::core::kTargetChildProcess, ko::core::kTypeChildProcessPacket, bytes, length);
  return ko::core::callHost(message) == 0;
}

template <typename Body>
int32_t guarded(const char* entry, Body body) {
  try {
    body();
  } catch (const std::exception& e) {
    ko::core::log(kLogInternal, "Unhandled exception in %s: %s", entry, e.what());
  } catch (...) {
    ko::core::log(kLogInternal, "Unhandled exception in %s", entry);
  }
  return 0;
}

}  // namespace

extern "C" {

SORVIK_EXPORT int32_t Load(void* parmsIn, void* parmsOut) {
  return guarded("Load", [&] {
    ko::core::setHostCallback(ko::core::readHostCallback(parmsIn));
    if (theService.load() == nullptr) {
      theService.store(new sorvik::UpdateService(&sorvik::pluginSteps()));
    }
    ko::core::writeLoadParmsOut(parmsOut);
    // A library the loader could not drop keeps its globals across a reload;
    // a new load must not inherit the previous Close.
    ko::ipc::shutdown(false);
    ko::ipc::set_transport(ko::core::kModuleId, &sendPacket);
  });
}

SORVIK_EXPORT int32_t Open() {
  return guarded("Open", [] { ko::core::announceModule(SORVIK_MODULE_VERSION); });
}

SORVIK_EXPORT int32_t IOCTL(void* record) {
  return guarded("IOCTL", [&] {
    sorvik::UpdateService* service = theService.load();
    if (service == nullptr) return;
    const ko::core::IoctlRequest request = ko::core::readIoctlRecord(record);
    if (request.data == nullptr && request.length != 0) return;
    switch (request.code) {
      case 1:
        service->runWorker();
        break;
      case 2:
        service->processConfiguration(request.data, request.length);
        break;
      case 4:
        if (request.length >= 16) ko::ipc::receive(request.data, request.length);
        break;
      default:
        break;
    }
  });
}

SORVIK_EXPORT int32_t Write(void* record) {
  return guarded("Write", [&] {
    sorvik::UpdateService* service = theService.load();
    if (service == nullptr) return;
    const ko::core::WriteRequest request = ko::core::readWriteRecord(record);
    if (request.data == nullptr && request.length != 0) return;
    service->processCommand(request.data, request.length);
  });
}

SORVIK_EXPORT int32_t Close() {
  return guarded("Close", [] {
    sorvik::UpdateService* service = theService.load();
    if (service != nullptr) service->requestStop();
    ko::ipc::shutdown(true);
  });
}

SORVIK_EXPORT int32_t Unload() {
  return guarded("Unload", [] {
    delete theService.exchange(nullptr);
    ko::core::setHostCallback(nullptr);
  });
}

}  // extern "C"
