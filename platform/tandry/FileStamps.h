#pragma once

#include <string>

namespace platform::tandry {

/// Appends the stamp of a file to `stamps`: modification and change time, size and inode, symbolic
/// links followed. A file that does not exist or cannot be looked at has a stamp too. Answers
/// whether it exists.
bool appendFileStamp(int dirfd, const char* file, std::string& stamps);

}  // namespace platform::tandry
