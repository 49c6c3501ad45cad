#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/lum/Listener.h"
#include "platform/lum/PeerLooks.h"
#include "platform/lum/Pool.h"
#include "platform/sandbox/BusyFolder.h"
#include "platform/spawnerd/GrantedHosts.h"
#include "platform/spawnerd/Instance.h"
#include "platform/spawnerd/InstanceGroups.h"
#include "platform/spawnerd/Keeper.h"
#include "platform/spawnerd/Launcher.h"
#include "platform/spawnerd/SpawnRequest.h"
#include "platform/system/Directories.h"
#include "platform/system/UniqueFd.h"
#include "platform/threads/SerialQueue.h"

namespace platform::spawnerd {

/// The programs that are used; tests use others.
struct Programs {
    std::string bubblewrap = kBubblewrap;
    std::string pasta = kPasta;
};

/// The service that hosts ask to start what they were granted, and the instances that run.
///
/// An instance belongs to the host process, not to a connection: it ends when the plug-in exits,
/// when the host asks for that or ends, when the plug-in is removed, and with the daemon.
/// Everything happens on the loop unless it says otherwise.
class SpawnService : public std::enable_shared_from_this<SpawnService> {
  public:
    static std::shared_ptr<SpawnService> make(Directories directories, std::string daemonService,
                                              std::shared_ptr<RunLoop> loop,
                                              LauncherSettings settings,
                                              std::function<void()> failed, Programs programs);
    SpawnService(const SpawnService&) = delete;
    /// Ends the instances. On the loop, or where it does not run.
    ~SpawnService();

    /// Begins to listen; an error line when that cannot be done.
    void listen();

    /// As `Launcher::grantExternalService`. From any thread.
    int grant(const AuditToken& host, Grant grant);
    /// As `Launcher::removeExternalServices`. From any thread.
    void takeBack(const std::string& bundlePath);
    /// As `Launcher::terminatePlugInInstances`, for the grants for which `which` holds and what was
    /// started by them, with a completion that is told whether there were any instances, on the
    /// loop. From any thread.
    void terminate(const std::function<bool(const Grant&)>& which,
                   std::function<void(bool found)> completion);

    /// As `Launcher::shutDown`. On the queue.
    void shutDown(std::function<void()> completion);

    /// From any thread.
    SerialQueue& queue() { return queue_; }

  private:
    using Waiter = std::function<void(int status)>;
    using Host = GrantedHosts::Host;
    struct Running {
        Host host;
        std::shared_ptr<const Grant> grant;
        std::vector<std::string> arguments;
        std::optional<Pool::Share> share;      // of the instances that there may be
        std::optional<BusyFolder> busyFolder;  // from its start on
        std::optional<SpawnRequest> starting;  // until it is answered
        UniqueFd connection;                   // the host's end, until then
        std::unique_ptr<Instance> instance;    // null while its places are being opened
        std::vector<Waiter> waiters;
    };

    SpawnService(Directories directories, std::string daemonService, std::shared_ptr<RunLoop> loop,
                 LauncherSettings settings, std::function<void()> failed, Programs programs);

    void watchKeeper();
    void accept(const std::shared_ptr<Connection>& connection);
    void serve(const Host& host, const SpawnRequest& request);

    // SpawnServiceStart.cpp:
    void start(const Host& host, const SpawnRequest& request);
    /// Draws from the instances that there may be; the error says that there are too many.
    Result<Pool::Share> drawFor(const Host& host);
    /// Opens what the grant of an instance names, where only its host waits for it.
    void open(std::uint64_t id);
    void opened(std::uint64_t id, Result<GrantedPlaces> places);
    std::optional<Error> spawn(std::uint64_t id, GrantedPlaces places);
    /// What the grant allows, as narrow as the host is.
    Allowance allowanceFor(const Running& running) const;
    void runs(std::uint64_t id);
    /// Refuses what was asked for, and forgets it.
    void fail(std::uint64_t id, const Error& error);

    void awaitEnd(const Host& host, const SpawnRequest& request, bool kill);
    std::vector<std::uint64_t> instancesWith(
        const std::function<bool(const Running&)>& property) const;
    /// Ends an instance. One that was not started yet is gone at once.
    void end(std::uint64_t id);
    void ended(std::uint64_t id, int status);
    void hostDied(const Host& host);
    void finishShutDown();

    const Directories directories_;
    const std::string daemonService_;
    const std::shared_ptr<RunLoop> loop_;
    const LauncherSettings settings_;
    const std::function<void()> failed_;
    const Programs programs_;
    const Result<Keeper> keeper_;  // parent of all instances, and so goes after them
    SerialQueue queue_;
    PeerLooks looks_;
    std::shared_ptr<GrantedHosts> hosts_;  // set once, before this object is shared
    std::unique_ptr<Listener> listener_;
    InstanceGroups groups_;
    std::uint64_t lastId_ = 0;
    Pool pool_;
    std::map<std::uint64_t, Running> instances_;
    std::function<void()> shutDownDone_;  // while a shut-down waits for the instances
    RunLoop::Timer shutDownTimer_;
    std::optional<RunLoop::Watch> keeperWatch_;
};

}  // namespace platform::spawnerd
