#pragma once

#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>

#include "platform/lum/AuditToken.h"
#include "platform/spawnerd/Grant.h"
#include "platform/system/UniqueFd.h"
#include "platform/threads/RunLoop.h"
#include "platform/threads/SerialQueue.h"

namespace platform::spawnerd {

/// A process that may start something.
struct GrantedHost {
    explicit GrantedHost(const AuditToken& audit) : token(audit) {}

    const AuditToken token;
    std::map<std::string, std::shared_ptr<const Grant>> grants;  // guarded by GrantedHosts' mutex

    // The queue's.
    UniqueFd pidFd;  // a duplicate, to be watched
    std::optional<RunLoop::Watch> watch;
    std::deque<std::pair<std::uint64_t, int>> ended;  // its last instances, with their status
};

/// Which processes may start which executables. What is granted goes with its process: a later
/// process with the same number is another one.
class GrantedHosts : public std::enable_shared_from_this<GrantedHosts> {
  public:
    using Host = std::shared_ptr<GrantedHost>;

    /// `died` is called on `queue`, a queue on a run loop, for each host that has ended.
    GrantedHosts(SerialQueue& queue, std::function<void(const Host&)> died)
        : queue_(queue), died_(std::move(died)) {}
    GrantedHosts(const GrantedHosts&) = delete;
    /// On the queue, or where its loop does not run.
    ~GrantedHosts();

    /// Answers 0, ESRCH for a process that has ended, or ENOSPC. From any thread.
    int add(const AuditToken& token, Grant grant);
    /// Takes back, from every host, the grants for which `which` holds. From any thread.
    void takeBack(const std::function<bool(const Grant&)>& which);

    /// The host that a process is; null when nothing was ever granted to it, or it has ended. From
    /// any thread.
    Host find(const AuditToken& token) const;
    /// What a host may start at a path, or null. From any thread.
    std::shared_ptr<const Grant> grant(const Host& host, const std::string& executable) const;

  private:
    void watch(const Host& host);
    void ended(const Host& host);

    SerialQueue& queue_;
    const std::function<void(const Host&)> died_;
    mutable std::mutex mutex_;
    std::map<pid_t, Host> hosts_;  // guarded by mutex_
};

}  // namespace platform::spawnerd
