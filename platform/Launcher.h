#pragma once

#include <functional>
#include <memory>
#include <string>

namespace platform {

class SerialQueue;

/// Starts plug-ins and knows the instances that run.
class Launcher {
  public:
    /// How an order went: one of those below, or another number for a failure.
    using Status = int;
    static constexpr Status kDone = 0;
    static constexpr Status kNoneOnRecord = 3;
    using Completion = std::function<void(Status)>;

    virtual ~Launcher() = default;
    /// Ends the running instances of the plug-in with a bundle identifier and a bundle version, and
    /// runs `completion` on `queue`, which must live until then, once they are gone. Returns at
    /// once. From any thread.
    virtual void terminatePlugInInstances(const std::string& bundleIdentifier,
                                          const std::string& bundleVersion, SerialQueue& queue,
                                          Completion completion) = 0;
};

/// The launcher of this process. It has started nothing, so there is never anything on record.
std::unique_ptr<Launcher> makeLauncher();

}  // namespace platform
