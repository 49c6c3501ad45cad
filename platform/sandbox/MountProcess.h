#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>

#include "platform/sandbox/SandboxTokens.h"
#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform {

/// A process beside the daemon that gives peers read access to files and directories. For each it
/// forks a child, which clones the mount of the file or directory, makes the clone read-only,
/// nosuid and nodev with all mounts in it, and sends a descriptor on that over a socket. The child
/// does so in a mount namespace of its own, and a user namespace where that takes one, and ends; so
/// it does when it takes too long. A process of its own, since to fork one that has threads and
/// much memory takes long, and stops those threads meanwhile.
///
/// The daemon's end; use from one thread at a time. The process goes with this object, and what it
/// has forked goes with the process.
class MountProcess {
  public:
    /// What goes over the socket, as ordinary data, with the descriptor.
    static constexpr char kGranted[] = "0\n";

    /// Forks it: best before this process has other threads, though it may have some. Error: the
    /// system's.
    static Result<MountProcess> make(std::chrono::seconds patience);
    MountProcess(MountProcess&& other) noexcept;
    MountProcess& operator=(MountProcess&& other) noexcept;
    ~MountProcess();

    /// `socket`, a connected AF_UNIX stream socket, is borrowed. Returns at once, with a descriptor
    /// that is readable once the outcome is known. Error: the system's. Should the process be gone,
    /// another takes its place.
    Result<UniqueFd> grant(const SandboxTokens::File& file, int socket);
    /// 0 when the descriptor has been sent, else the errno that was met: ESTALE when the path leads
    /// to another file by now, ELOOP when it does through a symbolic link, ETIMEDOUT when it took
    /// too long.
    static int outcomeAt(const UniqueFd& end);

    pid_t pid() const { return pid_; }

  private:
    MountProcess(pid_t pid, UniqueFd socket, std::chrono::seconds patience)
        : pid_(pid), socket_(std::move(socket)), patience_(patience) {}
    std::optional<Error> order(const SandboxTokens::File& file, int socket, int end) const;
    void end();

    pid_t pid_;  // 0 once moved from
    UniqueFd socket_;
    std::chrono::seconds patience_;
};

}  // namespace platform
