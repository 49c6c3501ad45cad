#include "platform/system/FileStamp.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <ctime>

namespace platform {

namespace {

/// Two ticks of the slowest clock that kernels stamp files by.
constexpr std::int64_t kSettlingTime = 20'000'000;

std::int64_t nanoseconds(const timespec& time) {
    return time.tv_sec * std::int64_t{1'000'000'000} + time.tv_nsec;
}

}  // namespace

FileStamp FileStamp::of(int dirfd, const char* path) {
    FileStamp stamp;
    struct stat status;
    if (::fstatat(dirfd, path, &status, 0) != 0) {
        stamp.error = errno == ENOTDIR ? ENOENT : errno;
        return stamp;
    }
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
    const std::int64_t age = nanoseconds(now) - nanoseconds(status.st_ctim);
    stamp.settled = std::abs(age) >= kSettlingTime;
    return stamp;
}

FileStamp FileStamp::of(const std::string& path) {
    return of(AT_FDCWD, path.c_str());
}

bool FileStamp::isMissing() const {
    return error == ENOENT;
}

void FileStamp::appendTo(std::string& bytes) const {
    bytes.append(reinterpret_cast<const char*>(facts.data()), sizeof facts);
    bytes.append(reinterpret_cast<const char*>(&error), sizeof error);
}

}  // namespace platform
