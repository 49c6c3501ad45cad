#pragma once

#include <sys/types.h>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform::spawnerd {

/// Namespaces of a sandbox: that of its network, and the user namespace with rights over it, to
/// which all of the sandbox belongs. Move-only.
struct SandboxNamespaces {
    UniqueFd network, user;

    /// Those of a process of ours in a sandbox, which lives, as `pidFd` tells. Error: the system's.
    static Result<SandboxNamespaces> of(pid_t process, const UniqueFd& pidFd);
};

}  // namespace platform::spawnerd
