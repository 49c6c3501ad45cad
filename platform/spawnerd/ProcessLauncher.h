#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <string>

#include "platform/spawnerd/Launcher.h"
#include "platform/spawnerd/SpawnService.h"

namespace platform::spawnerd {

/// The launcher that starts processes; see `makeLauncher`.
class ProcessLauncher final : public Launcher {
  public:
    ProcessLauncher(const Directories& directories, const std::string& daemonService,
                    std::shared_ptr<RunLoop> loop, LauncherSettings settings = nullptr,
                    std::function<void()> failed = nullptr, Programs programs = {});

    Result<std::shared_ptr<const CheckedService>> checkExternalService(
        const ExternalService& service, const Dictionary& overlay) override;
    std::shared_ptr<const CheckedService> renewExternalService(const CheckedService& checked,
                                                               const Dictionary& overlay) override;
    int grantExternalService(const AuditToken& host,
                             const std::shared_ptr<const CheckedService>& service) override;
    void removeExternalServices(const std::string& bundlePath) override;
    std::unique_ptr<WorkMarker> beginOutstandingWork() override;
    void terminatePlugInInstances(const std::string& bundleIdentifier,
                                  const std::string& bundleVersion, const KnownDirectory& bundle,
                                  SerialQueue& queue, Completion completion) override;
    void shutDown(std::function<void()> completion) override;

    /// How many work markers live. From any thread.
    int outstandingWork() const { return *outstanding_; }

  private:
    const Directories directories_;
    const std::shared_ptr<std::atomic<int>> outstanding_;
    const std::shared_ptr<SpawnService> service_;
};

}  // namespace platform::spawnerd
