#include "platform/system/OpenBeneath.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <string_view>
#include <utility>

namespace platform {

namespace {

/// How often the kernel is asked again when something on the way was renamed meanwhile: somebody
/// who does that all the time is answered in the end.
constexpr int kMostAttempts = 64;

int openResolving(int dirfd, const std::string& path, int flags, std::uint64_t resolve, Wait wait) {
    open_how how{};
    how.flags = static_cast<std::uint64_t>(flags | O_CLOEXEC);
    how.resolve = resolve | (wait == Wait::Never ? RESOLVE_CACHED : 0);
    for (int attempt = wait == Wait::Never ? kMostAttempts : 0;; ++attempt) {
        const long fd = ::syscall(SYS_openat2, dirfd, path.c_str(), &how, sizeof how);
        const bool isDisturbed = fd < 0 && (errno == EAGAIN || errno == EINTR);
        if (!isDisturbed || attempt == kMostAttempts) return static_cast<int>(fd);
    }
}

/// Takes the first component off a path.
std::string nextComponent(std::string_view& rest) {
    rest.remove_prefix(std::min(rest.find_first_not_of('/'), rest.size()));
    std::string name(rest.substr(0, rest.find('/')));
    rest.remove_prefix(name.size());
    return name;
}

/// The number of the mount that something open lies on.
std::uint64_t mountOf(int fd) {
    struct statx status {};
    ::statx(fd, "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC, STATX_MNT_ID, &status);
    return status.stx_mnt_id;
}

/// One component at a time, none of which may be a symbolic link or ".." (errno `linkError`). -1,
/// with errno, on failure.
int openByComponents(int start, std::string_view rest, int flags, int linkError) {
    UniqueFd way;  // the directory that was reached, once it is not `start`
    std::string name = nextComponent(rest);
    if (name.empty()) name.assign(1, '.');
    for (;;) {
        const int directory = way ? way.get() : start;
        struct stat status {};
        if (::fstatat(directory, name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) return -1;
        if (S_ISLNK(status.st_mode) || name == "..") {
            errno = linkError;
            return -1;
        }
        std::string next = nextComponent(rest);
        const int how = next.empty() ? flags : O_PATH | O_DIRECTORY;
        const int fd = ::openat(directory, name.c_str(), how | O_NOFOLLOW | O_CLOEXEC);
        if (fd < 0 || next.empty()) return fd;
        way.reset(fd);
        name = std::move(next);
    }
}

/// Whether the kernel knows too little for `openResolving`: then it takes several steps.
bool mustTakeSteps(int fd, Wait wait) {
    if (fd >= 0 || wait == Wait::Allowed) return fd < 0 && errno == ENOSYS;
    // One that knows no openings without waiting says that it does not know the flag.
    if (errno == ENOSYS || errno == EINVAL) errno = EAGAIN;
    return false;
}

Result<UniqueFd> opened(int fd, const std::string& path) {
    if (fd < 0) return Error::posix(errno, path);
    return UniqueFd(fd);
}

}  // namespace

Result<UniqueFd> openBeneath(int dirfd, const std::string& path, int flags, Wait wait) {
    if (path.find('\0') != std::string::npos) return Error::posix(EINVAL, path);
    constexpr std::uint64_t kInside = RESOLVE_BENEATH | RESOLVE_NO_XDEV | RESOLVE_NO_MAGICLINKS;
    const int fd = openResolving(dirfd, path, flags, kInside, wait);
    if (!mustTakeSteps(fd, wait)) return opened(fd, path);
    if (path.starts_with('/')) return Error::posix(EXDEV, path);
    auto file = opened(openByComponents(dirfd, path, flags, EXDEV), path);
    if (file && mountOf(file->get()) != mountOf(dirfd)) return Error::posix(EXDEV, path);
    return file;
}

Result<UniqueFd> openWithoutLinks(int dirfd, const std::string& path, int flags, Wait wait) {
    if (path.find('\0') != std::string::npos) return Error::posix(EINVAL, path);
    const bool isAbsolute = path.starts_with('/');
    int fd = openResolving(dirfd, path, flags,
                           RESOLVE_NO_SYMLINKS | (isAbsolute ? 0 : RESOLVE_BENEATH), wait);
    if (mustTakeSteps(fd, wait)) {
        const UniqueFd root(isAbsolute ? ::open("/", O_PATH | O_CLOEXEC) : -1);
        fd = openByComponents(root ? root.get() : dirfd, path, flags, ELOOP);
    }
    return opened(fd, path);
}

bool leadsOutside(const Error& error) {
    return error.domain == "POSIX" && (error.code == EXDEV || error.code == ELOOP);
}

}  // namespace platform
