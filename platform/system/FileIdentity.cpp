#include "platform/system/FileIdentity.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <array>
#include <cstdint>
#include <cstring>

namespace platform {

namespace {

using Stored = std::array<std::uint64_t, 2>;

}  // namespace

FileIdentity FileIdentity::of(const struct stat& status) {
    return {status.st_dev, status.st_ino};
}

FileIdentity FileIdentity::at(int dirfd, const char* path) {
    struct stat status;
    if (::fstatat(dirfd, path, &status, AT_SYMLINK_NOFOLLOW) != 0) return {};
    return of(status);
}

std::optional<FileIdentity> FileIdentity::ofOpen(int fd, mode_t* type) {
    struct statx status;
    if (::statx(fd, "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC, STATX_TYPE | STATX_INO, &status) != 0)
        return std::nullopt;
    if (type) *type = status.stx_mode & S_IFMT;
    return FileIdentity{::makedev(status.stx_dev_major, status.stx_dev_minor), status.stx_ino};
}

void FileIdentity::appendTo(std::string& bytes) const {
    static_assert(sizeof(Stored) == kStoredSize);
    const Stored stored{device, inode};
    bytes.append(reinterpret_cast<const char*>(stored.data()), sizeof stored);
}

FileIdentity FileIdentity::from(std::string_view bytes) {
    Stored stored{};
    if (bytes.size() < sizeof stored) return {};
    std::memcpy(stored.data(), bytes.data(), sizeof stored);
    return {stored[0], stored[1]};
}

}  // namespace platform
