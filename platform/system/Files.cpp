#include "platform/system/Files.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/random.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <memory>

#include <fmt/format.h>

#include "platform/system/OpenBeneath.h"
#include "platform/system/UniqueFd.h"

namespace platform {

namespace {

constexpr std::size_t kMaxName = 255;
constexpr int kMaxLinks = 40;
constexpr int kMaxTemporaryNames = 100;
constexpr std::size_t kRandomDigits = 16;
constexpr int kMaxDamagedNames = 100;

/// Paths come from messages: one with a NUL would be cut short by the kernel.
bool hasNul(std::string_view path) {
    return path.find('\0') != std::string_view::npos;
}

/// Without O_NONBLOCK a pipe would keep us waiting for its writer.
constexpr int kReading = O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY;

/// Reads to the end of the file, also when it is larger or smaller than its size promised.
Result<std::string> readAll(int fd, std::size_t expected, std::size_t limit,
                            const std::string& name) {
    std::string bytes;
    std::size_t used = 0;
    bytes.resize(expected + 1);
    for (;;) {
        ssize_t count = ::read(fd, bytes.data() + used, bytes.size() - used);
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) return Error::posix(errno, name);
        if (count == 0) break;
        used += static_cast<std::size_t>(count);
        if (used > limit) return Error::posix(EFBIG, name);
        if (used == bytes.size()) bytes.resize(used + used / 2 + 4096);
    }
    bytes.resize(used);
    return bytes;
}

Result<std::string> readRegular(const UniqueFd& fd, std::size_t limit, const std::string& name) {
    struct stat status {};
    if (::fstat(fd.get(), &status) != 0) return Error::posix(errno, name);
    if (!S_ISREG(status.st_mode)) return Error::posix(EINVAL, name);
    auto size = static_cast<std::uint64_t>(status.st_size);
    if (size > limit) return Error::posix(EFBIG, name);
    return readAll(fd.get(), size, limit, name);
}

/// The path that opening `path` would end at: symbolic links of the last component followed, also
/// to a file that does not exist yet.
Result<std::string> followLinks(std::string path) {
    for (int i = 0; i < kMaxLinks; ++i) {
        char target[PATH_MAX];
        ssize_t length = ::readlink(path.c_str(), target, sizeof target);
        if (length < 0) return path;  // no link, or nothing there
        if (length == sizeof target) return Error::posix(ENAMETOOLONG, path);
        std::string_view text(target, static_cast<std::size_t>(length));
        path = text.starts_with('/') ? std::string(text) : joinPath(parentPath(path), text);
    }
    return Error::posix(ELOOP, path);
}

/// What the names of temporary files begin with that are to become the file of a name. Both parts
/// are short whatever the name is.
std::string temporaryPrefix(std::string_view name) {
    std::uint64_t digest = 14695981039346656037u;  // FNV-1a
    for (const char c : name) digest = (digest ^ static_cast<unsigned char>(c)) * 1099511628211u;
    return fmt::format(".zorvan-{:016x}-", digest);
}

/// A file without a name until it is whole; where the file system has no such files, and for the
/// moment before it is renamed, one under a temporary name. It is locked as long as it is in use,
/// so that what a crash leaves behind is told from it.
class TemporaryFile {
  public:
    TemporaryFile(int dirfd, std::string_view target)
        : dirfd_(dirfd), prefix_(temporaryPrefix(target)) {}
    TemporaryFile(const TemporaryFile&) = delete;
    ~TemporaryFile() {
        if (!name_.empty()) ::unlinkat(dirfd_, name_.c_str(), 0);
    }

    /// Each operation answers 0 or the errno.
    int create() {
        constexpr int kFlags = O_WRONLY | O_CLOEXEC;
        constexpr mode_t kMode = S_IRUSR | S_IWUSR;
        fd_.reset(::openat(dirfd_, ".", kFlags | O_TMPFILE, kMode));
        const int failure = fd_ ? 0 : takeName([this](const char* name) {
            fd_.reset(::openat(dirfd_, name, kFlags | O_CREAT | O_EXCL, kMode));
            return static_cast<bool>(fd_);
        });
        // Where there are no locks, leftovers stay.
        if (!failure) ::flock(fd_.get(), LOCK_EX | LOCK_NB);
        return failure;
    }

    int setMode(mode_t mode) { return ::fchmod(fd_.get(), mode) == 0 ? 0 : errno; }

    int write(std::string_view bytes, Sync sync) {
        while (!bytes.empty()) {
            ssize_t count = ::write(fd_.get(), bytes.data(), bytes.size());
            if (count < 0 && errno == EINTR) continue;
            if (count < 0) return errno;
            bytes.remove_prefix(static_cast<std::size_t>(count));
        }
        return sync != Sync::Yes || ::fsync(fd_.get()) == 0 ? 0 : errno;
    }

    int rename(const char* name) {
        if (name_.empty()) {
            const std::string file = fmt::format("/proc/self/fd/{}", fd_.get());
            const int failure = takeName([&](const char* temporary) {
                return ::linkat(AT_FDCWD, file.c_str(), dirfd_, temporary, AT_SYMLINK_FOLLOW) == 0;
            });
            if (failure) return failure;
        }
        if (::renameat(dirfd_, name_.c_str(), dirfd_, name) != 0) return errno;
        name_.clear();
        return 0;
    }

  private:
    /// Has `use` make the file's entry under a name that nothing has.
    template <class Use>
    int takeName(Use use) {
        for (int i = 0; i < kMaxTemporaryNames; ++i) {
            std::uint64_t random = 0;
            if (::getrandom(&random, sizeof random, 0) != sizeof random) return errno;
            std::string name = fmt::format("{}{:016x}", prefix_, random);
            if (use(name.c_str())) {
                name_ = std::move(name);
                return 0;
            }
            if (errno != EEXIST) return errno;
        }
        return EEXIST;
    }

    int dirfd_;
    std::string prefix_;
    std::string name_;  // while it has one
    UniqueFd fd_;
};

/// The name that a file keeps which was synced, once another one that is not has taken its place.
std::string syncedName(std::string_view name) {
    return temporaryPrefix(name) + "synced";
}

/// One that has the name already was synced later than all that took its place since.
bool keepSynced(int dirfd, const char* name) {
    return ::linkat(dirfd, name, dirfd, syncedName(name).c_str(), 0) == 0 || errno == EEXIST;
}

/// Makes the names in the directory of a file that is synced durable. 0 or the errno.
int syncNames(int dirfd, std::string_view name) {
    if (::fsync(dirfd) != 0) return errno;
    ::unlinkat(dirfd, syncedName(name).c_str(), 0);
    return 0;
}

int replaceIn(int dirfd, const char* name, std::string_view bytes, Sync sync) {
    struct stat existing {};
    bool exists = ::fstatat(dirfd, name, &existing, AT_SYMLINK_NOFOLLOW) == 0;
    if (!exists && errno != ENOENT) return errno;
    if (exists && !S_ISREG(existing.st_mode)) return EINVAL;
    if (sync == Sync::Later && exists && !keepSynced(dirfd, name)) sync = Sync::Yes;

    TemporaryFile file(dirfd, name);
    int failure = file.create();
    if (!failure && exists) failure = file.setMode(existing.st_mode & 07777);
    if (!failure) failure = file.write(bytes, sync);
    if (!failure) failure = file.rename(name);
    // The rename itself is durable only once the directory is.
    return failure || sync != Sync::Yes ? failure : syncNames(dirfd, name);
}

/// Opens a regular file of this user's own.
UniqueFd openOwn(int dirfd, const char* name) {
    UniqueFd fd(::openat(dirfd, name, kReading | O_NOFOLLOW));
    struct stat status {};
    const bool isOwn = fd && ::fstat(fd.get(), &status) == 0 && S_ISREG(status.st_mode) &&
                       status.st_uid == ::geteuid();
    return isOwn ? std::move(fd) : UniqueFd();
}

/// Whether a file with a temporary name is this user's own, and nobody is writing it.
bool isLeftover(int dirfd, const char* name) {
    const UniqueFd fd = openOwn(dirfd, name);
    return fd && ::flock(fd.get(), LOCK_EX | LOCK_NB) == 0;
}

std::string_view withoutTrailingSlashes(std::string_view path) {
    while (path.size() > 1 && path.ends_with('/')) path.remove_suffix(1);
    return path;
}

}  // namespace

Result<std::string> readFile(const std::string& path, std::size_t limit) {
    return readFileAt(AT_FDCWD, path, limit);
}

Result<std::string> readFileAt(int dirfd, const std::string& name, std::size_t limit) {
    if (hasNul(name)) return Error::posix(EINVAL, name);
    const UniqueFd fd(::openat(dirfd, name.c_str(), kReading));
    if (!fd) return Error::posix(errno, name);
    return readRegular(fd, limit, name);
}

Result<std::string> readFileBeneath(int dirfd, const std::string& name, std::size_t limit) {
    const Result<UniqueFd> fd = openBeneath(dirfd, name, kReading);
    if (!fd) return fd.error();
    return readRegular(*fd, limit, name);
}

std::optional<Error> writeFileAtomically(const std::string& path, std::string_view bytes,
                                         Sync sync) {
    if (hasNul(path)) return Error::posix(EINVAL, path);
    auto target = followLinks(path);
    if (!target) return target.error();
    std::string directory(parentPath(*target));
    std::string name(lastPathComponent(*target));
    if (name.empty()) return Error::posix(EINVAL, path);

    UniqueFd dirfd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!dirfd) return Error::posix(errno, path);
    if (int failure = replaceIn(dirfd.get(), name.c_str(), bytes, sync))
        return Error::posix(failure, path);
    return std::nullopt;
}

std::optional<Error> syncFile(const std::string& path) {
    const auto target = followLinks(path);
    if (!target) return target.error();
    const UniqueFd file(::open(target->c_str(), kReading));
    const UniqueFd directory(
        ::open(std::string(parentPath(*target)).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!file || !directory || ::fsync(file.get()) != 0) return Error::posix(errno, path);
    const int failure = syncNames(directory.get(), lastPathComponent(*target));
    return failure ? std::optional(Error::posix(failure, path)) : std::nullopt;
}

std::optional<std::string> lastSyncedFile(const std::string& path) {
    const auto target = followLinks(path);
    if (hasNul(path) || !target) return std::nullopt;
    std::string file = joinPath(parentPath(*target), syncedName(lastPathComponent(*target)));
    return openOwn(AT_FDCWD, file.c_str()) ? std::optional(std::move(file)) : std::nullopt;
}

void removeLeftovers(const std::string& path) {
    const auto target = followLinks(path);
    if (hasNul(path) || !target) return;
    const std::unique_ptr<DIR, int (*)(DIR*)> folder(
        ::opendir(std::string(parentPath(*target)).c_str()), &::closedir);
    if (!folder) return;
    const std::string prefix = temporaryPrefix(lastPathComponent(*target));
    const int dirfd = ::dirfd(folder.get());
    while (const dirent* entry = ::readdir(folder.get())) {
        const std::string_view name = entry->d_name;
        if (name.size() == prefix.size() + kRandomDigits && name.starts_with(prefix) &&
            isLeftover(dirfd, entry->d_name))
            ::unlinkat(dirfd, entry->d_name, 0);
    }
}

UniqueFd memoryFile(std::string_view bytes) {
    UniqueFd file(::memfd_create("zrd", MFD_CLOEXEC));
    while (file && !bytes.empty()) {
        const ssize_t count = ::write(file.get(), bytes.data(), bytes.size());
        if (count < 0) return UniqueFd();
        bytes.remove_prefix(static_cast<std::size_t>(count));
    }
    if (file) ::lseek(file.get(), 0, SEEK_SET);
    return file;
}

std::optional<Error> makeDirectories(const std::string& path, mode_t mode) {
    if (hasNul(path)) return Error::posix(EINVAL, path);
    if (::mkdir(path.c_str(), mode) == 0) return std::nullopt;
    if (errno == ENOENT) {
        std::string parent(parentPath(path));
        if (path.empty() || parent == ".") return Error::posix(ENOENT, path);
        if (auto error = makeDirectories(parent, mode)) return error;
        if (::mkdir(path.c_str(), mode) == 0) return std::nullopt;
    }
    // EEXIST, but also EROFS and EACCES for a directory that is there.
    int failure = errno;
    struct stat status {};
    if (::stat(path.c_str(), &status) != 0) return Error::posix(failure, path);
    if (!S_ISDIR(status.st_mode)) return Error::posix(ENOTDIR, path);
    return std::nullopt;
}

std::optional<std::string> canonicalPath(const std::string& path, std::size_t limit) {
    if (hasNul(path)) return std::nullopt;
    std::unique_ptr<char, decltype(&std::free)> resolved(::realpath(path.c_str(), nullptr),
                                                         &std::free);
    if (!resolved) return std::nullopt;
    std::string text(resolved.get());
    if (text.size() >= limit) return std::nullopt;
    return text;
}

bool isSafeName(std::string_view name) {
    return !name.empty() && name.size() <= kMaxName && name.front() != '.' &&
           name.find('/') == std::string_view::npos && !hasNul(name);
}

std::optional<std::string> unusedDamagedName(const std::string& path) {
    for (int number = 1; number <= kMaxDamagedNames; ++number) {
        std::string name = fmt::format("{}.damaged-{}", path, number);
        struct stat status;
        if (::lstat(name.c_str(), &status) != 0) return name;
    }
    return std::nullopt;
}

std::string joinPath(std::string_view directory, std::string_view name) {
    std::string path;
    path.reserve(directory.size() + 1 + name.size());
    path += directory;
    if (!path.empty() && !path.ends_with('/')) path += '/';
    path += name;
    return path;
}

std::string_view lastPathComponent(std::string_view path) {
    path = withoutTrailingSlashes(path);
    return path.substr(path.rfind('/') + 1);
}

std::string_view parentPath(std::string_view path) {
    path = withoutTrailingSlashes(path);
    std::size_t slash = path.rfind('/');
    if (slash == std::string_view::npos) return ".";
    return withoutTrailingSlashes(path.substr(0, slash + 1));
}

}  // namespace platform
