#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/system/Error.h"
#include "platform/tandry/TDPlugInProxy.h"
#include "platform/tandry/UntouchedBundles.h"

namespace platform {

using TDPlugInProxyList = std::vector<TDPlugInProxyRef>;

/// Told about plug-ins that came and that are about to go, on the registry's thread, one call at a
/// time.
class WorkspaceObserver {
  public:
    virtual void pluginsDidInstall(const TDPlugInProxyList& plugIns) = 0;
    /// The records are hidden from lookups already; the catalogue changes after this returns.
    virtual void pluginsWillUninstall(const TDPlugInProxyList& plugIns) = 0;

  protected:
    ~WorkspaceObserver() = default;
};

/// On whose behalf the registry is asked to change. What a confined process asks for is refused:
/// what it can write would come to run with rights that it was not given.
enum class Requester { Unconfined, Confined };

/// The application registry: the source of truth for which plug-ins are installed. Operations may
/// be called from any thread but the registry's own observer callbacks' (which may only look up).
///
/// Paths are compared as they stand: callers pass canonical ones. Lookups wait for the first scan.
class Workspace {
  public:
    /// Whether to keep a candidate, given its plug-in identifier and entitlements.
    using Filter = std::function<bool(const std::optional<std::string>& identifier,
                                      const Dictionary& entitlements)>;

    virtual ~Workspace() = default;

    /// An observation, which ends when the handle is destroyed (not from inside a callback, and
    /// before the workspace is): afterwards no callback runs any more.
    class Observation {
      public:
        virtual ~Observation() = default;
    };
    /// Adds an observer, which must outlive the handle.
    virtual std::unique_ptr<Observation> addObserver(WorkspaceObserver& observer) = 0;

    /// Begins the first scan, once. Nothing is scanned and no observer called before.
    virtual void activate() = 0;

    virtual TDPlugInProxyRef plugInWithUuid(const Uuid& uuid) = 0;
    virtual TDPlugInProxyRef plugInAtPath(const std::string& bundlePath) = 0;
    /// The plug-ins inside the application at a path, in the order of their paths; empty when there
    /// are none or no such application.
    virtual TDPlugInProxyList plugInsOfApplication(const std::string& bundlePath) = 0;

    virtual TDPlugInProxyList installedPlugIns() = 0;
    /// Which bundles lie, at the moment of the call, where the records say that are looked up
    /// afterwards. Costs one look however many there are, and never waits.
    virtual UntouchedBundles untouchedBundles() = 0;
    /// The plug-ins that may match `query` (a rules dictionary) and that `filter` keeps; an empty
    /// one keeps all. Narrows by "VXExtensionPointIdentifier" and "VXExtensionIdentifier" when
    /// their pattern is a plain string, "=" and a string, or an array of those; never drops a
    /// plug-in that matching would accept. None when the query fails.
    virtual std::optional<TDPlugInProxyList> plugInsMatching(const Dictionary& query,
                                                             const Filter& filter) = 0;

    /// Registers the plug-in bundle at a path, or the application there with all its plug-ins.
    /// Returns when the catalogue has changed. The error says why the bundle was refused, or why
    /// nothing was stored: the registration then holds until the registry is closed, and is stored
    /// with the next change that can be. Registering once more tries that at once. An error line
    /// tells of what is refused for its requester, or because confined processes write where it
    /// lies: in data containers, assertion folders and the runtime directory.
    virtual std::optional<Error> registerPlugIn(const std::string& bundlePath,
                                                Requester requester) = 0;
    /// Forgets what is registered at a path: a plug-in, or an application's plug-ins. A bundle that
    /// an application directory holds stays forgotten until it is registered again or changes.
    /// Error: nothing is registered there, nothing was stored, or the requester may not (as above).
    virtual std::optional<Error> unregisterPlugIn(const std::string& bundlePath,
                                                  Requester requester) = 0;

    /// Makes what somebody has removed of a plug-in's data container meanwhile, without waiting for
    /// a walk over the disk. Does nothing for a plug-in that has none. Error: it cannot be made,
    /// or something else has its place.
    virtual std::optional<Error> restoreContainer(const TDPlugInProxy& plugIn) = 0;

    /// Drops what the registry caches of SDK dictionaries.
    virtual void clearSchemaCaches() = 0;
};

}  // namespace platform
