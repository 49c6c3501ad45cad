#pragma once

#include <string>

#include "platform/system/Error.h"
#include "platform/system/FileIdentity.h"
#include "platform/system/UniqueFd.h"

namespace platform {

/// A directory as somebody came to know it: where it lay, and which one it was. A plain value.
struct KnownDirectory {
    std::string path;  // canonical
    FileIdentity identity;

    /// Opens it (O_PATH), if its path still is canonical and leads to that very directory. Errors:
    /// the system's; ELOOP or ENOTDIR when a symbolic link lies on the path, ESTALE when another
    /// directory does, EINVAL for a path that is not absolute.
    Result<UniqueFd> open() const;

    friend bool operator==(const KnownDirectory&, const KnownDirectory&) = default;
};

/// Whether a path leads to that very directory, for who has thousands to look at: it takes one
/// look-up. A symbolic link that came to lie above it and leads there all the same is left to
/// `KnownDirectory::open`.
bool isInPlace(const std::string& path, const FileIdentity& identity);

}  // namespace platform
