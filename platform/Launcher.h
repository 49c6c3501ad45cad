#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/Value.h"
#include "platform/lum/AuditToken.h"

namespace platform {

class RunLoop;
class SerialQueue;
struct Directories;

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
    /// a system error: ENOENT, EACCES, ... the executable does not exist or cannot be run; EINVAL
    /// the overlay is no good, or there is no bundle with an identifier around the executable;
    /// E2BIG its environment is too large; ENOTDIR or EPERM the plug-in's data container is no
    /// directory of this user's own; ESRCH the process is gone; ENOSPC it has too many such rights.
    /// From any thread.
    virtual int addExternalService(const AuditToken& host, const std::string& executable,
                                   const Dictionary& overlay) = 0;
    /// Takes back what lets hosts start the executables of a bundle, by its canonical path. From
    /// then on none is started unless it is added anew; instances that run go on. From any thread.
    virtual void removeExternalServices(const std::string& bundlePath) = 0;

    /// Marks work that is not done as long as the marker lives; the daemon is not to be stopped for
    /// idleness meanwhile. From any thread.
    class WorkMarker {
      public:
        virtual ~WorkMarker() = default;
    };
    virtual std::unique_ptr<WorkMarker> beginOutstandingWork() = 0;
    /// Ends the running instances of the plug-in with a bundle identifier and a bundle version, at
    /// once and without asking them, takes back what lets hosts start it, and runs `completion` on
    /// `queue`, which must live until then, once the instances are gone. Returns at once. From any
    /// thread.
    virtual void terminatePlugInInstances(const std::string& bundleIdentifier,
                                          const std::string& bundleVersion, SerialQueue& queue,
                                          Completion completion) = 0;
};

/// The launcher of the daemon of a service name: it starts plug-ins under bubblewrap, for the hosts
/// that it was told of, which ask for it on a service of its own (docs/protocol.md). Made on the
/// thread that runs `loop`, to which its instances are tied: they end with that thread. It listens
/// from the loop's first turn; when it cannot, an error line says so and nothing is ever started.
///
/// It goes where `loop` runs or while it does not run, and takes its instances along.
std::unique_ptr<Launcher> makeLauncher(const Directories& directories,
                                       const std::string& daemonService,
                                       std::shared_ptr<RunLoop> loop);

}  // namespace platform
