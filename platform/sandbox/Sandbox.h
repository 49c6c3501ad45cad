#pragma once

#include <memory>
#include <string>

#include "platform/lum/AuditToken.h"
#include "platform/system/Error.h"
#include "platform/system/OpenBeneath.h"

namespace platform {

class RunLoop;
struct Directories;
struct KnownDirectory;

/// The sandbox service.
class Sandbox {
  public:
    virtual ~Sandbox() = default;

    /// Whether a process runs in a sandbox. From any thread.
    virtual bool isSandboxed(const AuditToken& token) = 0;
    /// Whether a process is confined in any way that shows, as the function of that name has it.
    /// From any thread.
    virtual bool isConfined(const AuditToken& token) = 0;

    /// A token that lets whoever presents it (platform/sandbox/SandboxExtension.h) read a file of a
    /// bundle, or a directory and all in it, by its name in there; "." is the bundle itself. Good
    /// as long as this service, and as long as that very file lies at its path. Error: the
    /// system's, in the domain "POSIX"; ESTALE, ELOOP, ENOTDIR, ... when the bundle's path leads to
    /// another directory, or through a symbolic link; EACCES when the name leads out of the bundle;
    /// EINVAL for what is neither a file nor a directory; EAGAIN when that would have to wait for
    /// the bundle's file system and may not. From any thread.
    virtual Result<std::string> issueReadExtension(const KnownDirectory& bundle,
                                                   const std::string& resource, Wait wait) = 0;
};

/// Whether a process runs in a sandbox: its user, mount or pid namespace differs from ours or
/// cannot be read, it has a seccomp filter and we have none, or its root has a `.flatpak-info`. A
/// process that is gone counts as sandboxed. From any thread.
bool isSandboxed(const AuditToken& token);

/// Whether a process is confined in any way that shows: it is sandboxed, or may gain no privileges
/// while we may. What confines itself by rules that do not show (Landlock) has to give those up
/// first. From any thread.
bool isConfined(const AuditToken& token);

/// The sandbox as this kernel has it. The tokens are those of the service of that name; they are
/// traded for access by a service beside it, on `loop`, which must outlive this object. When that
/// cannot be made, an error line says so and no tokens are issued. To be destroyed as
/// `SandboxBroker`.
std::unique_ptr<Sandbox> makeKernelSandbox(const Directories& directories,
                                           const std::string& serviceName, RunLoop& loop);

}  // namespace platform
