#pragma once

#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/spawnerd/Allowance.h"
#include "platform/spawnerd/InstanceLimits.h"
#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform {

struct Directories;

namespace spawnerd {

struct Grant;

/// A kind of sandbox that plug-ins run in.
struct SandboxProfile {
    const char* name;
    /// May have the user's network; otherwise there is none.
    bool network;
    /// Files below /etc that it sees besides those that every plug-in sees.
    std::span<const char* const> files;
    InstanceLimits limits;
};

/// Null for an unknown name.
const SandboxProfile* findSandboxProfile(std::string_view name);

/// What an instance finds for itself, beside what its profile and its grant say.
struct Surroundings {
    /// What it may have; a network only when its host has one, too.
    Allowance allowance;
    /// A directory, which it sees, read-only, as the place where it states that it is busy.
    std::string busyFolder;
};

/// What bubblewrap is started with.
struct SandboxSetup {
    std::vector<std::string> arguments;  // up to the command
    /// What the arguments bind by descriptor, so that it is what was looked at, whatever happens to
    /// its name; numbered from `kFirstSetupDescriptor` on.
    std::vector<UniqueFd> descriptors;
};

/// The setup for a granted plug-in of the daemon of a service name, whose bundle was opened in its
/// place. Everything that confines it is decided here; docs/bundles.md tells authors what they see.
/// Error: the data container is not a directory of this user's own any more.
Result<SandboxSetup> sandboxSetup(const Grant& grant, UniqueFd bundle,
                                  const Directories& directories, const std::string& daemonService,
                                  const Surroundings& surroundings);

}  // namespace spawnerd
}  // namespace platform
