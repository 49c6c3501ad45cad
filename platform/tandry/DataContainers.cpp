#include "platform/tandry/DataContainers.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "platform/Error.h"
#include "platform/Files.h"
#include "platform/OpsLog.h"

namespace platform::tandry {

namespace {

constexpr mode_t kPrivate = 0700;

}  // namespace

DataContainers::DataContainers(std::string root) : root_(std::move(root)) {}

bool DataContainers::openRoot() {
    if (folder_) return true;
    std::optional<Error> error = makeDirectories(root_, kPrivate);
    if (!error) {
        folder_.reset(::open(root_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (!folder_) error = Error::posix(errno, root_);
    }
    std::string problem = error ? describe(*error) : std::string();
    // Once for all plug-ins.
    if (error && problem != rootProblem_)
        EVLOG_ERROR(ops(), "no data containers: {}", pub(problem));
    rootProblem_ = std::move(problem);
    return bool(folder_);
}

/// Logs why there is no container.
void DataContainers::refuse(const std::string& identifier, int errnum) {
    EVLOG_ERROR(ops(), "no data container: {}",
                pub(Error::posix(errnum, joinPath(root_, identifier))));
}

DataContainers::State DataContainers::stateOf(const std::string& identifier) {
    struct stat status;
    if (::fstatat(folder_.get(), identifier.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
        if (errno == ENOENT) return State::Missing;
        refuse(identifier, errno);
        return State::Impossible;
    }
    if (!S_ISDIR(status.st_mode) || status.st_uid != ::geteuid()) {
        EVLOG_ERROR(ops(), "{} is not a directory of this user, so no data container",
                    pub(joinPath(root_, identifier)));
        return State::Impossible;
    }
    // A directory inside counts as a link; a file system that does not count them says 1.
    return status.st_nlink > 2 ? State::Whole : State::Missing;
}

std::optional<std::string> DataContainers::locate(const std::string& identifier) {
    if (!openRoot()) return std::nullopt;
    const State state = stateOf(identifier);
    if (state == State::Impossible) return std::nullopt;
    if (state == State::Missing) {
        if (canMake_)
            missing_.insert(identifier);
        else if (!(canMake_ = make(identifier)))
            return std::nullopt;
    }
    return joinPath(root_, identifier);
}

bool DataContainers::make(const std::string& identifier) {
    int made = ::mkdirat(folder_.get(), identifier.c_str(), kPrivate);
    if (made != 0 && errno == ENOENT) {
        // Somebody has removed the root.
        folder_.reset();
        if (!openRoot()) return false;
        made = ::mkdirat(folder_.get(), identifier.c_str(), kPrivate);
    }
    const bool isThere = made != 0 && errno == EEXIST;
    if (isThere && stateOf(identifier) == State::Impossible) return false;
    if ((made == 0 || isThere) &&
        (::mkdirat(folder_.get(), (identifier + "/tmp").c_str(), kPrivate) == 0 || errno == EEXIST))
        return true;
    refuse(identifier, errno);
    return false;
}

std::set<std::string> DataContainers::makeMissing() {
    std::set<std::string> failed;
    for (const std::string& identifier : std::exchange(missing_, {}))
        if (!make(identifier)) failed.insert(identifier);
    canMake_ = false;
    return failed;
}

}  // namespace platform::tandry
