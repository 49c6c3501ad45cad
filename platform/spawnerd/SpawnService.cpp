#include "platform/spawnerd/SpawnService.h"

#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/sandbox/Namespaces.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/spawnerd/Launcher.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/spawnerd/SandboxProfile.h"

namespace platform::spawnerd {

namespace {

const std::string* textAt(const Message& message, const char* key) {
    const Value* value = message.find(key);
    return value ? value->string() : nullptr;
}

/// The arguments of a "start"; none of them when the key is absent.
Result<std::vector<std::string>> argumentsIn(const Message& message) {
    std::vector<std::string> arguments;
    const Value* value = message.find(kArguments);
    if (!value) return arguments;
    if (!value->array()) return Error::posix(EINVAL, "\"arguments\" is no array");
    std::size_t bytes = 0;
    for (const Value& element : *value->array()) {
        const std::string* text = element.string();
        if (!text) return Error::posix(EINVAL, "an argument is no text");
        bytes += text->size();
        if (bytes > kMaxStringBytes || arguments.size() == kMaxStrings)
            return Error::posix(E2BIG, "arguments");
        arguments.push_back(*text);
    }
    return arguments;
}

/// A plug-in that is not started is one that was never made ready, or is not ready any more.
Error notReady(const std::string& executable) {
    EVLOG_INFO(ops(), "refusing to start {}: it was not made ready for its host", executable);
    return Error::posix(EPERM, "this process may not start " + executable);
}

template <class Asked>
void reply(const Asked& asked, const Message& message) {
    if (auto connection = asked.connection.lock()) connection->send(message);
}

template <class Asked>
void refuse(const Asked& asked, const Error& error) {
    Message message = Message::replyTo(asked.message);
    message.set(kErrorCode, error.code);
    message.set(kError, error.text);
    reply(asked, message);
}

template <class Asked>
void replyStatus(const Asked& asked, int status) {
    Message message = Message::replyTo(asked.message);
    message.set(kStatus, status);
    reply(asked, message);
}

}  // namespace

std::shared_ptr<SpawnService> SpawnService::make(Directories directories, std::string daemonService,
                                                 std::shared_ptr<RunLoop> loop,
                                                 LauncherSettings settings,
                                                 std::function<void()> failed, Programs programs) {
    std::shared_ptr<SpawnService> service(
        new SpawnService(std::move(directories), std::move(daemonService), std::move(loop),
                         std::move(settings), std::move(failed), std::move(programs)));
    service->hosts_ = std::make_shared<GrantedHosts>(
        service->queue_, [weak = std::weak_ptr(service)](const Host& host) {
            if (auto self = weak.lock()) self->hostDied(host);
        });
    return service;
}

SpawnService::SpawnService(Directories directories, std::string daemonService,
                           std::shared_ptr<RunLoop> loop, LauncherSettings settings,
                           std::function<void()> failed, Programs programs)
    : directories_(std::move(directories)),
      daemonService_(std::move(daemonService)),
      loop_(std::move(loop)),
      settings_(std::move(settings)),
      failed_(std::move(failed)),
      programs_(std::move(programs)),
      keeper_(Keeper::make()),
      queue_("spawnerd", *loop_),
      looks_(*loop_),
      pool_(kMaxInstances),
      shutDownTimer_(*loop_) {}

SpawnService::~SpawnService() = default;

void SpawnService::listen() {
    queue_.assertCurrent();
    auto listener = Listener::make(directories_, serviceNameFor(daemonService_), queue_);
    if (!listener) {
        EVLOG_ERROR(ops(), "no plug-in will be started: {}", pub(listener.error()));
        return;
    }
    listener_ = std::move(*listener);
    listener_->setEventHandler(
        [weak = weak_from_this()](const std::shared_ptr<Connection>& connection) {
            if (auto self = weak.lock()) self->accept(connection);
        });
    listener_->resume();
    BusyFolder::sweep(directories_);
    if (!keeper_) {
        EVLOG_ERROR(ops(), "no plug-in will be started: {}", pub(keeper_.error()));
        return;
    }
    keeperWatch_.emplace(*loop_, keeper_->pidFd().get());
    watchKeeper();
    groups_ = InstanceGroups::find();
    if (groups_.areThere())
        EVLOG_DEFAULT(ops(), "plug-ins are limited by groups of their own");
    else
        EVLOG_DEFAULT(ops(),
                      "plug-ins are limited by process, without a limit of memory{}: no group"
                      " of processes is delegated to this daemon",
                      pub(::geteuid() == 0 ? " or processes" : ""));
}

void SpawnService::watchKeeper() {
    keeperWatch_->awaitReadable([this] {
        pollfd state{keeper_->pidFd().get(), POLLIN, 0};
        if (::poll(&state, 1, 0) <= 0) return watchKeeper();
        EVLOG_ERROR(ops(), "the process that keeps plug-ins has ended, and they with it");
        if (failed_) failed_();
    });
}

int SpawnService::grant(const AuditToken& host, Grant grant) {
    return hosts_->add(host, std::move(grant));
}

void SpawnService::takeBack(const std::string& bundlePath) {
    hosts_->takeBack([&](const Grant& grant) { return grant.bundle.path == bundlePath; });
}

void SpawnService::accept(const std::shared_ptr<Connection>& connection) {
    // The connection holds the handler, so the handler must not hold it.
    connection->setEventHandler(
        [weak = weak_from_this(), peer = std::weak_ptr(connection)](const ConnectionEvent& event) {
            const auto* message = std::get_if<Message>(&event);
            auto self = weak.lock();
            auto connection = peer.lock();
            if (message && self && connection)
                self->serve(self->hosts_->find(connection->auditToken()), {peer, *message});
        });
    connection->resume();
}

void SpawnService::serve(const Host& host, const Asked& asked) {
    const std::string* request = textAt(asked.message, kRequest);
    if (!request) return refuse(asked, Error::posix(EINVAL, "\"request\" is missing"));
    if (*request == kStart) return start(host, asked);
    if (*request == kWait) return awaitEnd(host, asked, false);
    if (*request == kTerminate) return awaitEnd(host, asked, true);
    refuse(asked, Error::posix(ENOSYS, "unrecognized request"));
}

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

void SpawnService::start(const Host& host, const Asked& asked) {
    const std::string* executable = textAt(asked.message, kExecutable);
    if (!executable) return refuse(asked, Error::posix(EINVAL, "\"executable\" is missing"));
    const auto arguments = argumentsIn(asked.message);
    if (!arguments) return refuse(asked, arguments.error());
    auto grant = host ? hosts_->grant(host, *executable) : nullptr;
    if (!grant) return refuse(asked, notReady(*executable));
    auto share = drawFor(host);
    if (!share) return refuse(asked, share.error());
    const std::uint64_t id = ++lastId_;
    Running& running = instances_[id];
    running.share = std::move(*share);
    running.host = host;
    running.grant = std::move(grant);
    running.arguments = *arguments;
    running.starting = asked;
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
    if (running.starting->connection.expired()) return end(id);
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
    if (running.starting->connection.expired()) return end(id);
    Message message = Message::replyTo(running.starting->message);
    message.set(kInstance, id);
    message.setDescriptor(std::move(running.connection));
    reply(*running.starting, message);
    running.starting.reset();
}

void SpawnService::awaitEnd(const Host& host, const Asked& asked, bool kill) {
    const Value* value = asked.message.find(kInstance);
    const auto id = value ? value->unsignedInteger() : std::nullopt;
    if (!id) return refuse(asked, Error::posix(EINVAL, "\"instance\" is missing"));
    const auto found = instances_.find(*id);
    if (!host || found == instances_.end() || found->second.host != host) {
        if (host)
            for (const auto& [ended, status] : host->ended)
                if (ended == *id) return replyStatus(asked, status);
        return refuse(asked, Error::posix(ESRCH, "no instance of this process"));
    }
    Running& running = found->second;
    if (running.waiters.size() >= kMaxWaitersPerInstance)
        return refuse(asked, Error::posix(EBUSY, "too many requests wait for this instance"));
    // Without its contents and its turn: the connection goes on meanwhile.
    Asked later{asked.connection, {}};
    later.message.setSerial(asked.message.serial());
    running.waiters.push_back([later](int status) { replyStatus(later, status); });
    if (kill) end(*id);
}

std::vector<std::uint64_t> SpawnService::instancesWith(
    const std::function<bool(const Running&)>& property) const {
    std::vector<std::uint64_t> found;
    for (const auto& [id, running] : instances_)
        if (property(running)) found.push_back(id);
    return found;
}

void SpawnService::end(std::uint64_t id) {
    if (const auto& instance = instances_.at(id).instance) return instance->kill();
    ended(id, 128 + SIGKILL);
}

void SpawnService::fail(std::uint64_t id, const Error& error) {
    refuse(*std::exchange(instances_.at(id).starting, std::nullopt), error);
    ended(id, 128 + SIGKILL);
}

void SpawnService::ended(std::uint64_t id, int status) {
    auto node = instances_.extract(id);
    Running& running = node.mapped();
    running.busyFolder.reset();
    if (running.starting)
        refuse(*running.starting, Error::posix(EIO, "the sandbox of " + running.grant->executable));
    if (running.instance) {
        EVLOG_INFO(ops(), "instance {} of plug-in {} has ended with status {}", id,
                   running.grant->bundleIdentifier, status);
        auto& last = running.host->ended;
        last.emplace_back(id, status);
        if (last.size() > kMaxEndedPerHost) last.pop_front();
    }
    for (const Waiter& waiter : running.waiters) waiter(status);
    if (shutDownDone_ && instances_.empty()) finishShutDown();
}

void SpawnService::hostDied(const Host& host) {
    for (const auto id : instancesWith([&](const Running& one) { return one.host == host; }))
        end(id);
}

void SpawnService::terminate(const std::function<bool(const Grant&)>& which,
                             std::function<void(bool)> completion) {
    // At once: the same plug-in may be granted anew before the loop has its turn.
    hosts_->takeBack(which);
    queue_.async([weak = weak_from_this(), which, completion = std::move(completion)] {
        auto self = weak.lock();
        if (!self) return;
        const auto found =
            self->instancesWith([&](const Running& one) { return which(*one.grant); });
        if (found.empty()) return completion(false);
        auto left = std::make_shared<std::size_t>(found.size());
        for (const auto id : found) {
            self->instances_.at(id).waiters.push_back([left, completion](int) {
                if (--*left == 0) completion(true);
            });
            self->end(id);
        }
    });
}

void SpawnService::shutDown(std::function<void()> completion) {
    queue_.assertCurrent();
    listener_.reset();
    shutDownDone_ = std::move(completion);
    for (const auto id : instancesWith([](const Running&) { return true; })) end(id);
    if (instances_.empty()) return finishShutDown();
    shutDownTimer_.start(kShutDownPatience, [this] { finishShutDown(); });
}

void SpawnService::finishShutDown() {
    shutDownTimer_.cancel();
    if (const auto completion = std::exchange(shutDownDone_, nullptr)) completion();
}

}  // namespace platform::spawnerd
