#pragma once

#include <memory>
#include <string>
#include <utility>

#include "platform/services/Assertions.h"
#include "platform/system/UniqueFd.h"

namespace zorvan {

/// A plug-in's view of the host that has started it: the connection, and who the plug-in is. A
/// plain object, for any one thread at a time.
///
///     auto host = ZRPlugInHost::take();
///     if (!host) return usage();
///     auto busy = host->beginBusy();   // until it goes
///     while ((count = read(host->connection(), buffer, sizeof buffer)) > 0) ...
class ZRPlugInHost {
  public:
    /// The host of this process; null when the process was not started as a plug-in, and after the
    /// first call. Changes the environment, so that what the plug-in starts does not think itself
    /// one: call it before there are other threads.
    static std::unique_ptr<ZRPlugInHost> take();

    /// A connected stream socket, blocking, that children do not inherit. Borrowed; -1 once taken.
    /// It reads as ended when the host closes its end; a plug-in should end then.
    int connection() const { return connection_.get(); }
    platform::UniqueFd takeConnection() { return std::move(connection_); }

    const std::string& bundleIdentifier() const { return bundleIdentifier_; }
    /// The service name of the daemon that issues the tokens which a `ZRSandboxExtension` takes.
    /// The daemon itself cannot be reached from a plug-in's sandbox.
    const std::string& serviceName() const { return serviceName_; }

    /// States that this plug-in is busy, as long as the assertion lives: nobody can take its
    /// application out of service meanwhile. Errors: the system's, in the domain "POSIX".
    platform::Result<platform::BusyAssertion> beginBusy() const;

  private:
    ZRPlugInHost(platform::UniqueFd connection, std::string bundleIdentifier,
                 std::string serviceName)
        : connection_(std::move(connection)),
          bundleIdentifier_(std::move(bundleIdentifier)),
          serviceName_(std::move(serviceName)) {}

    platform::UniqueFd connection_;
    std::string bundleIdentifier_;
    std::string serviceName_;
};

}  // namespace zorvan
