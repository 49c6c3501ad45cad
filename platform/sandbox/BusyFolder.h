#pragma once

#include <string>
#include <string_view>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform {

struct Directories;

/// Key of a busy instance's report: the bundle identifier, as text.
inline constexpr const char* kAssertionBundleIdentifier = "BundleIdentifier";

/// Where one instance of a bundle states that it is busy: a folder of its own, with one file that
/// holds its report, below <runtime>/zorvan/tenurd/<bundle identifier>/. Its name tells instances
/// of this bundle from those of another one that claims the same identifier. Whoever locks the file
/// is busy; nothing in there needs to be written for that. The folder lives as long as this object,
/// and what a process leaves that was killed is removed by `sweep`. Move-only.
class BusyFolder {
  public:
    /// The file's name.
    static constexpr const char* kFile = "busy";

    /// The folder of all instances of a bundle, which a confined instance sees its own as.
    static std::string ofBundle(const Directories& directories,
                                const std::string& bundleIdentifier);

    /// For an instance of the bundle at a path, or, with an empty one, for whoever says nothing but
    /// the identifier. Errors: the system's; ENOTDIR or EPERM when the bundle's folder is not a
    /// directory of this user's own; EINVAL for an identifier that cannot be a file's name.
    static Result<BusyFolder> make(const Directories& directories,
                                   const std::string& bundleIdentifier,
                                   const std::string& bundlePath);
    BusyFolder(BusyFolder&&) = default;
    BusyFolder& operator=(BusyFolder&& other) noexcept;
    ~BusyFolder();

    const std::string& path() const { return path_; }

    /// What the names of the folders begin with that are those of the bundle at a path; "" for an
    /// empty path.
    static std::string prefixOf(const std::string& bundlePath);
    /// Whether a folder's name has a prefix, or is that of a folder made for an identifier alone.
    static bool isOf(std::string_view name, std::string_view prefix);

    /// Removes the folders, of all bundles, that have no owner any more.
    static void sweep(const Directories& directories);

  private:
    BusyFolder() = default;

    std::string path_;
    UniqueFd folder_;  // locked, so that nobody takes it for one without an owner
};

}  // namespace platform
