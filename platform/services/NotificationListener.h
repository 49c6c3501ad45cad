#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform {

struct Directories;

/// Waits for the posts of one notification (platform/services/Notifications.h), in any process of
/// the user; any number of listeners may wait for one name. Wait until `descriptor` is readable,
/// with whatever the process waits with, then `take`:
///
///     auto listener = NotificationListener::make(Directories::fromEnvironment(), "name");
///     RunLoop::Watch watch(loop, listener->descriptor());
///     watch.awaitReadable([&] { if (auto posts = listener->take(); posts && *posts) changed(); });
///
/// Move-only; listening ends with the object. Use from one thread at a time.
class NotificationListener {
  public:
    /// Counts posts from now on; nobody need have posted yet. Errors: the system's (no inotify
    /// instance left, no runtime directory); EINVAL for a name that is no file name.
    static Result<NotificationListener> make(const Directories& directories,
                                             const std::string& name);

    /// Readable when there may be posts to take. Borrowed; the same for the object's whole life.
    int descriptor() const { return inotify_.get(); }

    /// How many posts there were since the last call, which may be none. Never blocks. No post is
    /// missed: posts are counted, not woken for, so many that came at once are all there. Errors:
    /// the system's, when the directory of notifications went away and cannot be made again.
    Result<std::uint64_t> take();

  private:
    NotificationListener(std::string folder, std::string name)
        : folder_(std::move(folder)), name_(std::move(name)) {}

    std::optional<Error> watchFolder();
    /// Uses up what has been reported; whether the folder has to be watched anew.
    bool readEvents();

    std::string folder_;
    std::string name_;
    UniqueFd inotify_;
    std::uint64_t seen_ = 0;  // the posts so far, as of the last `take`
};

}  // namespace platform
