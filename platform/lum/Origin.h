#pragma once

#include <sys/types.h>

#include <compare>

#include "platform/lum/AuditToken.h"

namespace platform {

/// Where a peer comes from, as far as sharing goes: what one origin takes, it takes from itself.
/// All processes of one pid namespace other than ours, a sandbox with what is nested in it, are
/// one; of the others, a process with those that it forked and that did not begin a session of
/// their own. A value.
struct Origin {
    dev_t device = 0;  // of the pid namespace; 0 for ours, and for one that cannot be told
    ino_t inode = 0;
    pid_t session = 0;  // 0 for a sandbox, and for a session that began outside our namespace

    bool isSandbox() const { return inode != 0; }

    static Origin of(const AuditToken& token);

    auto operator<=>(const Origin&) const = default;  // NOLINT(modernize-use-nullptr)
};

}  // namespace platform
