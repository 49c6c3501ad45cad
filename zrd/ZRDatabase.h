#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "Zorvan/ZRError.h"
#include "platform/Services.h"
#include "platform/lum/Origin.h"
#include "platform/system/Files.h"
#include "platform/tandry/Workspace.h"
#include "platform/threads/SyncQueue.h"
#include "zrd/PlugInContext.h"

namespace zorvan {

class ZRDAnnotationStore;
class ZRDPlugIn;

using ZRDPlugInRef = std::shared_ptr<ZRDPlugIn>;
using ZRDPlugInList = std::vector<ZRDPlugInRef>;

/// Told about plug-ins that go.
class ZRDatabaseDelegate {
  public:
    /// The plug-ins are about to be uninstalled, and have left the database's cache. Called on a
    /// thread of the registry; the database may be used.
    virtual void removedPlugIns(const platform::TDPlugInProxyList& plugIns) = 0;

  protected:
    ~ZRDatabaseDelegate() = default;
};

/// The daemon's view of the installed plug-ins: the registry is the source of truth, this keeps
/// records that were built from it, and the user's annotations. One a process; `ZRDServer` derives
/// from it.
///
/// Every operation may be called from any thread unless it says otherwise; the cache and the store
/// are only touched on the queue "ZRDatabase", which operations enter synchronously, so none may be
/// called from inside it.
class ZRDatabase : public AnnotationReader, public platform::WorkspaceObserver {
  public:
    virtual ~ZRDatabase();

    /// Held weakly; none until set, which must happen before the registry is activated.
    void setDelegate(std::weak_ptr<ZRDatabaseDelegate> delegate) {
        delegate_ = std::move(delegate);
    }

    /// The most records that the cache may hold before it is emptied. 0 until set.
    std::uint32_t cacheLimit() const { return cacheLimit_; }
    void setCacheLimit(std::uint32_t limit) { cacheLimit_ = limit; }

    /// The record of a plug-in, from the cache or built now. Null when none can be built.
    ZRDPlugInRef plugInForProxy(const platform::TDPlugInProxyRef& proxy);
    /// The record with a UUID. Null for an unknown one, which is logged, and when none can be
    /// built.
    ZRDPlugInRef findPlugIn(const platform::Uuid& uuid);
    /// Whether the registry has it; no record is looked for, nor made.
    bool isRegistered(const platform::Uuid& uuid) {
        return workspace().plugInWithUuid(uuid) != nullptr;
    }
    /// The record of the plug-in bundle at a path; null, which is logged, when none is registered
    /// there.
    ZRDPlugInRef findPlugInAtPath(const std::string& bundlePath);
    /// The records of an application's plug-ins, in the registry's order. None for an application
    /// without plug-ins and for what is no application.
    std::optional<ZRDPlugInList> plugInsWithinApplication(const std::string& bundlePath);
    /// The records that a query (a rules dictionary, or null) may match, each once: what the
    /// registry selects and the user's election admits. None when the registry's query fails.
    std::optional<ZRDPlugInList> findPlugIns(const platform::Dictionary* query);

    /// Registers, or unregisters, the bundle at a path with the registry, which judges whether the
    /// requester may. None on success.
    std::optional<ZRError> addPlugIn(const std::string& bundlePath, platform::Requester requester);
    std::optional<ZRError> removePlugIn(const std::string& bundlePath,
                                        platform::Requester requester);

    std::optional<platform::Dictionary> annotationForPlugIn(const ZRDPlugIn& plugIn) override;
    /// Whether a change of the plug-in's annotation could be stored together with all others.
    bool hasRoomForAnnotation(const platform::Dictionary& annotation, const ZRDPlugIn& plugIn);
    /// Whether it would be within what one origin may have stored.
    bool hasShareForAnnotation(const platform::Dictionary& annotation, const ZRDPlugIn& plugIn,
                               const platform::Origin& origin);
    /// Merges `annotation` into the plug-in's, or removes that, and saves. Always answers none: a
    /// failed save is logged, and the change kept. Hosts' data belongs to the origin, if given.
    std::optional<ZRError> setAnnotation(
        const std::optional<platform::Dictionary>& annotation, const ZRDPlugIn& plugIn,
        const std::optional<platform::Origin>& origin = std::nullopt,
        platform::Sync sync = platform::Sync::Yes);
    /// After changes that were saved without a sync.
    void syncAnnotations();
    /// Tells whoever listens that annotations, and with them match results, have changed.
    void notifyAnnotationChange();

    void pluginsDidInstall(const platform::TDPlugInProxyList& plugIns) override;
    void pluginsWillUninstall(const platform::TDPlugInProxyList& plugIns) override;

  protected:
    explicit ZRDatabase(platform::Services services);

    /// Completes the construction; `self` is this very object. False when there is no registry.
    bool initWithDatabase(const std::optional<std::string>& path,
                          const std::shared_ptr<ZRDatabase>& self);

    const platform::Services& services() const { return services_; }
    platform::Workspace& workspace() { return *services_.workspace; }

  private:
    // On sync_ only.
    ZRDPlugInRef recordForProxy(const platform::TDPlugInProxyRef& proxy);
    ZRDPlugInRef createPlugInForProxy(const platform::TDPlugInProxyRef& proxy);
    void purgeCachesToLimit(std::uint32_t limit);
    void autoElect(const ZRDPlugIn& plugIn);

    std::optional<platform::TDPlugInProxyList> candidates(const platform::Dictionary* query);
    bool electionAdmits(const std::unordered_set<std::string>& patterns,
                        const std::optional<std::string>& identifier,
                        const platform::Dictionary& entitlements);

    const platform::Services services_;
    std::weak_ptr<ZRDatabaseDelegate> delegate_;
    std::atomic<std::uint32_t> cacheLimit_{0};
    platform::SyncQueue sync_{"ZRDatabase"};
    std::shared_ptr<PlugInContext> context_;
    std::unique_ptr<ZRDAnnotationStore> annotations_;         // guarded by sync_
    std::unordered_map<platform::Uuid, ZRDPlugInRef> cache_;  // guarded by sync_
    std::atomic<std::size_t> cacheCount_{0};                  // size of cache_, for log lines
    std::unique_ptr<platform::Workspace::Observation> observation_;  // the first to go
};

}  // namespace zorvan
