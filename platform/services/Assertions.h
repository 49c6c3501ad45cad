#pragma once

#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/sandbox/BusyFolder.h"
#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"
#include "platform/values/Value.h"

namespace platform {

struct Directories;

/// Which running plug-in instances are busy.
class Assertions {
  public:
    virtual ~Assertions() = default;
    /// A report for each running instance of these bundles that holds a busy assertion: what its
    /// file says, or an empty dictionary when that cannot be read. Of instances that were started
    /// from a bundle, only those of the one at `bundlePath` count: an identifier is anybody's to
    /// claim. Disturbs nobody. From any thread.
    virtual std::vector<Dictionary> busyInstancesForBundleIdentifiers(
        const std::set<std::string>& bundleIdentifiers, const std::string& bundlePath) = 0;
};

/// Assertions as locks on the files of `BusyFolder`.
std::unique_ptr<Assertions> makeFileAssertions(const Directories& directories);

/// A plug-in instance's statement that it is busy, for as long as this object, or its process,
/// lives. It is made in the folder that the launcher made for the instance; a process that was not
/// started by one makes itself a folder, which counts for every bundle of the identifier.
/// Move-only.
class BusyAssertion {
  public:
    /// Error: the system's, or EINVAL for an identifier that cannot be a file's name.
    static Result<BusyAssertion> take(const Directories& directories,
                                      const std::string& bundleIdentifier);

  private:
    BusyAssertion(std::optional<BusyFolder> own, UniqueFd file)
        : own_(std::move(own)), file_(std::move(file)) {}

    std::optional<BusyFolder> own_;
    UniqueFd file_;  // carries the lock
};

}  // namespace platform
