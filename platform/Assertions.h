#pragma once

#include <memory>
#include <set>
#include <string>
#include <vector>

#include "platform/Error.h"
#include "platform/UniqueFd.h"
#include "platform/Value.h"

namespace platform {

struct Directories;

/// Key of a busy instance's report: the bundle identifier, as text.
inline constexpr const char* kAssertionBundleIdentifier = "BundleIdentifier";

/// Which running plug-in instances are busy.
class Assertions {
  public:
    virtual ~Assertions() = default;
    /// A report for each running instance of these bundles that holds a busy assertion: what its
    /// file says, or an empty dictionary when that cannot be read. Disturbs nobody. From any
    /// thread.
    virtual std::vector<Dictionary> busyInstancesForBundleIdentifiers(
        const std::set<std::string>& bundleIdentifiers) = 0;
};

/// Assertions as locks on files under <runtime>/zorvan/tenurd/<bundle identifier>/.
std::unique_ptr<Assertions> makeFileAssertions(const Directories& directories);

/// A plug-in instance's statement that it is busy, for as long as this object, or its process,
/// lives. Move-only.
class BusyAssertion {
  public:
    /// Error: the system's, or EINVAL for an identifier that cannot be a file's name.
    static Result<BusyAssertion> take(const Directories& directories,
                                      const std::string& bundleIdentifier);
    BusyAssertion(BusyAssertion&&) = default;
    BusyAssertion& operator=(BusyAssertion&& other);
    ~BusyAssertion();

  private:
    BusyAssertion(UniqueFd file, std::string path)
        : file_(std::move(file)), path_(std::move(path)) {}

    UniqueFd file_;  // carries the lock
    std::string path_;
};

}  // namespace platform
