#include "platform/system/KnownDirectory.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/system/OpenBeneath.h"

namespace platform {

Result<UniqueFd> KnownDirectory::open() const {
    if (!path.starts_with('/')) return Error::posix(EINVAL, path);
    Result<UniqueFd> directory = openWithoutLinks(AT_FDCWD, path, O_PATH | O_DIRECTORY);
    if (!directory) return directory;
    struct stat status;
    if (::fstat(directory->get(), &status) != 0) return Error::posix(errno, path);
    if (FileIdentity::of(status) != identity) return Error::posix(ESTALE, path);
    return directory;
}

bool isInPlace(const std::string& path, const FileIdentity& identity) {
    struct stat status;
    return ::lstat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode) &&
           FileIdentity::of(status) == identity;
}

}  // namespace platform
