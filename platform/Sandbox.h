#pragma once

#include <memory>
#include <string>

#include "platform/Error.h"
#include "platform/lum/AuditToken.h"

namespace platform {

/// The sandbox service.
class Sandbox {
  public:
    virtual ~Sandbox() = default;

    /// Whether the process runs in a sandbox: its user, mount or pid namespace differs from ours or
    /// cannot be read, it has a seccomp filter and we have none, or its root has a `.flatpak-info`.
    /// A process that is gone counts as sandboxed.
    virtual bool isSandboxed(const AuditToken& token) = 0;

    /// A token that lets whoever presents it (platform/SandboxExtension.h) read the file, or the
    /// directory and all in it, at a path, which is taken in its canonical form. Good as long as
    /// this service. Error: the system's, in the domain "POSIX".
    virtual Result<std::string> issueReadExtension(const std::string& path) = 0;
};

/// The sandbox as this kernel has it.
std::unique_ptr<Sandbox> makeKernelSandbox();

}  // namespace platform
