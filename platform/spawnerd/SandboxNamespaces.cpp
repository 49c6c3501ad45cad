#include "platform/spawnerd/SandboxNamespaces.h"

#include <fcntl.h>
#include <linux/nsfs.h>
#include <sys/ioctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <string>

namespace platform::spawnerd {

Result<SandboxNamespaces> SandboxNamespaces::of(pid_t process, const UniqueFd& pidFd) {
    const std::string path = "/proc/" + std::to_string(process) + "/ns/net";
    SandboxNamespaces found;
    found.network.reset(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!found.network) return Error::posix(errno, path);
    // As it lives now, the number was its own until now.
    if (::syscall(SYS_pidfd_send_signal, pidFd.get(), 0, nullptr, 0) != 0)
        return Error::posix(errno, path);
    // Not the process's own user namespace: that may be one inside by now.
    found.user.reset(::ioctl(found.network.get(), NS_GET_USERNS));
    if (!found.user) return Error::posix(errno, path);
    return found;
}

}  // namespace platform::spawnerd
