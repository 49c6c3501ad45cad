#pragma once

#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Error.h"

namespace platform {

struct Directories;

namespace spawnerd {

struct Grant;

/// A kind of sandbox that plug-ins run in.
struct SandboxProfile {
    const char* name;
    /// Shares the machine's network; otherwise there is none.
    bool network;
    /// Files below /etc that it sees besides those that every plug-in sees.
    std::span<const char* const> files;
};

/// Null for an unknown name.
const SandboxProfile* findSandboxProfile(std::string_view name);

/// bubblewrap's arguments, up to the command, for a granted plug-in of the daemon of a service
/// name. Everything that confines it is decided here; docs/bundles.md tells authors what they see.
/// Makes the directory of the plug-in's busy assertions when it is missing. Errors: the data
/// container, or that directory, is not a directory of this user's own any more.
Result<std::vector<std::string>> sandboxArguments(const Grant& grant,
                                                  const Directories& directories,
                                                  const std::string& daemonService);

}  // namespace spawnerd
}  // namespace platform
