#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/lum/Listener.h"
#include "platform/threads/SerialQueue.h"
#include "zrd/HoldList.h"
#include "zrd/ZRDUserPrefs.h"
#include "zrd/ZRDatabase.h"

namespace zorvan {

/// The daemon's one long-lived object: the plug-in database, the listener on the named service, the
/// queues and the user's preferences. Every connection becomes a `ZRDLumClient`; every request runs
/// on the queue "service", one after another.
///
/// Made on the main thread, whose run loop it uses, and shared with its clients.
class ZRDServer final : public ZRDatabase,
                        public ZRDatabaseDelegate,
                        public std::enable_shared_from_this<ZRDServer> {
  public:
    /// The server of a service, listening but not yet accepting. `databasePath` is the annotation
    /// file's, or none for the default place. Null when there is no registry or the service's name
    /// cannot be had, which is logged.
    static std::shared_ptr<ZRDServer> initForService(const std::string& serviceName,
                                                     const std::optional<std::string>& databasePath,
                                                     const platform::Services& services);
    ~ZRDServer() override;

    /// The process's server; null before there is one.
    static std::shared_ptr<ZRDServer> server();

    /// Begins to accept and runs the main run loop; returns when the loop is stopped.
    void run();

    /// Has the launcher end running instances of these plug-ins, one after another; what it reports
    /// is logged.
    void removedPlugIns(const platform::TDPlugInProxyList& plugIns) override;

    // Holds. Each enters the queue "serverSync" synchronously: from any thread, but not from
    // inside.
    /// Whether any hold, of whichever client, has the plug-in, or the place where it lies.
    bool holdOnPlugIn(const ZRDPlugIn& plugIn);
    std::vector<std::shared_ptr<ZRDPlugInHold>> holds();
    /// Adds a hold, which also takes its plug-ins back from the hosts that they were made ready
    /// for, and, like the two that release holds, posts the change notification.
    void addHold(const std::shared_ptr<ZRDPlugInHold>& hold);
    /// Releases the hold with a token; an unknown one is ignored.
    void unholdToken(const platform::Uuid& token);
    /// Releases every hold of this very client.
    void unholdClient(const ZRDLumClient& client);

    /// Runs `work` on the service queue, after all work submitted before. From any thread.
    void submitWork(std::function<void()> work) { mainQueue_.async(std::move(work)); }
    /// The same beside the service queue, for work that waits for the registry.
    void submitRegistration(std::function<void()> work) { registrations_.async(std::move(work)); }

    std::uint32_t verbose() const { return verbose_; }
    void setVerbose(std::uint32_t count) { verbose_ = count; }
    platform::SerialQueue& lumQueue() { return lumQueue_; }
    platform::SerialQueue& mainQueue() { return mainQueue_; }
    platform::Listener& service() { return *service_; }
    ZRDUserPrefs& userPrefs() { return *userPrefs_; }

    /// What clients draw their holds from. From any thread.
    platform::Pool& holdPool() { return holdPool_; }

    using ZRDatabase::services;

  private:
    static constexpr std::size_t kMaxHolds = 16384;

    explicit ZRDServer(const platform::Services& services);
    bool listen(const std::string& serviceName);
    void admit(const std::shared_ptr<platform::Connection>& connection);

    std::atomic<std::uint32_t> verbose_{0};
    platform::SerialQueue lumQueue_;
    platform::Pool holdPool_{kMaxHolds};
    platform::SyncQueue syncQueue_{"serverSync"};
    HoldList holds_;                     // guarded by syncQueue_
    std::atomic<bool> areHolds_{false};  // whether it has any; changed there
    std::unique_ptr<platform::Listener> service_;
    std::unique_ptr<ZRDUserPrefs> userPrefs_;
    // The last members: they go first, and the work that still waits in them uses the others.
    platform::SerialQueue mainQueue_;
    platform::SerialQueue registrations_;  // ends first: it hands on to the one before
};

}  // namespace zorvan
