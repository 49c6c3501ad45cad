#include "platform/sandbox/BusyFolder.h"

#include <dirent.h>
#include <fcntl.h>
#include <stdlib.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <cerrno>
#include <memory>
#include <utility>

#include "platform/plist/PropertyList.h"
#include "platform/system/Digest.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"

namespace platform {

namespace {

constexpr int kDirectory = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

std::string allFolders(const Directories& directories) {
    return directories.zorvanRuntime() + "/tenurd";
}

constexpr char kSeparator = '-';  // the random part of a name has none

Error failed(const std::string& path) {
    return Error::posix(errno, path);
}

std::optional<Error> writeReport(int folder, const std::string& path,
                                 const std::string& bundleIdentifier) {
    const Result<std::string> report =
        writeXmlPropertyList(Dictionary{{kAssertionBundleIdentifier, bundleIdentifier}});
    if (!report) return report.error();
    const UniqueFd file(
        ::openat(folder, BusyFolder::kFile, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    if (!file ||
        ::write(file.get(), report->data(), report->size()) != static_cast<ssize_t>(report->size()))
        return failed(path);
    return std::nullopt;
}

/// Calls `visit(folder, name)` for the visible entries of a directory.
template <class Visit>
void forEachEntry(UniqueFd directory, Visit visit) {
    const std::unique_ptr<DIR, int (*)(DIR*)> folder(::fdopendir(directory.get()), &::closedir);
    if (!folder) return;
    directory.release();
    while (const dirent* entry = ::readdir(folder.get()))
        if (entry->d_name[0] != '.') visit(::dirfd(folder.get()), entry->d_name);
}

void removeWithoutOwner(int bundleFolder, const char* name) {
    const UniqueFd folder(::openat(bundleFolder, name, kDirectory));
    if (!folder || ::flock(folder.get(), LOCK_EX | LOCK_NB) != 0) return;
    ::unlinkat(folder.get(), BusyFolder::kFile, 0);
    ::unlinkat(bundleFolder, name, AT_REMOVEDIR);
}

}  // namespace

std::string BusyFolder::ofBundle(const Directories& directories,
                                 const std::string& bundleIdentifier) {
    return joinPath(allFolders(directories), bundleIdentifier);
}

Result<BusyFolder> BusyFolder::make(const Directories& directories,
                                    const std::string& bundleIdentifier,
                                    const std::string& bundlePath) {
    if (!isSafeName(bundleIdentifier)) return Error::posix(EINVAL, bundleIdentifier);
    const std::string parent = ofBundle(directories, bundleIdentifier);
    if (auto error = makeDirectories(parent, 0700)) return *error;
    const UniqueFd bundleFolder(::open(parent.c_str(), kDirectory));
    struct stat status;
    if (!bundleFolder || ::fstat(bundleFolder.get(), &status) != 0) return failed(parent);
    if (status.st_uid != ::geteuid()) return Error::posix(EPERM, parent);

    BusyFolder made;
    made.path_ = joinPath(parent, prefixOf(bundlePath) + "XXXXXX");
    if (!::mkdtemp(made.path_.data())) return failed(made.path_);
    made.folder_.reset(::open(made.path_.c_str(), kDirectory));
    if (!made.folder_) {
        const Error error = failed(made.path_);
        ::rmdir(made.path_.c_str());
        return error;
    }
    // Whoever was faster, for whatever reason, is not waited for.
    if (::flock(made.folder_.get(), LOCK_EX | LOCK_NB) != 0) return failed(made.path_);
    if (auto error = writeReport(made.folder_.get(), made.path_, bundleIdentifier)) return *error;
    return made;
}

BusyFolder& BusyFolder::operator=(BusyFolder&& other) noexcept {
    std::swap(path_, other.path_);
    std::swap(folder_, other.folder_);
    return *this;
}

BusyFolder::~BusyFolder() {
    if (!folder_) return;
    ::unlinkat(folder_.get(), kFile, 0);
    ::rmdir(path_.c_str());
}

std::string BusyFolder::prefixOf(const std::string& bundlePath) {
    return bundlePath.empty() ? std::string() : sha256Text(bundlePath) + kSeparator;
}

bool BusyFolder::isOf(std::string_view name, std::string_view prefix) {
    return name.find(kSeparator) == name.npos || name.starts_with(prefix);
}

void BusyFolder::sweep(const Directories& directories) {
    UniqueFd all(::open(allFolders(directories).c_str(), kDirectory));
    if (!all) return;
    forEachEntry(std::move(all), [](int folder, const char* bundle) {
        UniqueFd instances(::openat(folder, bundle, kDirectory));
        if (!instances) return;
        forEachEntry(std::move(instances), removeWithoutOwner);
        ::unlinkat(folder, bundle, AT_REMOVEDIR);
    });
}

}  // namespace platform
