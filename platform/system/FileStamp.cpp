#include "platform/system/FileStamp.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <span>

#include "platform/system/Files.h"
#include "platform/system/OpenBeneath.h"

namespace platform {

namespace {

/// Two ticks of the slowest clock that kernels stamp files by.
constexpr std::int64_t kSettlingTime = 20'000'000;

// Places among the facts: between them lie size and time of modification.
constexpr std::size_t kInode = 1;
constexpr std::size_t kChangeSeconds = 5;
constexpr std::size_t kChangeNanoseconds = 6;

std::int64_t nanoseconds(const timespec& time) {
    return time.tv_sec * std::int64_t{1'000'000'000} + time.tv_nsec;
}

}  // namespace

FileStamp FileStamp::ofFailure(int errnum) {
    FileStamp stamp;
    stamp.error = errnum == ENOTDIR ? ENOENT : errnum;
    return stamp;
}

FileStamp FileStamp::of(const struct stat& status) {
    FileStamp stamp;
    stamp.facts = {static_cast<std::int64_t>(status.st_dev),
                   static_cast<std::int64_t>(status.st_ino),
                   status.st_size,
                   status.st_mtim.tv_sec,
                   status.st_mtim.tv_nsec,
                   status.st_ctim.tv_sec,
                   status.st_ctim.tv_nsec};
    timespec now;
    ::clock_gettime(CLOCK_REALTIME, &now);
    // The time of the last change, which no writer can set back as it can that of the content.
    stamp.lookedAt = nanoseconds(now);
    const std::int64_t age = stamp.lookedAt - nanoseconds(status.st_ctim);
    stamp.settled = std::abs(age) >= kSettlingTime;
    return stamp;
}

FileStamp FileStamp::of(const std::string& path) {
    struct stat status;
    return ::stat(path.c_str(), &status) == 0 ? of(status) : ofFailure(errno);
}

FileStamp FileStamp::beneath(int dirfd, const std::string& folder, const std::string& file) {
    struct stat status;
    if (::fstatat(dirfd, joinPath(folder, file).c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0)
        return ofFailure(errno);
    if (!S_ISLNK(status.st_mode)) return of(status);
    const auto directory = openWithoutLinks(dirfd, folder, O_PATH | O_DIRECTORY | O_NOFOLLOW);
    if (!directory) return ofFailure(directory.error().code);
    return ofOpened(openBeneath(directory->get(), file, O_PATH));
}

FileStamp FileStamp::ofOpened(const Result<UniqueFd>& file) {
    struct stat status;
    if (!file) return ofFailure(file.error().code);
    return ::fstat(file->get(), &status) == 0 ? of(status) : ofFailure(errno);
}

bool FileStamp::isMissing() const {
    return error == ENOENT;
}

void FileStamp::appendTo(std::string& bytes) const {
    static_assert(sizeof facts + sizeof error == kStoredSize);
    auto stored = facts;
    // No file was changed a negative number of nanoseconds after a second began.
    if (!settled) stored[kChangeNanoseconds] = -lookedAt;
    bytes.append(reinterpret_cast<const char*>(stored.data()), sizeof stored);
    bytes.append(reinterpret_cast<const char*>(&error), sizeof error);
}

FileStamp FileStamp::from(std::string_view bytes) {
    FileStamp stamp;
    stamp.error = EINVAL;
    if (bytes.size() < kStoredSize) return stamp;
    std::memcpy(stamp.facts.data(), bytes.data(), sizeof stamp.facts);
    std::memcpy(&stamp.error, bytes.data() + sizeof stamp.facts, sizeof stamp.error);
    stamp.settled = stamp.facts[kChangeNanoseconds] >= 0;
    return stamp;
}

bool FileStamp::isLike(const FileStamp& other) const {
    const auto lasting = [](const FileStamp& stamp) {
        return std::span(stamp.facts).subspan(kInode, kChangeSeconds - kInode);
    };
    return error == other.error && std::ranges::equal(lasting(*this), lasting(other));
}

}  // namespace platform
