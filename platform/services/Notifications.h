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
    /// Wakes everybody who waits for the name. From any thread. Failure is logged.
    virtual void post(const std::string& name) = 0;
};

/// Notifications as files: a post rewrites <runtime>/zorvan/notify/<name>, by rename, with the
/// count of posts so far in decimal.
std::unique_ptr<Notifications> makeFileNotifications(const Directories& directories);

/// The folder of the files: <runtime>/zorvan/notify.
std::string notificationFolder(const Directories& directories);
/// The count that the file at `path` holds; 0 when there is none, or it is damaged.
std::uint64_t notificationPosts(const std::string& path);

}  // namespace platform
