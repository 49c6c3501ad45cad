#include "platform/system/PinnedDirectory.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <string_view>

#include "platform/system/Files.h"

namespace platform {

FileTrust trustOf(const struct stat& status, uid_t user) {
    const bool othersMayWrite = status.st_mode & (S_IWGRP | S_IWOTH);
    const bool sticky = S_ISDIR(status.st_mode) && (status.st_mode & S_ISVTX);
    if (othersMayWrite && !sticky) return FileTrust::Others;
    if (status.st_uid == 0) return FileTrust::Root;
    return status.st_uid == user ? FileTrust::User : FileTrust::Others;
}

Result<std::string> PinnedFile::read(std::size_t limit) const {
    return readFile("/proc/self/fd/" + std::to_string(descriptor.get()), limit);
}

Result<PinnedDirectory> PinnedDirectory::open(const std::string& path, uid_t user) {
    PinnedDirectory result(path, user);
    std::string_view rest = path;
    std::string reached = "/";
    constexpr int kFlags = O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
    UniqueFd current(::open("/", kFlags));
    for (;;) {
        struct stat status;
        if (!current || ::fstat(current.get(), &status) != 0) return Error::posix(errno, reached);
        if (const FileTrust trust = trustOf(status, user);
            trust < result.trust_ || result.weakest_.empty()) {
            result.trust_ = trust;
            result.weakest_ = reached;
        }
        rest.remove_prefix(std::min(rest.find_first_not_of('/'), rest.size()));
        if (rest.empty()) break;
        const std::string name(rest.substr(0, rest.find('/')));
        rest.remove_prefix(name.size());
        reached = joinPath(reached, name);
        current = UniqueFd(::openat(current.get(), name.c_str(), kFlags));
    }
    result.descriptor_ = std::move(current);
    return result;
}

Result<PinnedFile> PinnedDirectory::file(const std::string& name) const {
    const std::string path = joinPath(path_, name);
    PinnedFile result;
    result.descriptor.reset(
        ::openat(descriptor_.get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    struct stat status;
    if (!result.descriptor || ::fstat(result.descriptor.get(), &status) != 0)
        return Error::posix(errno, path);
    if (!S_ISREG(status.st_mode)) return Error{"POSIX", EINVAL, path + ": not a regular file"};
    const FileTrust trust = trustOf(status, user_);
    result.trust = std::min(trust, trust_);
    result.weakest = trust < trust_ ? path : weakest_;
    return result;
}

}  // namespace platform
