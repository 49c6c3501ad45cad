#include "platform/Launcher.h"

#include "platform/SerialQueue.h"

namespace platform {

namespace {

class ProcessLauncher final : public Launcher {
  public:
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
