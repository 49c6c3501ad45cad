#pragma once

#include <sys/types.h>

#include <string>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

struct stat;

namespace platform {

/// Who, besides root, may have put a file where it is or written what it holds.
enum class FileTrust { Others, User, Root };

/// What the owner and the mode of one file or directory say, for `user`: `Root` when it is root's
/// and nobody else may write it, `User` when it is that user's and nobody else may, else `Others`.
/// Everybody may write a sticky directory, such as /tmp, without harm: what others have put there
/// is theirs, and what is not theirs they cannot replace.
FileTrust trustOf(const struct stat& status, uid_t user);

/// A regular file pinned by a descriptor (O_PATH), with the least trust of it and of all
/// directories above it.
struct PinnedFile {
    UniqueFd descriptor;
    FileTrust trust = FileTrust::Others;
    std::string weakest;  // the path that made the trust what it is

    /// What the file holds; nobody can have exchanged it since it was pinned. Errors: those of
    /// `readFile`.
    Result<std::string> read(std::size_t limit) const;
};

/// A directory that was opened from the root one component at a time, so that what was learned
/// about each holds for the very directories that lead here. Move-only.
class PinnedDirectory {
  public:
    /// `path` is canonical; a symbolic link in it is an error (ENOTDIR), as is whatever the
    /// system finds.
    static Result<PinnedDirectory> open(const std::string& path, uid_t user);

    /// Pins a regular file directly in this directory; symbolic links are not followed (EINVAL, as
    /// for whatever else is no regular file).
    Result<PinnedFile> file(const std::string& name) const;

    /// Borrowed (O_PATH).
    int descriptor() const { return descriptor_.get(); }

  private:
    PinnedDirectory(std::string path, uid_t user) : path_(std::move(path)), user_(user) {}

    std::string path_;
    uid_t user_;
    UniqueFd descriptor_;
    FileTrust trust_ = FileTrust::Root;
    std::string weakest_;
};

}  // namespace platform
