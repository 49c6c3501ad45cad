#include "platform/system/KnownDirectory.h"

#include <fcntl.h>

#include <cerrno>

namespace platform {

Result<UniqueFd> KnownDirectory::open(Wait wait) const {
    if (!path.starts_with('/')) return Error::posix(EINVAL, path);
    Result<UniqueFd> directory = openWithoutLinks(AT_FDCWD, path, O_PATH | O_DIRECTORY, wait);
    if (!directory) return directory;
    const auto found = FileIdentity::ofOpen(directory->get());
    if (!found) return Error::posix(errno, path);
    if (*found != identity) return Error::posix(ESTALE, path);
    return directory;
}

}  // namespace platform
