#pragma once

#include <string>

namespace platform {

/// What tells one content of a file from another without reading it.
struct FileStamp {
    /// Changes whenever the file is replaced or rewritten (device, inode, times and size). Empty
    /// when there is no such file; a file that cannot be looked at has a text, so that reading it
    /// says why.
    std::string text;
    /// False for a file that was changed within the last clock ticks: it may be changed again
    /// without another text. Such a stamp must not be remembered for what is read after it.
    bool settled = true;
};

/// The stamp that the file at `path` has now; symbolic links are followed.
FileStamp fileStamp(const std::string& path);

}  // namespace platform
