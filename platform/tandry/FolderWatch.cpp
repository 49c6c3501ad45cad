#include "platform/tandry/FolderWatch.h"

#include <linux/magic.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/system/Error.h"
#include "platform/system/Files.h"
#include "platform/tandry/RegistryState.h"

namespace platform::tandry {

namespace {

constexpr std::uint32_t kEntries = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO;
constexpr std::uint32_t kSelf = IN_DELETE_SELF | IN_MOVE_SELF | IN_ATTRIB;
constexpr std::uint32_t kContent = IN_MODIFY | IN_CLOSE_WRITE;

constexpr std::size_t kBufferSize = 64u << 10;
/// Buffers that one call reads at most, so that a flood does not hold up the thread.
constexpr int kMostBuffers = 32;
constexpr int kMostLinks = 40;

bool isShortage(int errnum) {
    return errnum == ENOSPC || errnum == ENOMEM || errnum == EMFILE || errnum == ENFILE;
}

bool isRealDirectory(const std::string& path) {
    struct stat status;
    return ::lstat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

/// Takes the first component off a path.
std::string takeComponent(std::string& path) {
    const std::size_t begin = path.find_first_not_of('/');
    if (begin == std::string::npos) {
        path.clear();
        return {};
    }
    const std::size_t end = std::min(path.find('/', begin), path.size());
    std::string component = path.substr(begin, end - begin);
    path.erase(0, end);
    return component;
}

}  // namespace

void FolderWatch::beginWalk(bool overEverything) {
    disturb();
    ++walk_;
    isOverEverything_ = overEverything;
    shortage_ = 0;
    if (inotify_ || isPostponed_) return;
    inotify_.reset(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    if (!inotify_) shortage_ = errno;
}

void FolderWatch::markContents(const std::string& path, const std::string& scope) {
    mark(path, Kind::Contents, scope);
}

void FolderWatch::markEntries(const std::string& path, std::string_view suffix) {
    mark(path, Kind::Entries, suffix);
}

void FolderWatch::markWay(const std::string& path) {
    std::string way = "/";
    std::string rest = path;
    int links = 0;
    for (std::string name = takeComponent(rest); !name.empty(); name = takeComponent(rest)) {
        if (name == ".") continue;
        if (name == "..") {
            way = parentPath(way);
            continue;
        }
        const std::string next = joinPath(way, name);
        bool isDirectory = isRealDirectory(next);
        if (!isDirectory) {
            mark(way, Kind::Name, name);
            // It may have come before its directory was watched.
            isDirectory = isRealDirectory(next);
        }
        if (isDirectory) {
            // Being renamed shows on a directory itself, without the bustle around it.
            if (!rest.empty()) mark(next, Kind::Self);
            way = next;
            continue;
        }
        std::error_code failure;
        const std::filesystem::path target = std::filesystem::read_symlink(next, failure);
        if (failure || ++links > kMostLinks) return;
        if (target.is_absolute()) way.assign(1, '/');
        rest.insert(0, '/' + target.string());
    }
}

bool FolderWatch::Reason::operator==(const Reason& other) const {
    return kind == other.kind && *text == *other.text;
}

void FolderWatch::mark(const std::string& path, Kind kind, std::string_view text) {
    const Reason reason{kind, texts_.of(text)};
    auto known = paths_.find(path);
    const Descriptor before = known == paths_.end() ? -1 : known->second;
    if (known != paths_.end()) {
        const Watched& watched = watches_.at(before);
        if (watched.walk == walk_ && std::ranges::count(watched.reasons, reason) != 0) return;
    }
    // Asked for each time: another directory may have taken the place of the one that is known.
    const Descriptor descriptor = add(path, kind, before >= 0);
    if (before >= 0 && before != descriptor) release(known);
    if (descriptor < 0) return;
    Watched& watched = watches_[descriptor];
    if (!watched.path || *watched.path != path) {
        // The directory was renamed, and the change of its old path is still to be read.
        if (watched.path) paths_.erase(*watched.path);
        watched.path = &paths_.insert_or_assign(path, descriptor).first->first;
    }
    if (std::exchange(watched.walk, walk_) != walk_ && isOverEverything_) watched.reasons.clear();
    if (std::ranges::count(watched.reasons, reason) == 0) watched.reasons.push_back(reason);
}

FolderWatch::Descriptor FolderWatch::add(const std::string& path, Kind kind, bool isKnown) {
    if (!inotify_) return -1;
    std::uint32_t mask = IN_ONLYDIR | IN_MASK_ADD | kSelf;
    if (kind != Kind::Self) mask |= kEntries;
    if (kind == Kind::Contents) mask |= kContent;
    const bool isTooMany = !isKnown && watches_.size() >= mostWatches_;
    const Descriptor descriptor =
        isTooMany ? -1 : ::inotify_add_watch(inotify_.get(), path.c_str(), mask);
    if (descriptor < 0 && (isTooMany || isShortage(errno))) shortage_ = isTooMany ? ENOSPC : errno;
    return descriptor;
}

void FolderWatch::release(std::map<std::string, Descriptor>::iterator place) {
    ::inotify_rm_watch(inotify_.get(), place->second);
    watches_.erase(place->second);
    paths_.erase(place);
}

void FolderWatch::releaseUnmarked(const std::string& scope) {
    forEachWithin(paths_, scope, [this](auto place) {
        if (watches_.at(place->second).walk != walk_) release(place);
    });
}

void FolderWatch::endWalk() {
    if (shortage_ != 0 && !isShort_)
        EVLOG_ERROR(ops(),
                    "cannot watch all application directories, so they are looked at from time to "
                    "time (fs.inotify.max_user_watches may be too small): {}",
                    pub(Error::posix(shortage_, "inotify").text));
    // Only a walk over everything has asked for all watches.
    if (shortage_ == 0 && isShort_ && isOverEverything_)
        EVLOG_DEFAULT(ops(), "all application directories are watched again");
    isShort_ = shortage_ != 0 || (isShort_ && !isOverEverything_);
}

bool FolderWatch::watchesWayTo(const std::string& directory, const std::string& known) const {
    std::string path = directory;
    for (; path.size() > 1 && !isWithin(known, path); path = parentPath(path))
        if (!paths_.contains(path)) return false;
    return true;
}

/// What others change on a server, or behind a program's back, is not reported; neither is it known
/// of file systems to come.
bool FolderWatch::isLocal(const std::string& path) {
    constexpr std::array<long, 9> kLocal{
        EXT4_SUPER_MAGIC,      XFS_SUPER_MAGIC, BTRFS_SUPER_MAGIC,
        F2FS_SUPER_MAGIC,      TMPFS_MAGIC,     RAMFS_MAGIC,
        OVERLAYFS_SUPER_MAGIC, SQUASHFS_MAGIC,  EROFS_SUPER_MAGIC_V1};
    struct statfs status;
    return ::statfs(path.c_str(), &status) == 0 &&
           std::ranges::find(kLocal, static_cast<long>(status.f_type)) != kLocal.end();
}

void FolderWatch::disturb() {
    const std::lock_guard lock(mutex_);
    isSettled_ = false;
}

void FolderWatch::settle() {
    const std::lock_guard lock(mutex_);
    isSettled_ = static_cast<bool>(inotify_);
}

/// A change leaves the kernel's queue only after `disturb`: whoever finds the queue empty with the
/// lock in hand, and all settled, has missed none.
bool FolderWatch::isQuiet() const {
    const std::lock_guard lock(mutex_);
    int waiting = 0;
    return isSettled_ && ::ioctl(inotify_.get(), FIONREAD, &waiting) == 0 && waiting == 0;
}

Touches FolderWatch::takeTouched() {
    disturb();
    Touches touched;
    alignas(inotify_event) std::array<char, kBufferSize> buffer;
    for (int i = 0; i < kMostBuffers; ++i) {
        const ssize_t count = ::read(inotify_.get(), buffer.data(), buffer.size());
        if (count <= 0) break;
        for (const char* next = buffer.data(); next < buffer.data() + count;) {
            inotify_event event;
            std::memcpy(&event, next, sizeof event);
            const char* name = next + sizeof event;
            take(event, {name, ::strnlen(name, event.len)}, touched);
            next = name + event.len;
        }
    }
    return touched;
}

void FolderWatch::take(const inotify_event& event, std::string_view name, Touches& touched) {
    constexpr std::uint32_t kDirectoryCame = IN_MOVED_TO | IN_ISDIR;
    const auto touch = [&touched](const std::string& scope, bool isWhole = false) {
        touched[scope] = isWhole;
    };
    const std::string everything;
    if (event.mask & IN_Q_OVERFLOW) touch(everything);
    auto found = watches_.find(event.wd);
    if (found == watches_.end()) return;
    const Watched& watched = found->second;
    for (const Reason& reason : watched.reasons) switch (reason.kind) {
            case Kind::Self:
                if (name.empty()) touch(everything);
                break;
            case Kind::Name:
                if (name == *reason.text || name.empty()) touch(everything);
                break;
            case Kind::Entries:
                if (name.empty())
                    touch(everything);
                else if (name.ends_with(*reason.text))
                    touch(joinPath(*watched.path, name),
                          (event.mask & kDirectoryCame) == kDirectoryCame);
                break;
            case Kind::Contents:
                touch(*reason.text);
                break;
        }
    if (event.mask & IN_IGNORED) {
        paths_.erase(*watched.path);
        watches_.erase(found);
    }
}

}  // namespace platform::tandry
