#pragma once

#include <array>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

struct stat;

namespace platform {

/// What tells one content of a file from another without reading it. Equal stamps: the file was
/// neither replaced nor rewritten in between (but see `settled`).
struct FileStamp {
    /// Device, inode, size, times of modification and change (seconds and nanoseconds apart: files
    /// may claim to be from any century). All 0 after an error.
    std::array<std::int64_t, 7> facts{};
    std::int64_t error = 0;  // why the file cannot be looked at; ENOENT when there is none
    /// False for a file that was changed within the last clock ticks: it may be changed again
    /// without another stamp. Such a stamp must not be remembered for what is read after it.
    bool settled = true;
    std::int64_t lookedAt = 0;  // when it was taken, in nanoseconds since 1970

    /// The stamp that a file has now; symbolic links are followed.
    static FileStamp of(const std::string& path);
    /// That of a file in the directory `folder`; a relative path to that starts at the directory
    /// `dirfd` (borrowed, or AT_FDCWD). Symbolic links are followed as far as `openBeneath` goes
    /// from there: what they lead to elsewhere is not looked at.
    static FileStamp beneath(int dirfd, const std::string& folder, const std::string& file);

    /// That of what was opened, or was not.
    static FileStamp ofOpened(const Result<UniqueFd>& file);

    bool exists() const { return error == 0; }
    /// There is no such file. One that cannot be looked at is neither here nor missing: reading it
    /// says why.
    bool isMissing() const;

    /// Bytes of a stored stamp.
    static constexpr std::size_t kStoredSize = 64;
    /// Appends the stamp as bytes for storage. Equal stamps have equal bytes, but what is not
    /// settled has bytes like no other: it vouches for nothing that is read.
    void appendTo(std::string& bytes) const;
    /// Reads what `appendTo` wrote from the beginning of the bytes; too few are an error.
    static FileStamp from(std::string_view bytes);

    /// Whether the stamps may be of one file with one content: they differ by device and time of
    /// change at the most. New links, another mode and numbers that a start of the machine gave
    /// out anew leave a file like that.
    bool isLike(const FileStamp& other) const;

    friend bool operator==(const FileStamp& a, const FileStamp& b) {
        return a.error == b.error && a.facts == b.facts;
    }

  private:
    static FileStamp of(const struct stat& status);
    static FileStamp ofFailure(int errnum);
};

}  // namespace platform
