#pragma once

#include <sys/types.h>

#include <optional>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform {
struct Parcel;
}

namespace platform::spawnerd {

struct KeeperOrder;
struct SandboxNamespaces;

/// A process beside the daemon that is the parent of all that the launcher starts. It starts what
/// it is told to, and says how that ended. When the daemon ends, however and at whatever moment, it
/// ends everything that it has started, and what that has become or left behind, and goes itself;
/// should it be killed before, what it started ends with it as far as the kernel's parent-death
/// signals reach.
///
/// The daemon's end; use from one thread at a time. Move-only.
class Keeper {
  public:
    /// What is to be started: with the descriptors that it is given and no others, without anything
    /// of the daemon's environment, and as `ChildProcess` has it.
    struct Order {
        std::vector<std::string> words;                // the program's path, and its arguments
        std::vector<std::pair<int, int>> descriptors;  // borrowed, with their numbers in there
    };
    /// A process that was started. It is a child of the keeper, not of this process. Once nobody
    /// has `end`, the keeper ends it.
    struct Child {
        pid_t pid = -1;
        UniqueFd pidFd;
        UniqueFd end;  // readable once it has ended: see `statusAt`
    };

    /// Forks it: best before this process has other threads. Error: the system's.
    static Result<Keeper> make();
    Keeper(Keeper&&) noexcept;
    Keeper& operator=(Keeper&&) = delete;
    /// Ends it, and waits until nothing of what it has started is left.
    ~Keeper();

    /// Readable once the process has ended. Borrows.
    const UniqueFd& pidFd() const { return pidFd_; }

    /// Returns once the program runs. Error: the system's, also that it could not be run; EPIPE
    /// when the keeper is gone.
    Result<Child> run(const Order& order) const;

    /// Bounds what the processes of a sandbox may use of what the kernel counts by user, and, when
    /// it is to be connected, which ports they may take. Error: the system's; what this kernel does
    /// not count is none.
    std::optional<Error> limit(const SandboxNamespaces& namespaces, bool isConnected) const;

    /// What a child's `end` has told: its exit status, or 128 and the number of the signal that
    /// ended it (SIGKILL for one that went with the keeper). None when there is nothing yet.
    static std::optional<int> statusAt(const UniqueFd& end);

  private:
    Keeper(pid_t pid, UniqueFd pidFd, UniqueFd socket)
        : pid_(pid), pidFd_(std::move(pidFd)), socket_(std::move(socket)) {}

    Result<Parcel> ask(const KeeperOrder& order, std::span<const int> descriptors) const;

    pid_t pid_;  // 0 once moved from
    UniqueFd pidFd_;
    UniqueFd socket_;
};

}  // namespace platform::spawnerd
