#pragma once

#include <memory>
#include <string>

#include "platform/Error.h"
#include "platform/lum/AuditToken.h"

namespace platform {

class RunLoop;
struct Directories;

/// The sandbox service.
class Sandbox {
  public:
    virtual ~Sandbox() = default;

    /// Whether a process runs in a sandbox. From any thread.
    virtual bool isSandboxed(const AuditToken& token) = 0;

    /// A token that lets whoever presents it (platform/SandboxExtension.h) read the file, or the
    /// directory and all in it, at a path, which is taken in its canonical form. Good as long as
    /// this service, and as long as that very file lies there. Error: the system's, in the domain
    /// "POSIX"; EINVAL for what is neither a file nor a directory. From any thread.
    virtual Result<std::string> issueReadExtension(const std::string& path) = 0;
};

/// Whether a process runs in a sandbox: its user, mount or pid namespace differs from ours or
/// cannot be read, it has a seccomp filter and we have none, or its root has a `.flatpak-info`. A
/// process that is gone counts as sandboxed. From any thread.
bool isSandboxed(const AuditToken& token);

/// The sandbox as this kernel has it. The tokens are those of the service of that name; they are
/// traded for access by a service beside it, on `loop`, which must outlive this object. When that
/// cannot be made, an error line says so and no tokens are issued. To be destroyed as
/// `SandboxBroker`.
std::unique_ptr<Sandbox> makeKernelSandbox(const Directories& directories,
                                           const std::string& serviceName, RunLoop& loop);

}  // namespace platform
