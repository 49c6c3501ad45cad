#include "platform/FileStamp.h"

#include <fmt/format.h>
#include <sys/stat.h>

#include <cerrno>

namespace platform {

std::string fileStamp(const std::string& path) {
    struct stat status;
    if (::stat(path.c_str(), &status) != 0) {
        if (errno == ENOENT || errno == ENOTDIR) return {};
        return fmt::format("error {}", errno);
    }
    return fmt::format("{:x}:{:x} {}.{:09} {}.{:09} {}", status.st_dev, status.st_ino,
                       status.st_mtim.tv_sec, status.st_mtim.tv_nsec, status.st_ctim.tv_sec,
                       status.st_ctim.tv_nsec, status.st_size);
}

}  // namespace platform
