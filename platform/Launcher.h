#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/Value.h"
#include "platform/lum/AuditToken.h"

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

    /// Lets a process start an executable as a service, under the settings of an activation
    /// overlay: {"LUMService": {…}, "QFBundlePackageType": "LUM!"}. Holds for that very process and
    /// as long as it lives; the last overlay for an executable counts. Answers 0, or the number of
    /// a system error: the executable does not exist or cannot be run, the overlay is no good, the
    /// process is gone. From any thread.
    virtual int addExternalService(const AuditToken& host, const std::string& executable,
                                   const Dictionary& overlay) = 0;

    /// Marks work that is not done as long as the marker lives; the daemon is not to be stopped for
    /// idleness meanwhile. From any thread.
    class WorkMarker {
      public:
        virtual ~WorkMarker() = default;
    };
    virtual std::unique_ptr<WorkMarker> beginOutstandingWork() = 0;
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
