#pragma once

#include <string_view>

#include "platform/system/FileIdentity.h"

namespace platform {

/// In a process with one thread, which ends soon: clones the mount of one file or directory, makes
/// the clone read-only, and sends a descriptor on it, with `text`, over a connected socket. This
/// process is in namespaces of its own afterwards, and must not outlive its parent. Answers 0 or an
/// errno: ESTALE when the path leads to another file, ELOOP when it does through a symbolic link.
int sendReadOnlyMount(const char* path, const FileIdentity& identity, int socket,
                      std::string_view text);

}  // namespace platform
