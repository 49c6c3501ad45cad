#pragma once

#include <sys/types.h>

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

struct stat;

namespace platform {

/// Which file or directory something is, whatever it is called: of all that exist at one time, none
/// other has this device and inode.
struct FileIdentity {
    dev_t device = 0;
    ino_t inode = 0;

    static FileIdentity of(const struct stat& status);
    /// What lies at a path, itself when it is a symbolic link; all 0 when that cannot be told. A
    /// relative path starts at the directory `dirfd` (borrowed, or AT_FDCWD).
    static FileIdentity at(int dirfd, const char* path);

    /// What is open, and its type as in the mode of `stat`. Neither changes, so its file system is
    /// not asked, and nobody waits for it. None, with errno, on failure.
    static std::optional<FileIdentity> ofOpen(int fd, mode_t* type = nullptr);

    /// Bytes of a stored identity.
    static constexpr std::size_t kStoredSize = 16;
    /// Appends it as bytes for storage.
    void appendTo(std::string& bytes) const;
    /// Reads what `appendTo` wrote from the beginning of the bytes; all 0 when they are too few.
    static FileIdentity from(std::string_view bytes);

    friend bool operator==(const FileIdentity&, const FileIdentity&) = default;
};

}  // namespace platform
