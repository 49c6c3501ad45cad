#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <set>
#include <string>
#include <unordered_set>
#include <vector>

#include "platform/lum/Pool.h"
#include "platform/spawnerd/Launcher.h"
#include "platform/values/Uuid.h"

namespace zorvan {

class ZRDLumClient;
class ZRDPlugIn;

/// Plug-ins are the same when their UUIDs are.
struct PlugInIdentity {
    std::size_t operator()(const std::shared_ptr<ZRDPlugIn>& plugIn) const;
    bool operator()(const std::shared_ptr<ZRDPlugIn>& a, const std::shared_ptr<ZRDPlugIn>& b) const;
};

/// What to hold: all plug-ins of some applications, by canonical path, with those that are there
/// now; or, without applications, the bundles of these plug-ins.
struct HoldSubject {
    std::vector<std::shared_ptr<ZRDPlugIn>> plugIns;
    std::set<std::string> applications;
};

/// Plug-ins that a client has taken out of service, until it gives them back or dies, and the
/// places where they lie: what appears there meanwhile, or changes and so becomes another plug-in,
/// is held as well. While a hold exists, an outstanding-work marker keeps the daemon from being
/// stopped for idleness. Immutable; shared by the server's list and whoever looks at it.
class ZRDPlugInHold {
  public:
    /// A hold with a fresh token, made now.
    ZRDPlugInHold(HoldSubject subject, std::weak_ptr<ZRDLumClient> client,
                  platform::Pool::Share share, platform::Launcher& launcher);

    /// The token: whoever presents it may release the hold.
    const platform::Uuid& uuid() const { return uuid_; }
    using PlugIns = std::unordered_set<std::shared_ptr<ZRDPlugIn>, PlugInIdentity, PlugInIdentity>;
    const PlugIns& blocked() const { return blocked_; }
    /// Empty when it is the plug-ins' own bundles that are held.
    const std::set<std::string>& applications() const { return applications_; }
    /// Null once the client's record is gone.
    std::shared_ptr<ZRDLumClient> client() const { return client_.lock(); }
    /// Tells clients apart also when they are gone.
    const std::weak_ptr<ZRDLumClient>& owner() const { return client_; }
    std::chrono::system_clock::time_point created() const { return created_; }

    bool operator==(const ZRDPlugInHold& other) const { return uuid_ == other.uuid_; }
    std::size_t hash() const { return std::hash<platform::Uuid>()(uuid_); }

  private:
    const platform::Uuid uuid_ = platform::Uuid::random();
    const PlugIns blocked_;
    const std::set<std::string> applications_;
    const std::weak_ptr<ZRDLumClient> client_;
    const std::chrono::system_clock::time_point created_ = std::chrono::system_clock::now();
    const platform::Pool::Share share_;  // of the holds that there may be
    const std::unique_ptr<platform::Launcher::WorkMarker> workMarker_;
};

}  // namespace zorvan
