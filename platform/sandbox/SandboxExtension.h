#pragma once

#include <cstdint>
#include <string>

namespace platform {

/// The receiving end of read access that a daemon has given away as a token. From any thread.

/// Trades a token for access with the daemon that issued it, in this user's runtime directory;
/// waits for its answer, some seconds at most. The handle is a descriptor, open for reading and
/// closed on exec, of the file or directory on a read-only mount of its own: nothing can be written
/// through it, and ".." ends at its root. 0 when it is refused.
std::int64_t consumeExtension(const std::string& token);
/// Gives the access back. Does nothing for 0.
void releaseExtension(std::int64_t handle);

}  // namespace platform
