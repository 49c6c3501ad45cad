#pragma once

#include <poll.h>
#include <sys/types.h>

#include <map>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform {
struct Parcel;
}

namespace platform::spawnerd {

/// What goes to the keeper: a program to be started, with the pipe for its status first among the
/// descriptors; without words, a sandbox to be limited: its user namespace, and its network
/// namespace behind that when it is to be connected.
struct KeeperOrder {
    std::vector<int> targets;  // of the descriptors behind the first
    std::vector<std::string> words;

    std::string encode() const;
    static std::optional<KeeperOrder> decode(std::string_view bytes);
};

/// What comes back, for a program with its pidfd unless there is an error.
struct KeeperAnswer {
    int error;
    pid_t pid;
};

/// The keeper's own side: see `Keeper`.
class KeeperProcess {
  public:
    /// Where the kernel lists a process's children, if it was built to.
    static constexpr const char* kChildren = "/proc/thread-self/children";

    /// What the process does from its fork to its end. `socket` leads to the daemon.
    [[noreturn]] static void main(int socket);

  private:
    KeeperProcess(UniqueFd socket, UniqueFd childSignals, UniqueFd children)
        : socket_(std::move(socket)),
          childSignals_(std::move(childSignals)),
          children_(std::move(children)) {}

    /// Until the daemon is gone.
    void serve();
    /// One order; false when none will come any more.
    bool obey();
    KeeperAnswer answerTo(Parcel& parcel, UniqueFd& pidFd);
    KeeperAnswer start(const KeeperOrder& order, std::vector<UniqueFd>& descriptors,
                       UniqueFd& pidFd);
    /// Ends those whose end nobody waits for, by the states of `ends_`, in their order: whoever had
    /// them started has failed at taking them over.
    void endForgotten(std::span<const pollfd> states);
    void reap();
    /// Ends what an ended child has left behind, which may be a sandbox whose ties to it were not
    /// knotted yet.
    void endOrphans() const;
    /// Ends everything, and waits until nothing is left.
    void endAll();

    const UniqueFd socket_, childSignals_;
    const UniqueFd children_;         // the kernel's list of this process's children
    std::map<pid_t, UniqueFd> ends_;  // where to tell how a child ended; none for a forgotten one
};

}  // namespace platform::spawnerd
