#pragma once

#include <string>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform {

// Opening by names that others may exchange at any time. Whoever checks what is opened here checks
// what it uses. `flags` are those of open(2), and O_CLOEXEC is added.

/// Whether an opening may wait for a file system, which need not answer. One that may not is done
/// from what the kernel has in memory, or fails with EAGAIN.
enum class Wait { Allowed, Never };

/// Opens what a path leads to from the directory `dirfd` (borrowed), as long as nothing on the way
/// leads out of that directory: no "..", no absolute path, no symbolic link, and no other mount, so
/// that it answers as the directory does. Errors: the system's; EXDEV when the way leads out, ELOOP
/// when it goes through a link of the kernel's own (as in /proc) or through too many. Where the
/// kernel cannot watch the way (no openat2), no symbolic link is followed at all: EXDEV.
Result<UniqueFd> openBeneath(int dirfd, const std::string& path, int flags,
                             Wait wait = Wait::Allowed);

/// Opens a path on which no symbolic link lies: an absolute one, or one beneath the directory
/// `dirfd` (borrowed). Errors: the system's; ELOOP or ENOTDIR for a symbolic link, EXDEV or ELOOP
/// for a ".." that leads out of the directory.
Result<UniqueFd> openWithoutLinks(int dirfd, const std::string& path, int flags,
                                  Wait wait = Wait::Allowed);

/// Whether an error says that the way led out of the directory.
bool leadsOutside(const Error& error);

}  // namespace platform
