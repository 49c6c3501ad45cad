#pragma once

#include <string>

#include "platform/system/Error.h"
#include "platform/system/FileIdentity.h"
#include "platform/system/OpenBeneath.h"
#include "platform/system/UniqueFd.h"

namespace platform {

/// A directory as somebody came to know it: where it lay, and which one it was. A plain value.
struct KnownDirectory {
    std::string path;  // canonical
    FileIdentity identity;

    /// Opens it (O_PATH), if its path still is canonical and leads to that very directory. Errors:
    /// the system's; ELOOP or ENOTDIR when a symbolic link lies on the path, ESTALE when another
    /// directory does, EINVAL for a path that is not absolute, EAGAIN when it would have to wait
    /// and may not.
    Result<UniqueFd> open(Wait wait = Wait::Allowed) const;

    friend bool operator==(const KnownDirectory&, const KnownDirectory&) = default;
};

}  // namespace platform
