#include "platform/services/NotificationListener.h"

#include <sys/inotify.h>

#include <cerrno>

#include "platform/services/Notifications.h"
#include "platform/system/Files.h"

namespace platform {

Result<NotificationListener> NotificationListener::make(const Directories& directories,
                                                        const std::string& name) {
    if (!isSafeName(name)) return Error::posix(EINVAL, name);
    NotificationListener listener(notificationFolder(directories), name);
    listener.inotify_.reset(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    if (!listener.inotify_) return Error::posix(errno, "inotify");
    if (auto error = listener.watchFolder()) return *error;
    listener.seen_ = notificationPosts(joinPath(listener.folder_, name));
    return listener;
}

/// The folder is watched, since each post puts another file in the place of the last one. It is
/// made here when nobody has posted yet.
std::optional<Error> NotificationListener::watchFolder() {
    if (auto error = makeDirectories(folder_, 0700)) return error;
    constexpr std::uint32_t kEvents =
        IN_MOVED_TO | IN_DELETE | IN_MOVED_FROM | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
    if (::inotify_add_watch(inotify_.get(), folder_.c_str(), kEvents) >= 0) return std::nullopt;
    return Error::posix(errno, folder_);
}

bool NotificationListener::readEvents() {
    bool folderGone = false;
    alignas(inotify_event) char buffer[4096];
    for (;;) {
        const ssize_t size = ::read(inotify_.get(), buffer, sizeof buffer);
        if (size < 0 && errno == EINTR) continue;
        if (size <= 0) return folderGone;
        for (const char* at = buffer; at < buffer + size;) {
            const auto* event = reinterpret_cast<const inotify_event*>(at);
            at += sizeof *event + event->len;
            if (event->mask & IN_MOVE_SELF) ::inotify_rm_watch(inotify_.get(), event->wd);
            if (event->mask & IN_IGNORED) folderGone = true;
            // Whoever posts next begins at 1 again.
            const bool isRemoval = event->mask & (IN_DELETE | IN_MOVED_FROM);
            if (isRemoval && event->len > 0 && name_ == event->name) seen_ = 0;
        }
    }
}

Result<std::uint64_t> NotificationListener::take() {
    if (readEvents()) {
        if (auto error = watchFolder()) return *error;
        seen_ = 0;
    }
    // After the events, so that a post in between is counted now or reported again.
    const std::uint64_t posts = notificationPosts(joinPath(folder_, name_));
    const std::uint64_t fresh = posts < seen_ ? posts : posts - seen_;
    seen_ = posts;
    return fresh;
}

}  // namespace platform
