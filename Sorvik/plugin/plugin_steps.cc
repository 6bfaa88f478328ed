#include "Sorvik/plugin/plugin_steps.h"

#include "Sorvik/failover/decommission.h"
#include "Sorvik/failover/failback_agent.h"
#include "Sorvik/update/checksum.h"
#include "Sorvik/update/download.h"
#include "Sorvik/update/install.h"
#include "Sorvik/update/location.h"

namespace sorvik {
namespace {

class PluginSteps final : public WorkerSteps {
 public:
  bool DownloadBundle(UpdateService& service, const std::string& location, std::string& bundlePath) override {
    return sorvik::DownloadBundle(service, location, bundlePath);
  }
  bool VerifyBundleChecksum(UpdateService& service, const std::string& bundlePath,
                            const std::string& checksum) override {
    return sorvik::VerifyBundleChecksum(service, bundlePath, checksum);
  }
  void InstallBundle(UpdateService& service, const std::string& bundlePath) override {
    sorvik::InstallBundle(service, bundlePath);
  }
  void Decommission(UpdateService& service) override { sorvik::Decommission(service); }
  void StartAgent(UpdateService& service, const std::string& drives, AgentRequestRecord& request) override {
    sorvik::StartAgent(service, drives, request);
  }
  void StartReset(UpdateService& service, const std::string& drives, AgentRequestRecord& request) override {
    sorvik::StartReset(service, drives, request);
  }
  std::string LocationForLog(const std::string& location) override { return redactLocation(location); }
  void StopAgent(UpdateService& service, std::shared_ptr<ko::ipc::client>& handle, uint32_t exitCode) override {
    sorvik::StopAgent(service, handle, exitCode);
  }
};

}  // namespace

WorkerSteps& pluginSteps() {
  static PluginSteps steps;
  return steps;
}

}  // namespace sorvik
