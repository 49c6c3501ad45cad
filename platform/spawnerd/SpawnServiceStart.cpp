// From a host's "start" to a plug-in that runs.

#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/sandbox/Namespaces.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/spawnerd/SandboxProfile.h"
#include "platform/spawnerd/SpawnService.h"

namespace platform::spawnerd {

namespace {

/// A plug-in that is not started is one that was never made ready, or is not ready any more.
Error notReady(const std::string& executable) {
    EVLOG_INFO(ops(), "refusing to start {}: it was not made ready for its host", executable);
    return Error::posix(EPERM, "this process may not start " + executable);
}

}  // namespace

Result<Pool::Share> SpawnService::drawFor(const Host& host) {
    const auto own = std::ranges::count_if(
        instances_, [&](const auto& entry) { return entry.second.host == host; });
    if (static_cast<std::size_t>(own) >= kMaxInstancesPerHost)
        return Error::posix(EAGAIN, "this process has started too many plug-ins");
    if (instances_.size() >= kMaxInstances)
        return Error::posix(EAGAIN, "too many plug-ins are running");
    auto share = pool_.draw(Origin::of(host->token));
    if (!share)
        return Error::posix(EAGAIN, "those that this process belongs with run too many plug-ins");
    return std::move(*share);
}

void SpawnService::start(const Host& host, const SpawnRequest& request) {
    const auto* text = request.text(kExecutable);
    if (!text) return request.refuse(Error::posix(EINVAL, "\"executable\" is missing"));
    const std::string executable = text->string();
    const auto arguments = request.arguments();
    if (!arguments) return request.refuse(arguments.error());
    auto grant = host ? hosts_->grant(host, executable) : nullptr;
    if (!grant) return request.refuse(notReady(executable));
    auto share = drawFor(host);
    if (!share) return request.refuse(share.error());
    const std::uint64_t id = ++lastId_;
    Running& running = instances_[id];
    running.share = std::move(*share);
    running.host = host;
    running.grant = std::move(grant);
    running.arguments = *arguments;
    running.starting = request;
    open(id);
}

void SpawnService::open(std::uint64_t id) {
    const Running& running = instances_.at(id);
    const auto& grant = running.grant;
    auto places = std::make_shared<std::optional<Result<GrantedPlaces>>>();
    looks_.look(
        Origin::of(running.host->token),
        [places, grant, directories = directories_](PeerLooks::Pace&) {
            places->emplace(GrantedPlaces::open(*grant, directories));
        },
        [places, grant, id, weak = weak_from_this()](bool isDone, std::size_t) {
            auto self = weak.lock();
            if (!self) return;
            if (isDone) return self->opened(id, std::move(**places));
            self->opened(id, Error::posix(ETIMEDOUT, grant->bundle.path));
        });
}

void SpawnService::opened(std::uint64_t id, Result<GrantedPlaces> places) {
    const auto found = instances_.find(id);
    if (found == instances_.end()) return;  // it was ended meanwhile
    Running& running = found->second;
    // Without the connection over which it was asked for, nobody could ever speak to it.
    if (running.starting->isAbandoned()) return end(id);
    auto grant = hosts_->grant(running.host, running.grant->executable);
    if (!grant) return fail(id, notReady(running.grant->executable));
    if (grant != running.grant) {
        // It was made ready anew, perhaps in another place.
        running.grant = std::move(grant);
        return open(id);
    }
    if (auto error = places ? spawn(id, std::move(*places)) : places.error()) {
        EVLOG_ERROR(ops(), "cannot start {}: {}", running.grant->executable, pub(*error));
        fail(id, *error);
    }
}

Allowance SpawnService::allowanceFor(const Running& running) const {
    Allowance allowance = spawnerd::allowanceFor(*running.grant, settings_);
    const AuditToken& host = running.host->token;
    // What confines a host may keep it from the network in ways that do not show.
    allowance.network &= sharesNamespace(host, NamespaceKind::Network) && !isConfined(host);
    return allowance;
}

std::optional<Error> SpawnService::spawn(std::uint64_t id, GrantedPlaces places) {
    if (!keeper_) return keeper_.error();
    Running& running = instances_.at(id);
    const Grant& grant = *running.grant;
    auto busyFolder = BusyFolder::make(directories_, grant.bundleIdentifier, grant.bundle.path);
    if (!busyFolder) return busyFolder.error();
    const Surroundings surroundings{.allowance = allowanceFor(running),
                                    .busyFolder = busyFolder->path()};
    const Allowance& allowance = surroundings.allowance;
    running.busyFolder.emplace(std::move(*busyFolder));
    auto group = groups_.make(id, allowance.limits);
    if (!group) return group.error();
    const auto setup =
        sandboxSetup(grant, std::move(places), directories_, daemonService_, surroundings);
    if (!setup) return setup.error();
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0)
        return Error::posix(errno, "no connection");
    running.connection.reset(ends[0]);
    const UniqueFd plugInEnd(ends[1]);

    std::vector<std::string> command{grant.executable};
    command.insert(command.end(), running.arguments.begin(), running.arguments.end());
    auto process =
        SandboxedProcess::spawn(*keeper_, programs_.bubblewrap, *setup, command, plugInEnd);
    if (!process) return process.error();
    running.instance = std::make_unique<Instance>(
        *loop_, *keeper_, programs_.pasta, std::move(*process), grant.bundleIdentifier, allowance,
        std::move(*group), [this, id] { runs(id); }, [this, id](int status) { ended(id, status); });
    return std::nullopt;
}

void SpawnService::runs(std::uint64_t id) {
    Running& running = instances_.at(id);
    EVLOG_INFO(ops(), "client {} has started plug-in {} as instance {}", running.host->token.pid(),
               running.grant->bundleIdentifier, id);
    // Without the connection over which it was asked for, nobody could ever speak to it.
    if (running.starting->isAbandoned()) return end(id);
    Message message = running.starting->emptyReply();
    message.set(kInstance, id);
    message.setDescriptor(std::move(running.connection));
    running.starting->reply(message);
    running.starting.reset();
}

void SpawnService::fail(std::uint64_t id, const Error& error) {
    std::exchange(instances_.at(id).starting, std::nullopt)->refuse(error);
    ended(id, 128 + SIGKILL);
}

}  // namespace platform::spawnerd
