#include "platform/tandry/DataContainers.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/system/Files.h"

namespace platform::tandry {

namespace {

constexpr mode_t kPrivate = 0700;
constexpr const char* kTemporary = "tmp";

const std::string& placeOf(const TDPlugInProxy& plugIn) {
    return plugIn.containingApplication ? plugIn.containingApplication->bundlePath
                                        : *plugIn.bundlePath;
}

/// Why what lies at a path, which may start at the directory `dirfd`, cannot be a container, as an
/// errno; 0 when it can.
int faultAt(int dirfd, const std::string& path) {
    struct stat status;
    if (::fstatat(dirfd, path.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    if (!S_ISDIR(status.st_mode)) return ENOTDIR;
    return status.st_uid == ::geteuid() ? 0 : EPERM;
}

/// Whatever the plug-in has put there is its own business.
bool hasTemporaryAt(int dirfd, const std::string& path) {
    struct stat status;
    return ::fstatat(dirfd, joinPath(path, kTemporary).c_str(), &status, AT_SYMLINK_NOFOLLOW) ==
               0 ||
           errno != ENOENT;
}

}  // namespace

std::optional<Error> makeContainer(const std::string& path) {
    int fault = faultAt(AT_FDCWD, path);
    if (fault == 0 && hasTemporaryAt(AT_FDCWD, path)) return std::nullopt;
    if (fault == ENOENT) {
        if (auto error = makeDirectories(std::string(parentPath(path)), kPrivate)) return error;
        fault = ::mkdir(path.c_str(), kPrivate) == 0 || errno == EEXIST ? faultAt(AT_FDCWD, path)
                                                                        : errno;
    }
    if (fault == 0 && ::mkdir(joinPath(path, kTemporary).c_str(), kPrivate) != 0 && errno != EEXIST)
        fault = errno;
    return fault == 0 ? std::nullopt : std::optional(Error::posix(fault, path));
}

DataContainers::DataContainers(const std::string& dataFolder)
    : root_(joinPath(dataFolder, "Containers")),
      owners_(joinPath(dataFolder, "ContainerOwners.plist")) {}

void DataContainers::beginWalk() {
    struct stat status;
    const bool isNoDirectory = ::stat(root_.c_str(), &status) == 0 && !S_ISDIR(status.st_mode);
    folder_.reset(::open(root_.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    fail(isNoDirectory ? Error::posix(ENOTDIR, root_) : owners_.load());
}

/// None is given in this walk, which is told once for all plug-ins.
void DataContainers::fail(std::optional<Error> failure) {
    failure_ = std::move(failure);
    complain(root_, failure_ ? "no data containers: " + describe(*failure_) : std::string());
}

/// Logs what is wrong at a path, unless that is known; nothing is wrong when `problem` is empty.
void DataContainers::complain(const std::string& path, const std::string& problem) {
    if (problem.empty()) {
        told_.erase(path);
        return;
    }
    std::string& told = told_[path];
    if (told != problem) EVLOG_ERROR(ops(), "{}", pub(problem));
    told = problem;
}

int DataContainers::faultOf(const std::string& name) const {
    return folder_ ? faultAt(folder_.get(), name) : faultAt(AT_FDCWD, joinPath(root_, name));
}

bool DataContainers::hasTemporary(const std::string& name) const {
    return folder_ ? hasTemporaryAt(folder_.get(), name)
                   : hasTemporaryAt(AT_FDCWD, joinPath(root_, name));
}

Result<DataContainers::State> DataContainers::stateOf(const std::string& name) {
    const int fault = faultOf(name);
    const std::string path = joinPath(root_, name);
    if (fault == 0 && hasTemporary(name)) {
        told_.erase(path);
        return State::Whole;
    }
    if (fault == 0 || fault == ENOENT) return State::Missing;
    const Error error = Error::posix(fault, path);
    if (isTransient(error)) return error;
    const bool isForeign = fault == ENOTDIR || fault == EPERM;
    complain(path, isForeign ? path + " is not a directory of this user, so no data container"
                             : "no data container: " + describe(error));
    return State::Impossible;
}

Result<std::optional<std::string>> DataContainers::locate(const TDPlugInProxy& plugIn,
                                                          bool isRemembered) {
    std::optional<std::string> none;
    if (failure_ && isTransient(*failure_)) return *failure_;
    if (failure_) return none;
    ContainerClaim claim{*plugIn.plugInIdentifier, placeOf(plugIn), std::nullopt, isRemembered};
    if (const auto& application = plugIn.containingApplication)
        claim.application = application->bundleIdentifier;
    const std::string name = owners_.nameFor(
        claim, [this](const std::string& container) { return faultOf(container) != ENOENT; });
    std::string path = joinPath(root_, name);
    const Result<State> state = stateOf(name);
    if (!state) return state.error();
    if (*state == State::Impossible) return none;
    if (*state == State::Whole) return std::optional(std::move(path));
    if (canMake_) {
        missing_.insert(path);
        return std::optional(std::move(path));
    }
    if (std::optional<Error> error = makeDirectories(root_, kPrivate)) {
        fail(std::move(error));
        return locate(plugIn, isRemembered);
    }
    canMake_ = make(path);
    return canMake_ ? std::optional(std::move(path)) : none;
}

bool DataContainers::make(const std::string& path) {
    const std::optional<Error> error = makeContainer(path);
    complain(path, error ? "no data container: " + describe(*error) : std::string());
    return !error;
}

std::set<std::string> DataContainers::makeMissing() {
    std::set<std::string> failed;
    for (const std::string& path : std::exchange(missing_, {}))
        if (!make(path)) failed.insert(path);
    canMake_ = false;
    return failed;
}

}  // namespace platform::tandry
