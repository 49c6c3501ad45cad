#include "platform/FileStamp.h"

#include <fmt/format.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdint>
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

FileStamp fileStamp(const std::string& path) {
    struct stat status;
    if (::stat(path.c_str(), &status) != 0) {
        if (errno == ENOENT || errno == ENOTDIR) return {};
        return {fmt::format("error {}", errno)};
    }
    timespec now;
    ::clock_gettime(CLOCK_REALTIME, &now);
    // The time of the last change, which no writer can set back as it can that of the content.
    const std::int64_t age = nanoseconds(now) - nanoseconds(status.st_ctim);
    return {fmt::format("{:x}:{:x} {}.{:09} {}.{:09} {}", status.st_dev, status.st_ino,
                        status.st_mtim.tv_sec, status.st_mtim.tv_nsec, status.st_ctim.tv_sec,
                        status.st_ctim.tv_nsec, status.st_size),
            std::abs(age) >= kSettlingTime};
}

}  // namespace platform
