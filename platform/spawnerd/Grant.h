#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/Error.h"
#include "platform/Value.h"

namespace platform {

struct Directories;

namespace spawnerd {

struct SandboxProfile;

/// What a host may start, and how it is run: an executable with what its bundle and its activation
/// overlay say about it. A plain value.
struct Grant {
    std::string executable;
    std::string bundle;  // the directory around the executable
    std::string bundleIdentifier;
    std::string bundleVersion;  // empty when the bundle has none
    std::string container;      // the plug-in's data container; empty when it has none
    std::vector<std::pair<std::string, std::string>> environment;
    const SandboxProfile* profile = nullptr;

    /// Reads the bundle and judges the overlay. Errors, all "POSIX": the executable does not exist
    /// or cannot be run (ENOENT, EACCES, ...); the bundle has no identifier that can name a
    /// directory, or the overlay is no good (EINVAL, or E2BIG for too large an environment); the
    /// data container is not what it has to be (see `checkOwnDirectory`).
    static Result<Grant> make(const Directories& directories, const std::string& executable,
                              const Dictionary& overlay);
};

/// Whether what is at the path, if anything is, is a directory of this user's own and no symbolic
/// link. None when it is, or nothing is there; else ENOTDIR or EPERM.
std::optional<Error> checkOwnDirectory(const std::string& path);

}  // namespace spawnerd
}  // namespace platform
