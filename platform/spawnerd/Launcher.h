#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/lum/AuditToken.h"
#include "platform/system/KnownDirectory.h"
#include "platform/values/Value.h"

namespace platform {

class RunLoop;
class SerialQueue;
struct Directories;

/// What a plug-in's record says of what a host may start. A plain value.
struct ExternalService {
    std::string executable;  // the path of a file in the bundle
    KnownDirectory bundle;
    std::string container;  // the path of the plug-in's data container; empty when it has none
};

/// A service that a launcher has looked at and found fit to be started. Immutable.
class CheckedService {
  public:
    virtual ~CheckedService() = default;
};

/// Starts plug-ins and knows the instances that run.
class Launcher {
  public:
    /// How an order went: one of those below, or another number for a failure.
    using Status = int;
    static constexpr Status kDone = 0;
    static constexpr Status kNoneOnRecord = 3;
    using Completion = std::function<void(Status)>;

    virtual ~Launcher() = default;

    /// Looks at an executable that is to be started as a service, under the settings of an
    /// activation overlay: {"LUMService": {…}, "QFBundlePackageType": "LUM!"}. Reads the bundle,
    /// and so waits for its file system. Errors, all "POSIX": ESTALE, ELOOP, ENOTDIR, ... the
    /// bundle is not in its place; ENOENT, EACCES, EXDEV, ... the executable does not exist, cannot
    /// be run or lies outside the bundle; EINVAL the overlay is no good, or the bundle has no
    /// identifier; E2BIG its environment is too large; ENOTDIR, EPERM or EINVAL the data container
    /// is no directory of this user's own below the containers. From any thread.
    virtual Result<std::shared_ptr<const CheckedService>> checkExternalService(
        const ExternalService& service, const Dictionary& overlay) = 0;
    /// What was checked, under another overlay: at once, without waiting for anybody, while all of
    /// it is on disk as it was then. Null when that cannot be told, or something is different: only
    /// checking it anew tells what comes of that. From any thread.
    virtual std::shared_ptr<const CheckedService> renewExternalService(
        const CheckedService& checked, const Dictionary& overlay) = 0;
    /// Lets a process start what this launcher has looked at. Holds for that very process and as
    /// long as it lives, and for that very bundle: an instance is started only while the bundle's
    /// path leads to it. The last one for an executable counts. Answers 0, or the number of a
    /// system error: ESRCH the process is gone; ENOSPC it has too many such rights. Waits for
    /// nobody. From any thread.
    virtual int grantExternalService(const AuditToken& host,
                                     const std::shared_ptr<const CheckedService>& service) = 0;
    /// Both, one after the other; answers 0, or the error's number.
    int addExternalService(const AuditToken& host, const ExternalService& service,
                           const Dictionary& overlay) {
        const auto checked = checkExternalService(service, overlay);
        return checked ? grantExternalService(host, *checked) : checked.error().code;
    }
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
    /// Ends the running instances of the plug-in with a bundle identifier and a bundle version that
    /// were started from `bundle`, at once and without asking them, takes back what lets hosts
    /// start it, and runs `completion` on `queue`, which must live until then, once the instances
    /// are gone. Returns at once. From any thread.
    virtual void terminatePlugInInstances(const std::string& bundleIdentifier,
                                          const std::string& bundleVersion,
                                          const KnownDirectory& bundle, SerialQueue& queue,
                                          Completion completion) = 0;
    /// Ends all running instances, as above, and starts no more, for good. Runs `completion` on the
    /// loop's thread once they are gone, or two seconds have passed. From any thread.
    virtual void shutDown(std::function<void()> completion) = 0;
};

/// What the administrator says of the limits of instances, by key (docs/security.md): as it is at
/// that moment. Asked on the loop's thread, at every start.
using LauncherSettings = std::function<std::optional<Value>(const std::string& key)>;

/// The launcher of the daemon of a service name: it starts plug-ins under bubblewrap, for the hosts
/// that it was told of, which ask for it on a service of its own (docs/protocol.md). It forks a
/// process that its instances belong to, so it is best made before there are threads. It listens
/// from the loop's first turn; when it cannot, an error line says so and nothing is ever started.
/// `failed` is called on the loop, once, should that process end before the launcher: with it its
/// instances have ended, and no more can be started. An error line has said so.
///
/// It goes where `loop` runs or while it does not run, and takes its instances along.
std::unique_ptr<Launcher> makeLauncher(const Directories& directories,
                                       const std::string& daemonService,
                                       std::shared_ptr<RunLoop> loop, LauncherSettings settings,
                                       std::function<void()> failed);

}  // namespace platform
