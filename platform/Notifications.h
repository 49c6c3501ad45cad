#pragma once

#include <memory>
#include <string>

namespace platform {

struct Directories;

/// System-wide notifications without payload, by name.
class Notifications {
  public:
    virtual ~Notifications() = default;
    /// Wakes everybody who waits for the name. From any thread. Failure is logged.
    virtual void post(const std::string& name) = 0;
};

/// Notifications as files: a post rewrites <runtime>/zorvan/notify/<name>, by rename, with the
/// count of posts so far in decimal.
std::unique_ptr<Notifications> makeFileNotifications(const Directories& directories);

}  // namespace platform
