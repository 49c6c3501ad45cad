#include "platform/services/Assertions.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "platform/plist/PropertyList.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"

namespace platform {

namespace {

/// A report holds one identifier, and comes from a process that may be hostile.
constexpr std::size_t kMaxReport = 4096;
constexpr int kMaxInstances = 1024;

struct flock wholeFile(short type) {
    struct flock lock {};
    lock.l_type = type;
    lock.l_whence = SEEK_SET;
    return lock;
}

/// Whether somebody holds a lock of a file; looking takes none.
bool isLocked(int file) {
    struct flock lock = wholeFile(F_WRLCK);
    return ::fcntl(file, F_OFD_GETLK, &lock) == 0 && lock.l_type != F_UNLCK;
}

/// Of the file that was looked at: by its name, its writer might have exchanged it meanwhile.
Dictionary reportIn(int file) {
    std::string bytes(kMaxReport + 1, '\0');
    const ssize_t count = ::pread(file, bytes.data(), bytes.size(), 0);
    if (count <= 0 || count > static_cast<ssize_t>(kMaxReport)) return {};
    bytes.resize(static_cast<std::size_t>(count));
    const Result<Value> report = parsePropertyList(bytes);
    return report && report->dictionary() ? *report->dictionary() : Dictionary();
}

/// The file in which an instance states that it is busy; none when there is no such file.
UniqueFd openFile(int folder) {
    constexpr int kFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
    UniqueFd file(::openat(folder, BusyFolder::kFile, kFlags));
    struct stat status;
    if (file && (::fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode))) file.reset();
    return file;
}

UniqueFd openFolder(int parent, const char* name) {
    return UniqueFd(::openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
}

/// Calls `visit(file)` for each instance of a bundle whose folder is in that of its identifier.
template <class Visit>
void forEachInstance(const std::string& path, const std::string& bundlePath, Visit visit) {
    const std::unique_ptr<DIR, int (*)(DIR*)> all(::opendir(path.c_str()), &::closedir);
    if (!all) return;
    const std::string prefix = BusyFolder::prefixOf(bundlePath);
    int left = kMaxInstances;
    while (const dirent* entry = ::readdir(all.get())) {
        if (entry->d_name[0] == '.' || !BusyFolder::isOf(entry->d_name, prefix)) continue;
        if (--left < 0) return;
        const UniqueFd folder = openFolder(::dirfd(all.get()), entry->d_name);
        const UniqueFd file = folder ? openFile(folder.get()) : UniqueFd();
        if (file) visit(file.get());
    }
}

class FileAssertions final : public Assertions {
  public:
    explicit FileAssertions(const Directories& directories) : directories_(directories) {}

    std::vector<Dictionary> busyInstancesForBundleIdentifiers(
        const std::set<std::string>& bundleIdentifiers, const std::string& bundlePath) override {
        std::vector<Dictionary> reports;
        for (const std::string& identifier : bundleIdentifiers) {
            if (!isSafeName(identifier)) continue;
            forEachInstance(BusyFolder::ofBundle(directories_, identifier), bundlePath,
                            [&](int file) {
                                if (isLocked(file)) reports.push_back(reportIn(file));
                            });
        }
        return reports;
    }

  private:
    const Directories directories_;
};

}  // namespace

std::unique_ptr<Assertions> makeFileAssertions(const Directories& directories) {
    return std::make_unique<FileAssertions>(directories);
}

Result<BusyAssertion> BusyAssertion::take(const Directories& directories,
                                          const std::string& bundleIdentifier) {
    if (!isSafeName(bundleIdentifier)) return Error::posix(EINVAL, bundleIdentifier);
    std::string path = BusyFolder::ofBundle(directories, bundleIdentifier);
    UniqueFd folder = openFolder(AT_FDCWD, path.c_str());
    UniqueFd file = folder ? openFile(folder.get()) : UniqueFd();
    std::optional<BusyFolder> own;
    if (!file) {
        auto made = BusyFolder::make(directories, bundleIdentifier, {});
        if (!made) return made.error();
        path = made->path();
        own.emplace(std::move(*made));
        folder = openFolder(AT_FDCWD, path.c_str());
        file = folder ? openFile(folder.get()) : UniqueFd();
    }
    // For reading: all assertions of an instance share its file, and it may not write there.
    struct flock lock = wholeFile(F_RDLCK);
    if (!file || ::fcntl(file.get(), F_OFD_SETLK, &lock) != 0) return Error::posix(errno, path);
    return BusyAssertion(std::move(own), std::move(file));
}

}  // namespace platform
