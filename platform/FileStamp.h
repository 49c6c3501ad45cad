#pragma once

#include <string>

namespace platform {

/// A text that changes whenever the file at `path` is replaced or rewritten (device, inode, times
/// and size); symbolic links are followed. Empty when there is no such file; a file that cannot be
/// looked at has a stamp, so that reading it says why.
std::string fileStamp(const std::string& path);

}  // namespace platform
