#include "platform/lum/AuditToken.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstdlib>
#include <ctime>
#include <mutex>
#include <string_view>
#include <utility>

#include "platform/system/Files.h"
#include "platform/system/OpenBeneath.h"
#include "platform/system/OwnMounts.h"
#include "platform/system/UniqueFd.h"

namespace platform {

namespace {

#ifdef SO_PEERPIDFD
constexpr int kPeerPidFd = SO_PEERPIDFD;
#else
constexpr int kPeerPidFd = 77;
#endif

UniqueFd openPidFd(pid_t pid) {
    return UniqueFd(static_cast<int>(syscall(SYS_pidfd_open, pid, 0)));
}

/// Whether the process of the pidfd still has its process id. Somebody else's process may refuse
/// the signal, but it is there then.
bool isAlive(int pidFd) {
    return syscall(SYS_pidfd_send_signal, pidFd, 0, nullptr, 0) == 0 || errno == EPERM;
}

UniqueFd openProc(pid_t pid) {
    return UniqueFd(open(fmt::format("/proc/{}", pid).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
}

/// When the process started, in clock ticks since boot: the 22nd field of `stat`, counted from
/// behind the name, which may hold anything.
std::optional<std::uint64_t> startTicks(int procDirectory) {
    UniqueFd file(openat(procDirectory, "stat", O_RDONLY | O_CLOEXEC));
    char buffer[1024];
    const ssize_t count = file ? read(file.get(), buffer, sizeof buffer) : -1;
    if (count <= 0) return std::nullopt;
    std::string_view text(buffer, static_cast<std::size_t>(count));
    text.remove_prefix(std::min(text.rfind(')'), text.size()));
    constexpr int kFieldsFromName = 20;
    for (int i = 0; i < kFieldsFromName; ++i) {
        const std::size_t space = text.find(' ');
        if (space == std::string_view::npos) return std::nullopt;
        text.remove_prefix(space + 1);
    }
    return std::strtoull(std::string(text.substr(0, text.find(' '))).c_str(), nullptr, 10);
}

std::uint64_t ticksSinceBoot() {
    timespec now{};
    clock_gettime(CLOCK_BOOTTIME, &now);
    const auto perSecond = static_cast<std::uint64_t>(sysconf(_SC_CLK_TCK));
    return static_cast<std::uint64_t>(now.tv_sec) * perSecond +
           static_cast<std::uint64_t>(now.tv_nsec) * perSecond / 1'000'000'000;
}

struct FileId {
    std::uint32_t major, minor;
    std::uint64_t inode;
    bool operator==(const FileId&) const = default;
};

/// Which file a path leads to, as the kernel knows it already: the file may lie in a file system
/// that the peer serves itself, and nothing is asked of that.
std::optional<FileId> fileAt(int directory, const char* path) {
    struct statx status {};
    if (statx(directory, path, AT_STATX_DONT_SYNC | AT_EMPTY_PATH, STATX_TYPE | STATX_INO,
              &status) != 0)
        return std::nullopt;
    return FileId{status.stx_dev_major, status.stx_dev_minor, status.stx_ino};
}

/// What a process runs, as the kernel has it: nothing is looked up on the way to that.
struct Executable {
    FileId file;
    std::string path;
};

std::optional<Executable> readExecutable(int procDirectory) {
    char path[PATH_MAX];
    const auto running = fileAt(procDirectory, "exe");
    if (!running) return std::nullopt;
    const ssize_t length = readlinkat(procDirectory, "exe", path, sizeof path);
    if (length <= 0 || length == sizeof path || path[0] != '/') return std::nullopt;
    return Executable{*running, std::string(path, static_cast<std::size_t>(length))};
}

}  // namespace

struct AuditToken::State {
    State(pid_t number, uid_t user, UniqueFd pidDescriptor, UniqueFd directory)
        : pid(number),
          uid(user),
          pidFd(std::move(pidDescriptor)),
          proc(std::move(directory)),
          running(readExecutable(proc.get())) {}

    const pid_t pid;
    const uid_t uid;
    const UniqueFd pidFd;
    const UniqueFd proc;
    const std::optional<Executable> running;
    mutable std::once_flag looked;  // what follows does not change any more afterwards
    mutable std::optional<std::string> executable;
};

std::optional<AuditToken> AuditToken::ofPeer(int socket) {
    const std::uint64_t accepted = ticksSinceBoot();
    int rawPidFd = -1;
    socklen_t size = sizeof rawPidFd;
    const bool pinnedByKernel = getsockopt(socket, SOL_SOCKET, kPeerPidFd, &rawPidFd, &size) == 0;
    if (!pinnedByKernel && errno != ENOPROTOOPT) return std::nullopt;
    UniqueFd pidFd(pinnedByKernel ? rawPidFd : -1);

    ucred peer{};
    size = sizeof peer;
    if (getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0 || peer.pid <= 0)
        return std::nullopt;
    if (!pinnedByKernel) pidFd = openPidFd(peer.pid);

    // The directory is opened by number: it is the peer's if the number was still the peer's after
    // that.
    UniqueFd proc = openProc(peer.pid);
    if (!pidFd || !proc || !isAlive(pidFd.get())) return std::nullopt;
    if (!pinnedByKernel) {
        // As precisely as ticks tell: a client may well have started just now.
        const auto started = startTicks(proc.get());
        if (!started || *started > accepted) return std::nullopt;
    }

    return AuditToken(
        std::make_shared<const State>(peer.pid, peer.uid, std::move(pidFd), std::move(proc)));
}

std::optional<AuditToken> AuditToken::ofSelf() {
    UniqueFd pidFd = openPidFd(getpid());
    UniqueFd proc = openProc(getpid());
    if (!pidFd || !proc) return std::nullopt;
    return AuditToken(
        std::make_shared<const State>(getpid(), geteuid(), std::move(pidFd), std::move(proc)));
}

pid_t AuditToken::pid() const {
    return state_->pid;
}
uid_t AuditToken::uid() const {
    return state_->uid;
}
int AuditToken::pidFd() const {
    return state_->pidFd.get();
}
int AuditToken::procDirectory() const {
    return state_->proc.get();
}
const std::optional<std::string>& AuditToken::executablePath() const {
    const State& state = *state_;
    std::call_once(state.looked, [&state] {
        // Also no match: the path of another mount namespace, and "/x (deleted)".
        if (state.running && fileAt(AT_FDCWD, state.running->path.c_str()) == state.running->file)
            state.executable = state.running->path;
    });
    return state.executable;
}
std::optional<UniqueFd> AuditToken::openFolderAtOnce() const {
    const State& state = *state_;
    if (!state.running) return std::nullopt;
    const std::string& path = state.running->path;
    auto folder = openWithoutLinks(AT_FDCWD, std::string(parentPath(path)), O_PATH | O_DIRECTORY,
                                   Wait::Never);
    if (!folder || !isOnOwnMount(folder->get())) return std::nullopt;
    const auto file =
        openBeneath(folder->get(), std::string(lastPathComponent(path)), O_PATH | O_NOFOLLOW);
    if (!file || fileAt(file->get(), "") != state.running->file) return std::nullopt;
    std::call_once(state.looked, [&] { state.executable = path; });
    return std::move(*folder);
}

}  // namespace platform
