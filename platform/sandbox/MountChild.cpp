#include "platform/sandbox/MountChild.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <utility>

namespace platform {

namespace {

// The daemon has threads, so what runs in the child before it ends allocates nothing, takes no lock
// and only makes system calls: the functions below answer 0 or an errno, and descriptors lie at
// fixed numbers.
constexpr int kSocket = 0;
constexpr int kTree = 1;
constexpr const char* kTreePath = "/proc/self/fd/1";

/// Leaves nothing of the daemon's open in the child: locks and connections must not outlive it
/// there.
int keepOnlySocket(int socket) {
    if (socket != kSocket && ::dup2(socket, kSocket) < 0) return errno;
    if (::close_range(kSocket + 1, ~0U, 0) != 0) return errno;
    return 0;
}

/// Root needs no user namespace, and may be denied one; others need one for the right to mount.
int enterNamespace() {
    if (::unshare(CLONE_NEWNS) == 0) return 0;
    return ::unshare(CLONE_NEWUSER | CLONE_NEWNS) == 0 ? 0 : errno;
}

/// Clones the mount below the path, if it leads to the very file without a symbolic link. The path
/// is opened here since a descriptor from outside the namespace cannot be cloned.
int cloneMount(const char* path, const FileIdentity& identity) {
    open_how how{};
    how.flags = O_PATH | O_CLOEXEC;
    how.resolve = RESOLVE_NO_SYMLINKS;
    const auto file = static_cast<int>(::syscall(SYS_openat2, AT_FDCWD, path, &how, sizeof how));
    if (file < 0) return errno;
    struct stat status {};
    if (::fstat(file, &status) != 0) return errno;
    if (FileIdentity::of(status) != identity) return ESTALE;
    const int tree =
        ::open_tree(file, "", OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC | AT_EMPTY_PATH | AT_RECURSIVE);
    if (tree < 0) return errno;
    // Private: mounts that others make later do not turn up in the clone.
    mount_attr attributes{};
    attributes.attr_set = MOUNT_ATTR_RDONLY | MOUNT_ATTR_NOSUID | MOUNT_ATTR_NODEV;
    attributes.propagation = MS_PRIVATE;
    if (::mount_setattr(tree, "", AT_EMPTY_PATH | AT_RECURSIVE, &attributes, sizeof attributes) !=
        0)
        return errno;
    ::close(file);
    if (tree == kTree) return 0;
    if (::dup2(tree, kTree) < 0) return errno;
    ::close(tree);
    return 0;
}

/// The descriptor is open for reading, for peers without a /proc to reopen it through. The clone's
/// own descriptor is closed before anything is sent: with that, the clone belongs to no namespace
/// any more, and a peer with rights to mount in one of its own cannot make it writable, nor clone
/// or mount it.
int sendOpened() {
    const int opened = ::open(kTreePath, O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
    if (opened < 0) return errno;
    ::close(kTree);
    char granted[sizeof MountChild::kGranted];
    std::memcpy(granted, MountChild::kGranted, sizeof granted);
    iovec data{granted, sizeof granted - 1};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof opened)] = {};
    msghdr message{};
    message.msg_iov = &data;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof opened);
    std::memcpy(CMSG_DATA(header), &opened, sizeof opened);
    return ::sendmsg(kSocket, &message, MSG_NOSIGNAL | MSG_DONTWAIT) >= 0 ? 0 : errno;
}

int sendMount(const char* path, const FileIdentity& identity, int socket) {
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (int error = keepOnlySocket(socket)) return error;
    if (int error = enterNamespace()) return error;
    if (int error = cloneMount(path, identity)) return error;
    return sendOpened();
}

}  // namespace

Result<MountChild> MountChild::start(const SandboxTokens::File& file, int socket) {
    const char* path = file.path.c_str();
    const pid_t pid = ::fork();
    if (pid == 0) ::_exit(sendMount(path, file.identity, socket));
    if (pid < 0) return Error::posix(errno, "fork");
    MountChild child(pid, UniqueFd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0))));
    if (!child.pidFd_) return Error::posix(errno, "pidfd_open");
    return child;
}

MountChild::MountChild(MountChild&& other) noexcept
    : pid_(std::exchange(other.pid_, 0)), pidFd_(std::move(other.pidFd_)), killed_(other.killed_) {}

MountChild::~MountChild() {
    if (pid_ == 0) return;
    kill();
    reap();
}

void MountChild::kill() {
    if (pid_ == 0) return;
    killed_ = true;
    ::kill(pid_, SIGKILL);
}

int MountChild::reap() {
    int status = 0;
    pid_t reaped = -1;
    while ((reaped = ::waitpid(pid_, &status, 0)) < 0 && errno == EINTR) {
    }
    pid_ = 0;
    if (reaped < 0) return errno;
    if (WIFEXITED(status)) return WEXITSTATUS(status);
    return killed_ ? ETIMEDOUT : EIO;
}

}  // namespace platform
