#include "platform/Assertions.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "platform/Directories.h"
#include "platform/Files.h"
#include "platform/PropertyList.h"

namespace platform {

namespace {

/// A report holds one identifier, and comes from a process that may be hostile.
constexpr std::size_t kMaxReport = 4096;
constexpr int kMaxInstances = 1024;

std::string folderOf(const Directories& directories, const std::string& bundleIdentifier) {
    return joinPath(directories.zorvanRuntime() + "/tenurd", bundleIdentifier);
}

struct flock wholeFile() {
    struct flock lock {};
    lock.l_type = F_WRLCK;
    lock.l_whence = SEEK_SET;
    return lock;
}

/// Whether somebody holds the lock of a file; looking takes none.
bool isLocked(int file) {
    struct flock lock = wholeFile();
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

/// Calls `visit(folder, name, file)` for the files of a folder.
template <class Visit>
void forEachFile(const std::string& path, Visit visit) {
    const std::unique_ptr<DIR, int (*)(DIR*)> folder(::opendir(path.c_str()), &::closedir);
    if (!folder) return;
    int left = kMaxInstances;
    while (const dirent* entry = ::readdir(folder.get())) {
        if (entry->d_name[0] == '.') continue;
        if (--left < 0) return;
        const int fd = ::dirfd(folder.get());
        const UniqueFd file(
            ::openat(fd, entry->d_name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
        struct stat status;
        if (file && ::fstat(file.get(), &status) == 0 && S_ISREG(status.st_mode))
            visit(fd, entry->d_name, file.get());
    }
}

class FileAssertions final : public Assertions {
  public:
    explicit FileAssertions(const Directories& directories) : directories_(directories) {}

    std::vector<Dictionary> busyInstancesForBundleIdentifiers(
        const std::set<std::string>& bundleIdentifiers) override {
        std::vector<Dictionary> reports;
        for (const std::string& identifier : bundleIdentifiers) {
            if (!isSafeName(identifier)) continue;
            forEachFile(folderOf(directories_, identifier), [&](int, const char*, int file) {
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
    const std::string folder = folderOf(directories, bundleIdentifier);
    if (auto error = makeDirectories(folder, 0700)) return *error;
    // What crashed instances left. Files get their names with their locks.
    forEachFile(folder, [](int fd, const char* name, int file) {
        if (!isLocked(file)) ::unlinkat(fd, name, 0);
    });
    const Result<std::string> report =
        writeXmlPropertyList(Dictionary{{kAssertionBundleIdentifier, bundleIdentifier}});
    if (!report) return report.error();

    std::string temporary = joinPath(folder, ".busy-XXXXXX");
    UniqueFd file(::mkostemp(temporary.data(), O_CLOEXEC));
    if (!file) return Error::posix(errno, temporary);
    struct flock lock = wholeFile();
    const std::string path = joinPath(folder, temporary.substr(folder.size() + 2));
    const bool isWritten = ::fcntl(file.get(), F_OFD_SETLK, &lock) == 0 &&
                           ::write(file.get(), report->data(), report->size()) ==
                               static_cast<ssize_t>(report->size()) &&
                           ::rename(temporary.c_str(), path.c_str()) == 0;
    if (!isWritten) {
        const int failure = errno;
        ::unlink(temporary.c_str());
        return Error::posix(failure, path);
    }
    return BusyAssertion(std::move(file), path);
}

BusyAssertion& BusyAssertion::operator=(BusyAssertion&& other) {
    std::swap(file_, other.file_);
    std::swap(path_, other.path_);
    return *this;
}

BusyAssertion::~BusyAssertion() {
    // The name goes first: a file without a lock would be left behind otherwise.
    if (file_) ::unlink(path_.c_str());
}

}  // namespace platform
