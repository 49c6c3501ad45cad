#include "zrd/HostExecutable.h"

#include <utility>

#include "Zorvan/LogHandles.h"

namespace zorvan {

using platform::AuditToken;

namespace {

/// Longer executable paths count as not found.
constexpr std::size_t kMaxExecutablePath = 2048;

}  // namespace

HostExecutable HostExecutable::of(const AuditToken& token, platform::CodeSigning& signing) {
    HostExecutable executable;
    const auto& path = token.executablePath();
    if (path && path->size() < kMaxExecutablePath) {
        executable.bundle = ZRBundle::initWithExecutablePath(*path);
        executable.path = *path;
    }
    executable.task = signing.makeTask(token);
    return executable;
}

void HostExecutable::find(const AuditToken& token, std::shared_ptr<platform::CodeSigning> signing,
                          platform::PeerLooks& looks, std::function<void(HostExecutable)> use) {
    auto found = std::make_shared<HostExecutable>();
    looks.look(
        platform::Origin::of(token),
        [found, token, signing = std::move(signing)](platform::PeerLooks::Pace&) {
            *found = of(token, *signing);
        },
        [found, pid = token.pid(), use = std::move(use)](bool isDone, std::size_t) {
            if (isDone) return use(std::move(*found));
            EVLOG_ERROR(ops(),
                        "client {} goes without bundle and entitlements: its executable "
                        "could not be looked at in time",
                        pid);
            use({{}, nullptr, platform::makeUnreadableTask()});
        });
}

}  // namespace zorvan
