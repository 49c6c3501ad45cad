#include "platform/tandry/DataContainers.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "platform/Error.h"
#include "platform/Files.h"
#include "platform/Log.h"

namespace platform::tandry {

namespace {

constexpr mode_t kPrivate = 0700;

const Log& ops() {
    static const Log& handle = Log::make("com.orbel.Zorvan", "ops");
    return handle;
}

}  // namespace

DataContainers::DataContainers(std::string root) : root_(std::move(root)) {}

bool DataContainers::openRoot() {
    if (folder_) return true;
    if (std::optional<Error> error = makeDirectories(root_, kPrivate)) {
        EVLOG_ERROR(ops(), "no data containers: {}", pub(*error));
        return false;
    }
    folder_.reset(::open(root_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!folder_) EVLOG_ERROR(ops(), "no data containers: {}", pub(Error::posix(errno, root_)));
    return bool(folder_);
}

std::optional<std::string> DataContainers::locate(const std::string& identifier) {
    if (!openRoot()) return std::nullopt;
    std::string path = joinPath(root_, identifier);
    struct stat status;
    if (::fstatat(folder_.get(), identifier.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0) {
        if (S_ISDIR(status.st_mode) && status.st_uid == ::geteuid()) return path;
        EVLOG_ERROR(ops(), "{} is not a directory of this user, so no data container", pub(path));
        return std::nullopt;
    }
    if (errno != ENOENT) {
        EVLOG_ERROR(ops(), "no data container: {}", pub(Error::posix(errno, path)));
        return std::nullopt;
    }
    missing_.push_back(identifier);
    return path;
}

void DataContainers::makeMissing() {
    for (const std::string& identifier : std::exchange(missing_, {})) {
        const bool isMade = ::mkdirat(folder_.get(), identifier.c_str(), kPrivate) == 0;
        // Versions of one plug-in share their container.
        if (!isMade && errno == EEXIST) continue;
        if (!isMade || ::mkdirat(folder_.get(), (identifier + "/tmp").c_str(), kPrivate) != 0)
            EVLOG_ERROR(ops(), "cannot make a data container: {}",
                        pub(Error::posix(errno, joinPath(root_, identifier))));
    }
}

}  // namespace platform::tandry
