#pragma once

#include <memory>

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
};

/// The sandbox as this kernel has it.
std::unique_ptr<Sandbox> makeKernelSandbox();

}  // namespace platform
