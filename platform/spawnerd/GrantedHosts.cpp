#include "platform/spawnerd/GrantedHosts.h"

#include <fcntl.h>
#include <poll.h>

#include <cerrno>
#include <utility>

#include "platform/spawnerd/Protocol.h"

namespace platform::spawnerd {

namespace {

bool hasEnded(const AuditToken& token) {
    pollfd state{token.pidFd(), POLLIN, 0};
    return ::poll(&state, 1, 0) != 0;
}

/// Of two processes that both live, each has its number to itself.
bool areSame(const AuditToken& one, const AuditToken& other) {
    return one.pid() == other.pid() && !hasEnded(one) && !hasEnded(other);
}

}  // namespace

GrantedHosts::~GrantedHosts() {
    for (auto& [pid, host] : hosts_) host->watch.reset();
}

int GrantedHosts::add(const AuditToken& token, Grant grant) {
    const std::lock_guard lock(mutex_);
    if (hasEnded(token)) return ESRCH;
    Host& host = hosts_[token.pid()];
    if (!host || !areSame(host->token, token)) {
        host = std::make_shared<GrantedHost>(token);
        host->pidFd.reset(::fcntl(token.pidFd(), F_DUPFD_CLOEXEC, 0));
        if (!host->pidFd) {
            const int failure = errno;
            hosts_.erase(token.pid());
            return failure;
        }
        queue_.async([weak = weak_from_this(), host = host] {
            if (auto self = weak.lock()) self->watch(host);
        });
    }
    const std::string executable = grant.executable;
    if (host->grants.size() >= kMaxGrantsPerHost && !host->grants.contains(executable))
        return ENOSPC;
    host->grants[executable] = std::make_shared<const Grant>(std::move(grant));
    return 0;
}

void GrantedHosts::takeBack(const std::function<bool(const Grant&)>& which) {
    const std::lock_guard lock(mutex_);
    for (auto& [pid, host] : hosts_)
        std::erase_if(host->grants, [&](const auto& entry) { return which(*entry.second); });
}

GrantedHosts::Host GrantedHosts::find(const AuditToken& token) const {
    const std::lock_guard lock(mutex_);
    const auto found = hosts_.find(token.pid());
    if (found == hosts_.end() || !areSame(found->second->token, token)) return nullptr;
    return found->second;
}

std::shared_ptr<const Grant> GrantedHosts::grant(const Host& host,
                                                 const std::string& executable) const {
    const std::lock_guard lock(mutex_);
    const auto found = host->grants.find(executable);
    return found == host->grants.end() ? nullptr : found->second;
}

void GrantedHosts::watch(const Host& host) {
    host->watch.emplace(queue_.runLoop(), host->pidFd.get());
    // What waits keeps the host alive: another process may have taken its place in the map.
    host->watch->awaitReadable([weak = weak_from_this(), host] {
        if (auto self = weak.lock()) self->ended(host);
    });
}

void GrantedHosts::ended(const Host& host) {
    queue_.assertCurrent();
    host->watch.reset();
    {
        const std::lock_guard lock(mutex_);
        const auto found = hosts_.find(host->token.pid());
        if (found != hosts_.end() && found->second == host) hosts_.erase(found);
    }
    died_(host);
}

}  // namespace platform::spawnerd
