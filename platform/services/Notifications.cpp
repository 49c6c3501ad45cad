#include "platform/services/Notifications.h"

#include <fcntl.h>
#include <stdlib.h>

#include <cerrno>
#include <charconv>
#include <cstdio>
#include <mutex>
#include <optional>

#include "platform/log/OpsLog.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"
#include "platform/system/UniqueFd.h"

namespace platform {

namespace {

/// Replaces a file by rename, like `writeFileAtomically`, but without the syncs: counts live in
/// memory-backed runtime state and mean nothing after a crash.
std::optional<Error> replaceFile(const std::string& folder, const std::string& name,
                                 const std::string& bytes) {
    std::string temporary = joinPath(folder, ".post-XXXXXX");
    const UniqueFd file(::mkostemp(temporary.data(), O_CLOEXEC));
    if (!file) return Error::posix(errno, temporary);
    const std::string path = joinPath(folder, name);
    const ssize_t written = ::write(file.get(), bytes.data(), bytes.size());
    int failure = written < 0 ? errno : ENOSPC;
    if (written == static_cast<ssize_t>(bytes.size())) {
        if (::rename(temporary.c_str(), path.c_str()) == 0) return std::nullopt;
        failure = errno;
    }
    ::unlink(temporary.c_str());
    return Error::posix(failure, path);
}

class FileNotifications : public Notifications {
  public:
    explicit FileNotifications(const Directories& directories)
        : folder_(notificationFolder(directories)) {}

    void post(const std::string& name) override {
        if (!isSafeName(name)) {
            EVLOG_ERROR(ops(), "cannot post notification {}: not a file name", pub(name));
            return;
        }
        // Two posts at once must not write the same count.
        const std::lock_guard lock(mutex_);
        std::optional<Error> error = makeDirectories(folder_, 0700);
        if (!error) {
            const std::uint64_t count = notificationPosts(joinPath(folder_, name)) + 1;
            error = replaceFile(folder_, name, std::to_string(count));
        }
        if (error) EVLOG_ERROR(ops(), "cannot post notification {}: {}", pub(name), pub(*error));
    }

  private:
    const std::string folder_;
    std::mutex mutex_;
};

}  // namespace

std::unique_ptr<Notifications> makeFileNotifications(const Directories& directories) {
    return std::make_unique<FileNotifications>(directories);
}

std::string notificationFolder(const Directories& directories) {
    return directories.zorvanRuntime() + "/notify";
}

std::uint64_t notificationPosts(const std::string& path) {
    std::uint64_t count = 0;
    if (const Result<std::string> text = readFile(path, 64))
        std::from_chars(text->data(), text->data() + text->size(), count);
    return count;
}

}  // namespace platform
