#include "platform/spawnerd/ProcessLauncher.h"

#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/threads/SerialQueue.h"

namespace platform {

namespace spawnerd {

namespace {

class CountedMarker final : public Launcher::WorkMarker {
  public:
    explicit CountedMarker(std::shared_ptr<std::atomic<int>> count) : count_(std::move(count)) {
        ++*count_;
    }
    ~CountedMarker() override { --*count_; }

  private:
    const std::shared_ptr<std::atomic<int>> count_;
};

struct Checked final : CheckedService {
    explicit Checked(Grant made) : grant(std::move(made)) {}
    const Grant grant;
};

}  // namespace

ProcessLauncher::ProcessLauncher(const Directories& directories, const std::string& daemonService,
                                 std::shared_ptr<RunLoop> loop, LauncherSettings settings,
                                 std::function<void()> failed, Programs programs)
    : directories_(directories),
      outstanding_(std::make_shared<std::atomic<int>>(0)),
      service_(SpawnService::make(directories, daemonService, std::move(loop), std::move(settings),
                                  std::move(failed), std::move(programs))) {
    // Not before the daemon runs: only then does its name, and so this one, belong to it.
    service_->queue().async([weak = std::weak_ptr(service_)] {
        if (auto service = weak.lock()) service->listen();
    });
}

Result<std::shared_ptr<const CheckedService>> ProcessLauncher::checkExternalService(
    const ExternalService& service, const Dictionary& overlay) {
    auto grant = Grant::make(directories_, service, overlay);
    if (grant) return std::shared_ptr<const CheckedService>(new Checked(*std::move(grant)));
    EVLOG_INFO(ops(), "{} cannot be started as a plug-in: {}", service.executable, grant.error());
    return grant.error();
}

std::shared_ptr<const CheckedService> ProcessLauncher::renewExternalService(
    const CheckedService& checked, const Dictionary& overlay) {
    auto grant = static_cast<const Checked&>(checked).grant.renewed(overlay);
    return grant ? std::make_shared<const Checked>(*std::move(grant)) : nullptr;
}

int ProcessLauncher::grantExternalService(const AuditToken& host,
                                          const std::shared_ptr<const CheckedService>& service) {
    return service_->grant(host, static_cast<const Checked&>(*service).grant);
}

void ProcessLauncher::removeExternalServices(const std::string& bundlePath) {
    service_->takeBack(bundlePath);
}

std::unique_ptr<Launcher::WorkMarker> ProcessLauncher::beginOutstandingWork() {
    return std::make_unique<CountedMarker>(outstanding_);
}

void ProcessLauncher::terminatePlugInInstances(const std::string& bundleIdentifier,
                                               const std::string& bundleVersion,
                                               const KnownDirectory& bundle, SerialQueue& queue,
                                               Completion completion) {
    const auto isOfPlugIn = [=](const Grant& grant) {
        return grant.bundleIdentifier == bundleIdentifier && grant.bundleVersion == bundleVersion &&
               grant.bundle == bundle;
    };
    service_->terminate(isOfPlugIn, [&queue, completion = std::move(completion)](bool found) {
        queue.async([completion, found] { completion(found ? kDone : kNoneOnRecord); });
    });
}

void ProcessLauncher::shutDown(std::function<void()> completion) {
    service_->queue().async([service = service_, completion = std::move(completion)]() mutable {
        service->shutDown(std::move(completion));
    });
}

}  // namespace spawnerd

std::unique_ptr<Launcher> makeLauncher(const Directories& directories,
                                       const std::string& daemonService,
                                       std::shared_ptr<RunLoop> loop, LauncherSettings settings,
                                       std::function<void()> failed) {
    return std::make_unique<spawnerd::ProcessLauncher>(directories, daemonService, std::move(loop),
                                                       std::move(settings), std::move(failed));
}

}  // namespace platform
