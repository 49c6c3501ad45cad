#include "platform/spawnerd/SpawnService.h"

#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
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
                                                 LauncherSettings settings, Programs programs) {
    std::shared_ptr<SpawnService> service(
        new SpawnService(std::move(directories), std::move(daemonService), std::move(loop),
                         std::move(settings), std::move(programs)));
    service->hosts_ = std::make_shared<GrantedHosts>(
        service->queue_, [weak = std::weak_ptr(service)](const Host& host) {
            if (auto self = weak.lock()) self->hostDied(host);
        });
    return service;
}

SpawnService::SpawnService(Directories directories, std::string daemonService,
                           std::shared_ptr<RunLoop> loop, LauncherSettings settings,
                           Programs programs)
    : directories_(std::move(directories)),
      daemonService_(std::move(daemonService)),
      loop_(std::move(loop)),
      settings_(std::move(settings)),
      programs_(std::move(programs)),
      keeper_(Keeper::make()),
      queue_("spawnerd", *loop_),
      pool_(kMaxInstances),
      looks_(*loop_),
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
    groups_ = InstanceGroups::find({::getpid(), keeper_->pid()});
    if (groups_.areThere())
        EVLOG_DEFAULT(ops(), "plug-ins are limited by groups of their own");
    else
        EVLOG_DEFAULT(ops(),
                      "plug-ins are limited by process, without a limit of memory{}: no group"
                      " of processes is delegated to this daemon",
                      pub(::geteuid() == 0 ? " or processes" : ""));
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

std::optional<Error> SpawnService::excess(const Host& host) const {
    const auto own = std::ranges::count_if(
        instances_, [&](const auto& entry) { return entry.second.host == host; });
    if (static_cast<std::size_t>(own) >= kMaxInstancesPerHost)
        return Error::posix(EAGAIN, "this process has started too many plug-ins");
    if (instances_.size() >= kMaxInstances)
        return Error::posix(EAGAIN, "too many plug-ins are running");
    return std::nullopt;
}

Result<Pool::Share> SpawnService::drawFor(const Host& host) {
    if (auto error = excess(host)) return *error;
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
    if (!grant) {
        EVLOG_INFO(ops(), "refusing to start {}: it was not made ready for its host", *executable);
        return refuse(asked, Error::posix(EPERM, "this process may not start " + *executable));
    }
    auto share = drawFor(host);
    if (!share) return refuse(asked, share.error());
    const auto running = std::make_shared<Running>();
    running->share = std::move(*share);
    running->host = host;
    running->grant = std::move(grant);
    running->starting = asked;
    openBundle(*running->grant, [this, running, arguments = *arguments](Result<UniqueFd> bundle) {
        const std::string executable = running->grant->executable;
        const Asked starting = *running->starting;
        if (auto error = spawn(std::move(bundle), std::move(*running), arguments)) {
            EVLOG_ERROR(ops(), "cannot start {}: {}", executable, pub(*error));
            refuse(starting, *error);
        }
    });
}

/// Opens the bundle in its place, without holding up the loop if its file system has to be waited
/// for. It was opened before, so that is rare.
void SpawnService::openBundle(const Grant& grant, std::function<void(Result<UniqueFd>)> use) {
    auto bundle = grant.bundle.open(Wait::Never);
    if (bundle || bundle.error().code != EAGAIN) return use(std::move(bundle));
    const auto opened = std::make_shared<Result<UniqueFd>>(UniqueFd());
    looks_.make({{grant.bundle.path, [opened, place = grant.bundle] { *opened = place.open(); }}},
                [weak = weak_from_this(), opened, path = grant.bundle.path,
                 use = std::move(use)](const std::vector<bool>& done) {
                    if (!weak.lock()) return;
                    use(done[0] ? std::move(*opened) : Error::posix(ETIMEDOUT, path));
                });
}

/// Whether what was asked for may still be started.
std::optional<Error> SpawnService::whyNot(const Running& running) const {
    const Host& host = running.host;
    if (!listener_ || hosts_->find(host->token) != host ||
        hosts_->grant(host, running.grant->executable) != running.grant)
        return Error::posix(EPERM, "this process may not start " + running.grant->executable);
    return excess(host);
}

Allowance SpawnService::allowanceFor(const Running& running) const {
    Allowance allowance = spawnerd::allowanceFor(*running.grant, settings_);
    const AuditToken& host = running.host->token;
    // What confines a host may keep it from the network in ways that do not show.
    allowance.network &= sharesNamespace(host, NamespaceKind::Network) && !isConfined(host);
    return allowance;
}

std::optional<Error> SpawnService::spawn(Result<UniqueFd> bundle, Running running,
                                         const std::vector<std::string>& plugInArguments) {
    if (!bundle) return bundle.error();
    if (auto error = whyNot(running)) return error;
    if (!keeper_) return keeper_.error();
    const std::uint64_t id = ++lastId_;
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
        sandboxSetup(grant, std::move(*bundle), directories_, daemonService_, surroundings);
    if (!setup) return setup.error();
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0)
        return Error::posix(errno, "no connection");
    running.connection.reset(ends[0]);
    const UniqueFd plugInEnd(ends[1]);

    std::vector<std::string> command{grant.executable};
    command.insert(command.end(), plugInArguments.begin(), plugInArguments.end());
    auto process =
        SandboxedProcess::spawn(*keeper_, programs_.bubblewrap, *setup, command, plugInEnd);
    if (!process) return process.error();
    running.instance = std::make_unique<Instance>(
        *loop_, *keeper_, programs_.pasta, std::move(*process), grant.bundleIdentifier, allowance,
        std::move(*group), [this, id] { runs(id); }, [this, id](int status) { ended(id, status); });
    instances_.emplace(id, std::move(running));
    return std::nullopt;
}

void SpawnService::runs(std::uint64_t id) {
    Running& running = instances_.at(id);
    EVLOG_INFO(ops(), "client {} has started plug-in {} as instance {}", running.host->token.pid(),
               running.grant->bundleIdentifier, id);
    // Without the connection over which it was asked for, nobody could ever speak to it.
    if (running.starting->connection.expired()) return running.instance->kill();
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
    if (kill) running.instance->kill();
}

void SpawnService::ended(std::uint64_t id, int status) {
    auto node = instances_.extract(id);
    Running& running = node.mapped();
    EVLOG_INFO(ops(), "instance {} of plug-in {} has ended with status {}", id,
               running.grant->bundleIdentifier, status);
    running.busyFolder.reset();
    if (running.starting)
        refuse(*running.starting, Error::posix(EIO, "the sandbox of " + running.grant->executable));
    auto& last = running.host->ended;
    last.emplace_back(id, status);
    if (last.size() > kMaxEndedPerHost) last.pop_front();
    for (const Waiter& waiter : running.waiters) waiter(status);
    if (shutDownDone_ && instances_.empty()) finishShutDown();
}

void SpawnService::hostDied(const Host& host) {
    for (auto& [id, running] : instances_)
        if (running.host == host) running.instance->kill();
}

void SpawnService::terminate(const std::function<bool(const Grant&)>& which,
                             std::function<void(bool)> completion) {
    // At once: the same plug-in may be granted anew before the loop has its turn.
    hosts_->takeBack(which);
    queue_.async([weak = weak_from_this(), which, completion = std::move(completion)] {
        auto self = weak.lock();
        if (!self) return;
        auto left = std::make_shared<std::size_t>(0);
        for (auto& [id, running] : self->instances_) {
            if (!which(*running.grant)) continue;
            ++*left;
            running.waiters.push_back([left, completion](int) {
                if (--*left == 0) completion(true);
            });
            running.instance->kill();
        }
        if (*left == 0) completion(false);
    });
}

void SpawnService::shutDown(std::function<void()> completion) {
    queue_.assertCurrent();
    listener_.reset();
    shutDownDone_ = std::move(completion);
    for (auto& [id, running] : instances_) running.instance->kill();
    if (instances_.empty()) return finishShutDown();
    shutDownTimer_.start(kShutDownPatience, [this] { finishShutDown(); });
}

void SpawnService::finishShutDown() {
    shutDownTimer_.cancel();
    if (const auto completion = std::exchange(shutDownDone_, nullptr)) completion();
}

}  // namespace platform::spawnerd
