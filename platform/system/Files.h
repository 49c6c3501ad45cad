#pragma once

#include <sys/stat.h>

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform {

/// Reads a whole regular file of at most `limit` bytes. Errors: the system's; EFBIG for a larger
/// file, EINVAL for what is not a regular file (nothing is read from a device or a pipe, and
/// opening never blocks).
Result<std::string> readFile(const std::string& path, std::size_t limit);
/// The same, relative to the directory `dirfd` (borrowed).
Result<std::string> readFileAt(int dirfd, const std::string& name, std::size_t limit);
/// The same for a file that must lie beneath the directory `dirfd` (borrowed). Errors also: those
/// of `openBeneath`.
Result<std::string> readFileBeneath(int dirfd, const std::string& name, std::size_t limit);

/// Whether what is written has to outlive a crash of the machine: at once, not at all, or once who
/// writes has synced it.
enum class Sync { Yes, No, Later };

/// Replaces the file at `path` by one that holds `bytes`, in one rename, so that whoever opens the
/// path sees either the old file or the new one, also after a crash: file and directory are synced.
/// The new file lies in the same directory and has no name until it is whole (on file systems
/// without such files one of its own, see `removeLeftovers`); no other file is touched. A new file
/// gets mode 0600; an existing one keeps its mode. A symbolic link stays, and the file that it
/// leads to is replaced. None on success. Errors: the system's; EINVAL when something other than a
/// regular file is there. Without the sync, a crash of the machine (not of a process) may leave
/// neither. Who syncs later, by `syncFile`, loses nothing in between: what was synced last keeps a
/// name of its own until then (where a file cannot have two names, the sync is not put off).
std::optional<Error> writeFileAtomically(const std::string& path, std::string_view bytes,
                                         Sync sync = Sync::Yes);

/// Syncs the file at `path`, and the directory that it lies in: for who has replaced it without.
std::optional<Error> syncFile(const std::string& path);

/// The file, of this user's, that holds what was last synced at `path`, if a crash has come between
/// a write that was to be synced later and that sync.
std::optional<std::string> lastSyncedFile(const std::string& path);

/// Removes what writing this very file has left beside it when it was interrupted by a crash.
/// Nobody else's files are touched: such a file bears a name of ours that follows from the name at
/// `path`, belongs to this user, and is locked while somebody writes it.
void removeLeftovers(const std::string& path);

/// A file without a name, in memory, with these bytes, to be read from its beginning; none, with
/// errno set, when there is no room.
UniqueFd memoryFile(std::string_view bytes);

/// Makes the directory and its missing parents, each with `mode`. An existing directory is fine.
std::optional<Error> makeDirectories(const std::string& path, mode_t mode);

/// The canonical absolute path of something that exists (symbolic links, "." and ".." resolved).
/// None when it cannot be resolved, or when the result has `limit` bytes or more.
std::optional<std::string> canonicalPath(const std::string& path, std::size_t limit = 4096);

/// Whether a name taken from a file may become one component of a path: not empty, no "/" and no
/// NUL, no leading ".", at most 255 bytes.
bool isSafeName(std::string_view name);

/// A path beside `path` that nothing has, "<path>.damaged-<number>", to move a damaged file out of
/// the way. None when there are too many already.
std::optional<std::string> unusedDamagedName(const std::string& path);

/// `directory` with `name` appended as a path component.
std::string joinPath(std::string_view directory, std::string_view name);

/// The part of a path after its last "/" (of "/a/b/" it is "b").
std::string_view lastPathComponent(std::string_view path);
/// The part of a path before its last component: "/" for one directly under the root, "." for a
/// lone name.
std::string_view parentPath(std::string_view path);

}  // namespace platform
