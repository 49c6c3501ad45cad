#pragma once

#include <memory>
#include <set>
#include <string>
#include <utility>

namespace platform {

/// Which bundles are known to lie where they were when the registry last looked, without a look at
/// each of them: what a registry that watches the disk can tell at once. A plain value; by default
/// it knows nothing.
class UntouchedBundles {
  public:
    using Paths = std::set<std::string>;

    UntouchedBundles() = default;
    /// All but those at some paths.
    explicit UntouchedBundles(std::shared_ptr<const Paths> exceptions)
        : exceptions_(std::move(exceptions)) {}

    /// Whether this bundle is one, given the canonical path of a registered one.
    bool contains(const std::string& bundlePath) const {
        return exceptions_ && !exceptions_->contains(bundlePath);
    }

  private:
    std::shared_ptr<const Paths> exceptions_;  // null: no bundle is known to be untouched
};

}  // namespace platform
