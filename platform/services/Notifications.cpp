#include "platform/services/Notifications.h"

#include <fcntl.h>
#include <stdlib.h>

#include <cerrno>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <future>
#include <map>
#include <mutex>
#include <optional>

#include "platform/log/OpsLog.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"
#include "platform/system/UniqueFd.h"
#include "platform/threads/SerialQueue.h"

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

/// 0 without a file, or when it is damaged. Errors: those of `readFile`.
Result<std::uint64_t> postsIn(const std::string& path) {
    std::uint64_t count = 0;
    const Result<std::string> text = readFile(path, 64);
    if (!text && !isMissingFile(text.error()) && text.error().code != EFBIG) return text.error();
    if (text) std::from_chars(text->data(), text->data() + text->size(), count);
    return count;
}

class FileNotifications final : public Notifications {
  public:
    explicit FileNotifications(const Directories& directories)
        : folder_(notificationFolder(directories)) {}

    void post(const std::string& name) override {
        if (!isSafeName(name)) {
            EVLOG_ERROR(ops(), "cannot post notification {}: not a file name", pub(name));
            return;
        }
        const std::lock_guard lock(mutex_);
        // Whoever counts first has all written that are counted until the writer has its turn.
        if (counted_[name]++ == 0) writer_.async([this, name] { write(name); });
    }

    void finish() override {
        const auto written = std::make_shared<std::promise<void>>();
        writer_.async([written] { written->set_value(); });
        written->get_future().wait_for(kPatience);
    }

  private:
    static constexpr std::chrono::seconds kPatience{1};

    void write(const std::string& name) {
        writer_.assertCurrent();
        std::uint64_t& unwritten = unwritten_[name];
        {
            const std::lock_guard lock(mutex_);
            unwritten += counted_.extract(name).mapped();
        }
        std::optional<Error> error = makeDirectories(folder_, 0700);
        const Result<std::uint64_t> before = postsIn(joinPath(folder_, name));
        // Without knowing the count, a new one might be the one that is there.
        if (!error && !before) error = before.error();
        if (!error) error = replaceFile(folder_, name, std::to_string(*before + unwritten));
        if (!error) unwritten = 0;
        if (error) EVLOG_ERROR(ops(), "cannot post notification {}: {}", pub(name), pub(*error));
    }

    const std::string folder_;
    std::mutex mutex_;
    std::map<std::string, std::uint64_t> counted_;    // since the writer looked; guarded by mutex_
    std::map<std::string, std::uint64_t> unwritten_;  // the writer's: those, and what failed
    SerialQueue writer_{"notifications"};  // the last member: what it still does uses the others
};

}  // namespace

std::unique_ptr<Notifications> makeFileNotifications(const Directories& directories) {
    return std::make_unique<FileNotifications>(directories);
}

std::string notificationFolder(const Directories& directories) {
    return directories.zorvanRuntime() + "/notify";
}

std::uint64_t notificationPosts(const std::string& path) {
    const Result<std::uint64_t> posts = postsIn(path);
    return posts ? *posts : 0;
}

}  // namespace platform
