#include "zrd/HostExecutable.h"

#include <utility>

#include "Zorvan/LogHandles.h"
#include "platform/system/Files.h"

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

std::optional<HostExecutable> HostExecutable::atOnce(const AuditToken& token,
                                                     platform::CodeSigning& signing) {
    const auto folder = token.openFolderAtOnce();
    if (!folder) return std::nullopt;
    const std::string& path = *token.executablePath();
    if (path.size() >= kMaxExecutablePath) return std::nullopt;
    auto task = signing.makeTaskAtOnce(token, folder->get());
    if (!task) return std::nullopt;
    const bool isInBundle = platform::LumBundle::isAt(folder->get());
    auto bundle =
        ZRBundle::initWithPath(isInBundle ? std::string(platform::parentPath(path)) : path);
    return HostExecutable{path, std::move(bundle), std::move(task)};
}

void HostExecutable::find(const platform::Connection& host,
                          std::shared_ptr<platform::CodeSigning> signing,
                          platform::PeerLooks& looks, std::function<void(HostExecutable)> use) {
    const AuditToken& token = host.auditToken();
    if (auto executable = atOnce(token, *signing)) return use(*std::move(executable));
    auto found = std::make_shared<HostExecutable>();
    looks.look(
        host.origin(),
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
