#include "platform/tandry/FolderEntries.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <optional>

#include "platform/system/Files.h"
#include "platform/values/Utf8.h"
#include "platform/values/Value.h"

namespace platform::tandry {

namespace {

bool isDirectory(const std::string& path) {
    struct stat status;
    return ::stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

bool isLink(int directory, const dirent& entry) {
    if (entry.d_type != DT_UNKNOWN) return entry.d_type == DT_LNK;
    struct stat status;
    return ::fstatat(directory, entry.d_name, &status, AT_SYMLINK_NOFOLLOW) == 0 &&
           S_ISLNK(status.st_mode);
}

void add(FolderEntries& found, const std::string& folder, const dirent& entry, FolderWatch& watch,
         ForeignPlaces& places, Complaints& complaints) {
    if (entry.d_name[0] == '.' ||
        (entry.d_type != DT_DIR && entry.d_type != DT_LNK && entry.d_type != DT_UNKNOWN))
        return;
    std::string path = joinPath(folder, entry.d_name);
    std::string target;
    std::string unseen;
    if (entry.d_type != DT_DIR && !places.answers(path, &unseen)) {
        found.unseen.push_back(std::move(unseen));
        return;
    }
    if (isLink(found.directory(), entry)) {
        watch.markWay(path);
        std::optional<std::string> canonical = canonicalPath(path);
        if (!canonical) {
            complaints.add(path, "skipping", path + ": a link that cannot be resolved");
            std::error_code ignored;
            const auto missing = std::filesystem::weakly_canonical(
                std::filesystem::path(folder) / std::filesystem::read_symlink(path, ignored),
                ignored);
            found.nowhere.push_back(missing.string());
            return;
        }
        target = *canonical;
    }
    const std::string& real = target.empty() ? path : target;
    if (entry.d_type != DT_DIR && !isDirectory(real)) return;
    if (isUsablePath(real))
        found.entries.push_back({entry.d_name, std::move(target)});
    else
        complaints.add(real, "skipping",
                       real + ": its path is not UTF-8 text, or has control characters");
}

}  // namespace

bool isUsablePath(const std::string& path) {
    auto isControl = [](unsigned char c) { return c < 0x20 || c == 0x7F; };
    return isValidUtf8(path) && std::ranges::none_of(path, isControl) &&
           isPropertyList(Value(path));
}

Result<FolderEntries> FolderEntries::read(const std::string& path, FolderWatch& watch,
                                          ForeignPlaces& places, Complaints& complaints) {
    FolderEntries found;
    found.stream.reset(::opendir(path.c_str()));
    if (!found.stream) return Error::posix(errno, path);
    errno = 0;
    while (const dirent* entry = ::readdir(found.stream.get())) {
        add(found, path, *entry, watch, places, complaints);
        errno = 0;
    }
    if (errno != 0) return Error::posix(errno, path);
    std::ranges::sort(found.entries, {}, &Entry::name);
    return found;
}

}  // namespace platform::tandry
