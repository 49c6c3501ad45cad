#pragma once

#include <cstdint>
#include <memory>
#include <string>

namespace platform {

struct Directories;

/// System-wide notifications without payload, by name. platform/services/NotificationListener.h
/// waits for them.
class Notifications {
  public:
    virtual ~Notifications() = default;
    /// Wakes everybody who waits for the name, as often as it is posted. Costs the caller next to
    /// nothing, and waits for nobody. From any thread. Failure is logged.
    virtual void post(const std::string& name) = 0;
    /// Returns when everybody can see what was posted so far, or that has taken a second. Whoever
    /// ends the process without destroying this calls it last.
    virtual void finish() = 0;
};

/// Notifications as files: <runtime>/zorvan/notify/<name> holds the count of posts so far in
/// decimal. A thread of its own rewrites it, by rename, once for all posts that came meanwhile;
/// those that cannot be written are written with the next ones. Its end writes what is left; what a
/// killed process has counted alone is lost, and what it has left behind is removed by the next.
std::unique_ptr<Notifications> makeFileNotifications(const Directories& directories);

/// The folder of the files: <runtime>/zorvan/notify.
std::string notificationFolder(const Directories& directories);
/// The count that the file at `path` holds; 0 when there is none, or it is damaged.
std::uint64_t notificationPosts(const std::string& path);

}  // namespace platform
