#include "platform/tandry/DataContainers.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/system/Error.h"
#include "platform/system/Files.h"

namespace platform::tandry {

namespace {

constexpr mode_t kPrivate = 0700;

const std::string& placeOf(const TDPlugInProxy& plugIn) {
    return plugIn.containingApplication ? plugIn.containingApplication->bundlePath
                                        : *plugIn.bundlePath;
}

}  // namespace

DataContainers::DataContainers(const std::string& dataFolder)
    : root_(joinPath(dataFolder, "Containers")),
      owners_(joinPath(dataFolder, "ContainerOwners.plist")) {}

bool DataContainers::open() {
    if (folder_) return true;
    std::optional<Error> error = makeDirectories(root_, kPrivate);
    if (!error) {
        folder_.reset(::open(root_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (!folder_) error = Error::posix(errno, root_);
    }
    if (!error) error = owners_.load();
    if (error) folder_.reset();
    std::string problem = error ? describe(*error) : std::string();
    // Once for all plug-ins.
    if (error && problem != problem_) EVLOG_ERROR(ops(), "no data containers: {}", pub(problem));
    problem_ = std::move(problem);
    return bool(folder_);
}

/// Logs why there is no container.
void DataContainers::refuse(const std::string& name, int errnum) {
    EVLOG_ERROR(ops(), "no data container: {}", pub(Error::posix(errnum, joinPath(root_, name))));
}

DataContainers::State DataContainers::stateOf(const std::string& name) {
    struct stat status;
    if (::fstatat(folder_.get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
        if (errno == ENOENT) return State::Missing;
        refuse(name, errno);
        return State::Impossible;
    }
    if (!S_ISDIR(status.st_mode) || status.st_uid != ::geteuid()) {
        EVLOG_ERROR(ops(), "{} is not a directory of this user, so no data container",
                    pub(joinPath(root_, name)));
        return State::Impossible;
    }
    // A directory inside counts as a link; a file system that does not count them says 1.
    return status.st_nlink > 2 ? State::Whole : State::Missing;
}

std::optional<std::string> DataContainers::locate(const TDPlugInProxy& plugIn, bool isRemembered) {
    if (!open()) return std::nullopt;
    ContainerClaim claim{*plugIn.plugInIdentifier, placeOf(plugIn), std::nullopt, isRemembered};
    if (const auto& application = plugIn.containingApplication)
        claim.application = application->bundleIdentifier;
    const std::string name = owners_.nameFor(claim, [this](const std::string& container) {
        struct stat status;
        return ::fstatat(folder_.get(), container.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0 ||
               errno != ENOENT;
    });
    const State state = stateOf(name);
    if (state == State::Impossible) return std::nullopt;
    if (state == State::Missing) {
        if (canMake_)
            missing_.insert(name);
        else if (!(canMake_ = make(name)))
            return std::nullopt;
    }
    return joinPath(root_, name);
}

bool DataContainers::isOwn(const TDPlugInProxy& plugIn) const {
    return owners_.isOwner(*plugIn.plugInIdentifier, placeOf(plugIn),
                           std::string(lastPathComponent(*plugIn.dataContainerPath)));
}

bool DataContainers::make(const std::string& name) {
    int made = ::mkdirat(folder_.get(), name.c_str(), kPrivate);
    if (made != 0 && errno == ENOENT) {
        // Somebody has removed the root.
        folder_.reset();
        if (!open()) return false;
        made = ::mkdirat(folder_.get(), name.c_str(), kPrivate);
    }
    const bool isThere = made != 0 && errno == EEXIST;
    if (isThere && stateOf(name) == State::Impossible) return false;
    if ((made == 0 || isThere) &&
        (::mkdirat(folder_.get(), (name + "/tmp").c_str(), kPrivate) == 0 || errno == EEXIST))
        return true;
    refuse(name, errno);
    return false;
}

std::set<std::string> DataContainers::makeMissing() {
    std::set<std::string> failed;
    for (const std::string& name : std::exchange(missing_, {}))
        if (!make(name)) failed.insert(joinPath(root_, name));
    canMake_ = false;
    return failed;
}

}  // namespace platform::tandry
