#pragma once

#include <sys/types.h>

#include "platform/sandbox/SandboxTokens.h"
#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform {

/// A child process that gives a peer read access to one file or directory: it clones the mount of
/// it, makes the clone read-only, nosuid and nodev with all mounts in it, and sends a descriptor on
/// that over a socket. It does so in a mount namespace of its own, and a user namespace where that
/// takes one, and ends. Killed and reaped with this object.
class MountChild {
  public:
    /// What goes over the socket, as ordinary data, with the descriptor.
    static constexpr char kGranted[] = "0\n";

    /// `socket`, a connected AF_UNIX stream socket, is borrowed. Fit for processes with several
    /// threads; returns at once. Error: the system's.
    static Result<MountChild> start(const SandboxTokens::File& file, int socket);
    MountChild(MountChild&& other) noexcept;
    MountChild& operator=(MountChild&&) = delete;
    ~MountChild();

    /// Borrows; readable once the child has ended.
    int pidFd() const { return pidFd_.get(); }
    /// Has a child that takes too long end soon, with the outcome ETIMEDOUT.
    void kill();
    /// Waits until the child has ended. Answers 0 when it has sent the descriptor, else the errno
    /// that it met: ESTALE when the path leads to another file by now, ELOOP when it does through a
    /// symbolic link.
    int reap();

  private:
    MountChild(pid_t pid, UniqueFd pidFd) : pid_(pid), pidFd_(std::move(pidFd)) {}

    pid_t pid_;  // 0 once reaped
    UniqueFd pidFd_;
    bool killed_ = false;
};

}  // namespace platform
