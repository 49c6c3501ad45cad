#include "platform/tandry/FileStamps.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdint>

namespace platform::tandry {

bool appendFileStamp(int dirfd, const char* file, std::string& stamps) {
    constexpr std::int64_t kNanoseconds = 1'000'000'000;
    struct stat status;
    std::int64_t stamp[4];
    bool exists = ::fstatat(dirfd, file, &status, 0) == 0;
    if (exists) {
        stamp[0] = status.st_mtim.tv_sec * kNanoseconds + status.st_mtim.tv_nsec;
        stamp[1] = status.st_ctim.tv_sec * kNanoseconds + status.st_ctim.tv_nsec;
        stamp[2] = status.st_size;
        stamp[3] = static_cast<std::int64_t>(status.st_ino);
    } else {
        stamp[0] = stamp[1] = stamp[2] = -1;
        stamp[3] = errno == ENOTDIR ? ENOENT : errno;
    }
    stamps.append(reinterpret_cast<const char*>(stamp), sizeof stamp);
    return exists;
}

}  // namespace platform::tandry
