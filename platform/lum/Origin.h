#pragma once

#include <sys/types.h>

#include <compare>

#include "platform/lum/AuditToken.h"

namespace platform {

/// Where a peer comes from, as far as sharing goes: what one origin takes, it takes from itself.
/// All processes of a sandbox, which has a user or a pid namespace within ours, are one, with what
/// is nested in it; of the others, a process with those that it forked and that did not begin a
/// session of their own. A value.
struct Origin {
    dev_t device = 0;  // of the sandbox's namespace; 0 for who is in none, or cannot be told
    ino_t inode = 0;
    pid_t session = 0;  // 0 for a sandbox, and for a session that began outside our namespace

    static Origin of(const AuditToken& token);

    auto operator<=>(const Origin&) const = default;  // NOLINT(modernize-use-nullptr)
};

}  // namespace platform
