#include "platform/Launcher.h"

#include <cerrno>

#include "platform/SerialQueue.h"

namespace platform {

namespace {

class ProcessLauncher final : public Launcher {
  public:
    int addExternalService(const AuditToken&, const std::string&, const Dictionary&) override {
        return ENOTSUP;
    }
    std::unique_ptr<WorkMarker> beginOutstandingWork() override {
        return std::make_unique<WorkMarker>();
    }
    void terminatePlugInInstances(const std::string&, const std::string&, SerialQueue& queue,
                                  Completion completion) override {
        queue.async([completion = std::move(completion)] { completion(kNoneOnRecord); });
    }
};

}  // namespace

std::unique_ptr<Launcher> makeLauncher() {
    return std::make_unique<ProcessLauncher>();
}

}  // namespace platform
