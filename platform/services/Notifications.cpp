#include "platform/services/Notifications.h"

#include <cerrno>
#include <charconv>
#include <chrono>
#include <future>
#include <map>
#include <mutex>
#include <optional>
#include <set>

#include "platform/log/OpsLog.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"
#include "platform/threads/SerialQueue.h"

namespace platform {

namespace {

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
        const std::string path = joinPath(folder_, name);
        if (swept_.insert(name).second) removeLeftovers(path);
        const Result<std::uint64_t> before = postsIn(path);
        // Without knowing the count, a new one might be the one that is there.
        if (!error && !before) error = before.error();
        // Counts mean nothing after a crash of the machine.
        if (!error)
            error = writeFileAtomically(path, std::to_string(*before + unwritten), Sync::No);
        if (!error) unwritten = 0;
        if (error) EVLOG_ERROR(ops(), "cannot post notification {}: {}", pub(name), pub(*error));
    }

    const std::string folder_;
    std::mutex mutex_;
    std::map<std::string, std::uint64_t> counted_;  // since the writer looked; guarded by mutex_
    // The writer's:
    std::map<std::string, std::uint64_t> unwritten_;  // those, and what failed
    std::set<std::string> swept_;                     // names without leftovers of crashes
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
