#pragma once

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/system/Error.h"
#include "platform/system/FileStamp.h"
#include "platform/system/KnownDirectory.h"
#include "platform/system/UniqueFd.h"
#include "platform/values/Value.h"

namespace platform {

struct Directories;
struct ExternalService;

namespace spawnerd {

struct SandboxProfile;

/// The entitlement with which a plug-in asks for the user's network.
inline constexpr const char* kNetworkEntitlement = "com.orbel.developer.network-client";

/// What the files of a bundle that a grant was made from were like before they were read: while
/// they are, reading them would tell the same.
struct GrantStamps {
    FileStamp info;
    FileStamp entitlements;
    FileStamp executable;

    /// Of an open bundle (borrowed).
    static GrantStamps of(int bundle, const std::string& executable);
    bool areSettled() const { return info.settled && entitlements.settled && executable.settled; }
    friend bool operator==(const GrantStamps&, const GrantStamps&) = default;
};

/// What a host may start, and how it is run: an executable with what its bundle and its activation
/// overlay say about it. A plain value.
struct Grant {
    std::string executable;
    KnownDirectory bundle;
    std::string bundleIdentifier;
    std::string plugInIdentifier;
    std::string extensionPoint;  // empty when the bundle names none
    bool wantsNetwork = false;   // as its entitlements say
    std::string bundleVersion;   // empty when the bundle has none
    std::string container;       // the plug-in's data container; empty when it has none
    std::vector<std::pair<std::string, std::string>> environment;
    const SandboxProfile* profile = nullptr;
    std::shared_ptr<const GrantStamps> stamps;  // null: only reading its files tells what they say

    /// Reads the bundle and judges the overlay. Errors, all "POSIX": the bundle is not in its place
    /// (see `KnownDirectory::open`); the executable does not exist, cannot be run or lies outside
    /// (ENOENT, EACCES, EXDEV, ...); the bundle has no identifier that can name a directory, or the
    /// overlay is no good (EINVAL, or E2BIG for too large an environment); the data container is
    /// not what it has to be (see `openContainer`).
    static Result<Grant> make(const Directories& directories, const ExternalService& service,
                              const Dictionary& overlay);
    /// The grant for the same service with another overlay, while everything on disk is as it was
    /// when this one was made: without reading or waiting for anything. None when that cannot be
    /// told, or something is different, or the overlay is no good: then only `make` tells.
    std::optional<Grant> renewed(const Dictionary& overlay) const;
};

/// What a grant names, open (O_PATH): bound into a sandbox it is what was looked at, whatever
/// happens to its name.
struct GrantedPlaces {
    UniqueFd bundle;
    UniqueFd container;  // none when the plug-in has none

    /// Both were checked when the grant was made, and may have been exchanged since. Hangs with
    /// their file systems. Errors: those of `KnownDirectory::open` and `openContainer`.
    static Result<GrantedPlaces> open(const Grant& grant, const Directories& directories);
};

/// Opens (O_PATH) a data container. Errors: the system's; EINVAL when the path is not one below
/// this user's containers; EXDEV when it leads out of them, ELOOP or ENOTDIR for a symbolic link
/// there, EPERM for a directory of somebody else.
Result<UniqueFd> openContainer(const Directories& directories, const std::string& path);

}  // namespace spawnerd
}  // namespace platform
