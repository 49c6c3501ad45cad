#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

#include "platform/system/UniqueFd.h"

namespace platform {

/// Who a peer process is, pinned: its process id cannot come to mean another process while a token
/// lives. Immutable; copies share it; usable from any thread.
class AuditToken {
  public:
    /// The process that connected the other end of `socket` (borrowed, AF_UNIX). Reads, in the
    /// order that pins them to one process: its credentials, a pidfd, its /proc directory, and
    /// through that which file it runs. None when the process is gone already or cannot be told for
    /// sure (on kernels without SO_PEERPIDFD: when it has not started before the connection was
    /// accepted).
    static std::optional<AuditToken> ofPeer(int socket);
    /// This process itself.
    static std::optional<AuditToken> ofSelf();

    pid_t pid() const;
    uid_t uid() const;

    /// Borrowed descriptors: the process's pidfd and its pinned /proc/<pid> directory (O_PATH).
    int pidFd() const;
    int procDirectory() const;

    /// Where the executable lies, when the path that the process runs from names, here, the very
    /// file (device and inode) that it ran when the token was made; otherwise, or when that could
    /// not be read, none. Looked at by the first call, which may hang with the file system.
    const std::optional<std::string>& executablePath() const;
    /// Learns the same without waiting for anybody, and opens (O_PATH) the directory that the
    /// executable lies in: when the kernel knows the way there, that lies on a file system of the
    /// kernel's own, and the executable is there. None when only `executablePath` can tell.
    std::optional<UniqueFd> openFolderAtOnce() const;

  private:
    struct State;
    explicit AuditToken(std::shared_ptr<const State> state) : state_(std::move(state)) {}
    std::shared_ptr<const State> state_;
};

}  // namespace platform
