#include "platform/spawnerd/SpawnService.h"

#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/spawnerd/Launcher.h"
#include "platform/spawnerd/Protocol.h"

namespace platform::spawnerd {

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

void SpawnService::serve(const Host& host, const SpawnRequest& request) {
    const auto* what = request.text(kRequest);
    if (!what) return request.refuse(Error::posix(EINVAL, "\"request\" is missing"));
    if (*what == kStart) return start(host, request);
    if (*what == kWait) return awaitEnd(host, request, false);
    if (*what == kTerminate) return awaitEnd(host, request, true);
    request.refuse(Error::posix(ENOSYS, "unrecognized request"));
}

void SpawnService::awaitEnd(const Host& host, const SpawnRequest& request, bool kill) {
    const auto id = request.instance();
    if (!id) return request.refuse(Error::posix(EINVAL, "\"instance\" is missing"));
    const auto found = instances_.find(*id);
    if (!host || found == instances_.end() || found->second.host != host) {
        if (host)
            for (const auto& [ended, status] : host->ended)
                if (ended == *id) return request.replyStatus(status);
        return request.refuse(Error::posix(ESRCH, "no instance of this process"));
    }
    Running& running = found->second;
    if (running.waiters.size() >= kMaxWaitersPerInstance)
        return request.refuse(Error::posix(EBUSY, "too many requests wait for this instance"));
    running.waiters.push_back(
        [later = request.withoutTurn()](int status) { later.replyStatus(status); });
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

void SpawnService::ended(std::uint64_t id, int status) {
    auto node = instances_.extract(id);
    Running& running = node.mapped();
    running.busyFolder.reset();
    if (running.starting)
        running.starting->refuse(Error::posix(EIO, "the sandbox of " + running.grant->executable));
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
