#include "platform/tandry/FileStamps.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <iterator>

namespace platform::tandry {

bool appendFileStamp(int dirfd, const char* file, std::string& stamps) {
    struct stat status;
    std::int64_t stamp[6];
    bool exists = ::fstatat(dirfd, file, &status, 0) == 0;
    if (exists) {
        // Seconds and nanoseconds apart: files may claim to be from any century.
        stamp[0] = status.st_mtim.tv_sec;
        stamp[1] = status.st_mtim.tv_nsec;
        stamp[2] = status.st_ctim.tv_sec;
        stamp[3] = status.st_ctim.tv_nsec;
        stamp[4] = status.st_size;
        stamp[5] = static_cast<std::int64_t>(status.st_ino);
    } else {
        std::fill(std::begin(stamp), std::end(stamp), -1);
        stamp[5] = errno == ENOTDIR ? ENOENT : errno;
    }
    stamps.append(reinterpret_cast<const char*>(stamp), sizeof stamp);
    return exists;
}

}  // namespace platform::tandry
