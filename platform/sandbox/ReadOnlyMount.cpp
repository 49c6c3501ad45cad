#include "platform/sandbox/ReadOnlyMount.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <utility>

#include "platform/system/Parcel.h"
#include "platform/system/UniqueFd.h"

namespace platform {

namespace {

/// Root needs no user namespace, and may be denied one; others need one for the right to mount.
int enterNamespace() {
    if (::unshare(CLONE_NEWNS) == 0) return 0;
    return ::unshare(CLONE_NEWUSER | CLONE_NEWNS) == 0 ? 0 : errno;
}

/// Clones the mount below the path, if it leads to the very file without a symbolic link. The path
/// is opened here since a descriptor from outside the namespace cannot be cloned.
int cloneMount(const char* path, const FileIdentity& identity, UniqueFd& tree) {
    open_how how{};
    how.flags = O_PATH | O_CLOEXEC;
    how.resolve = RESOLVE_NO_SYMLINKS;
    const UniqueFd file(static_cast<int>(::syscall(SYS_openat2, AT_FDCWD, path, &how, sizeof how)));
    if (!file) return errno;
    struct stat status {};
    if (::fstat(file.get(), &status) != 0) return errno;
    if (FileIdentity::of(status) != identity) return ESTALE;
    tree.reset(::open_tree(file.get(), "",
                           OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC | AT_EMPTY_PATH | AT_RECURSIVE));
    if (!tree) return errno;
    // Private: mounts that others make later do not turn up in the clone.
    mount_attr attributes{};
    attributes.attr_set = MOUNT_ATTR_RDONLY | MOUNT_ATTR_NOSUID | MOUNT_ATTR_NODEV;
    attributes.propagation = MS_PRIVATE;
    return ::mount_setattr(tree.get(), "", AT_EMPTY_PATH | AT_RECURSIVE, &attributes,
                           sizeof attributes) == 0
               ? 0
               : errno;
}

}  // namespace

int sendReadOnlyMount(const char* path, const FileIdentity& identity, int socket,
                      std::string_view text) {
    if (int error = enterNamespace()) return error;
    UniqueFd tree;
    if (int error = cloneMount(path, identity, tree)) return error;
    // Open for reading, for peers without a /proc to reopen it through.
    const std::string opening = "/proc/self/fd/" + std::to_string(tree.get());
    const UniqueFd opened(::open(opening.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
    if (!opened) return errno;
    // The clone's own descriptor is closed before anything is sent: with that, the clone belongs to
    // no namespace any more, and a peer with rights to mount in one of its own cannot make it
    // writable, nor clone or mount it.
    tree.reset();
    const int descriptor = opened.get();
    const auto failure = Parcel::send(socket, text, std::span(&descriptor, 1));
    return failure ? static_cast<int>(failure->code) : 0;
}

}  // namespace platform
