#include "platform/lum/ServiceSocket.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <optional>
#include <set>
#include <utility>
#include <vector>

#include "platform/log/OpsLog.h"
#include "platform/lum/Listener.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"

namespace platform::lum {

namespace {

/// To be let in: who connects again and again fills the line, and others stand behind in it.
constexpr int kMostWaiting = 256;

/// The paths of the sockets that were made here and are still there.
struct OwnPaths {
    std::mutex mutex;  // guards `paths`
    std::set<std::string> paths;
};

OwnPaths& ownPaths() {
    static auto* const own = new OwnPaths;  // never destroyed: sockets may end with the process
    return *own;
}

/// Opens a directory of ours below `parent`, made when it is missing. What somebody else has put in
/// its place, also a symbolic link, is refused.
Result<UniqueFd> openOwnDirectory(int parent, const char* name, const std::string& path) {
    if (mkdirat(parent, name, 0700) != 0 && errno != EEXIST) return Error::posix(errno, path);
    UniqueFd directory(openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!directory) return Error::posix(errno, path);
    struct stat status {};
    if (fstat(directory.get(), &status) != 0) return Error::posix(errno, path);
    if (status.st_uid != geteuid()) return Error::posix(EPERM, path + " is another user's");
    if ((status.st_mode & 0777) != 0700 && fchmod(directory.get(), 0700) != 0)
        return Error::posix(errno, path);
    return directory;
}

Result<UniqueFd> openServicesDirectory(const Directories& directories) {
    if (auto error = makeDirectories(directories.runtime, 0700)) return *error;
    UniqueFd runtime(open(directories.runtime.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!runtime) return Error::posix(errno, directories.runtime);
    const std::string zorvanPath = directories.zorvanRuntime();
    auto zorvan = openOwnDirectory(runtime.get(), "zorvan", zorvanPath);
    if (!zorvan) return zorvan.error();
    return openOwnDirectory(zorvan->get(), "services", zorvanPath + "/services");
}

Result<UniqueFd> lockName(int directory, const std::string& serviceName) {
    const std::string name = serviceName + ".lock";
    UniqueFd file(openat(directory, name.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600));
    if (!file) return Error::posix(errno, name);
    if (flock(file.get(), LOCK_EX | LOCK_NB) != 0)
        return Error::posix(errno == EWOULDBLOCK ? EADDRINUSE : errno,
                            "service \"" + serviceName + "\"");
    return file;
}

/// A descriptor that socket activation has passed to this process.
struct PassedSocket {
    UniqueFd fd;
    std::string name;
};

/// Notes the passed descriptors that are not noted yet, and clears the variables that announce
/// them.
void notePassedSockets(std::vector<PassedSocket>& passed) {
    char** names = nullptr;
    const int count = sd_listen_fds_with_names(1, &names);
    for (int i = 0; i < count; ++i) {
        passed.push_back({UniqueFd(SD_LISTEN_FDS_START + i), names[i]});
        free(names[i]);
    }
    free(names);
}

/// The listening socket that socket activation has passed for this service, if any: one bound to
/// its path, or one with its name. The others wait for the services that they are for.
UniqueFd passedSocket(const std::string& serviceName, const std::string& path) {
    static std::mutex mutex;  // guards `passed`
    static std::vector<PassedSocket> passed;
    std::lock_guard lock(mutex);
    notePassedSockets(passed);
    for (auto socket = passed.begin(); socket != passed.end(); ++socket) {
        const int fd = socket->fd.get();
        const bool bound = sd_is_socket_unix(fd, SOCK_STREAM, 1, path.c_str(), 0) > 0;
        const bool named =
            serviceName == socket->name && sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) > 0;
        if (!bound && !named) continue;
        UniqueFd found = std::move(socket->fd);
        passed.erase(socket);
        fcntl(found.get(), F_SETFL, fcntl(found.get(), F_GETFL) | O_NONBLOCK);
        return found;
    }
    return {};
}

/// Removes the socket that an owner of the name before us has left behind. Nothing but a socket.
std::optional<Error> removeStale(int directory, const std::string& name, const std::string& path) {
    struct stat status {};
    if (fstatat(directory, name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0)
        return errno == ENOENT ? std::nullopt : std::optional(Error::posix(errno, path));
    if (!S_ISSOCK(status.st_mode)) return Error::posix(ENOTSOCK, path);
    if (unlinkat(directory, name.c_str(), 0) != 0) return Error::posix(errno, path);
    return std::nullopt;
}

Result<UniqueFd> bindSocket(const std::string& path) {
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.data(), path.size());
    // Whatever the umask, nobody can connect before `listen`, nor reach through the directory.
    if (!socket ||
        ::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
        chmod(path.c_str(), 0600) != 0 || ::listen(socket.get(), kMostWaiting) != 0)
        return Error::posix(errno, path);
    return socket;
}

}  // namespace

Result<ServiceSocket> ServiceSocket::make(const Directories& directories,
                                          const std::string& serviceName) {
    auto path = socketPath(directories, serviceName);
    if (!path) return path.error();
    auto directory = openServicesDirectory(directories);
    if (!directory) return directory.error();
    auto lock = lockName(directory->get(), serviceName);
    if (!lock) return lock.error();

    if (UniqueFd passed = passedSocket(serviceName, *path))
        return ServiceSocket(std::move(*lock), std::move(passed), "");
    if (auto error = removeStale(directory->get(), serviceName, *path)) return *error;
    auto socket = bindSocket(*path);
    if (!socket) return socket.error();
    {
        const std::lock_guard guard(ownPaths().mutex);
        ownPaths().paths.insert(*path);
    }
    return ServiceSocket(std::move(*lock), std::move(*socket), std::move(*path));
}

ServiceSocket::~ServiceSocket() {
    if (!socket_ || ownPath_.empty()) return;
    const std::lock_guard guard(ownPaths().mutex);
    if (ownPaths().paths.erase(ownPath_) != 0) unlink(ownPath_.c_str());
}

void removeServiceSockets() {
    const std::lock_guard guard(ownPaths().mutex);
    for (const std::string& path : std::exchange(ownPaths().paths, {})) unlink(path.c_str());
}

std::optional<pid_t> admittedPeer(int connected) {
    pollfd state{connected, 0, 0};
    if (::poll(&state, 1, 0) > 0) return std::nullopt;
    ucred peer{};
    socklen_t size = sizeof peer;
    if (getsockopt(connected, SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0) return std::nullopt;
    if (peer.uid == geteuid() || peer.uid == 0) return peer.pid;
    EVLOG_ERROR(ops(), "client {} of user {} is not let in", peer.pid, peer.uid);
    return std::nullopt;
}

}  // namespace platform::lum
