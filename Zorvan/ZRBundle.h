#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/lum/LumBundle.h"
#include "platform/values/Value.h"

namespace zorvan {

/// What the daemon asks of a bundle on disk: an application, a plug-in, or the bundle around an
/// executable. Usable from any thread.
class ZRBundle {
  public:
    /// Each makes a record around a `LumBundle`; null when that could not be made.
    static std::shared_ptr<ZRBundle> initForMainBundle();
    static std::shared_ptr<ZRBundle> initWithPath(const std::string& bundlePath);
    /// From an executable inside a bundle. A path that is in no bundle is taken as a bundle path.
    static std::shared_ptr<ZRBundle> initWithExecutablePath(const std::string& executablePath);
    static std::shared_ptr<ZRBundle> initWithLumBundle(std::shared_ptr<platform::LumBundle> bundle);

    /// The text of a numbered property of the platform's bundle, or none.
    std::optional<std::string> stringProperty(int number) const;
    std::optional<std::string> path() const;
    /// The executable; the bundle's own path when it names none.
    std::optional<std::string> executablePath() const;
    /// The directory of the support files, fetched once.
    std::optional<std::string> supportPath() const;
    /// `supportPath` with a name appended; none without a support path.
    std::optional<std::string> bundleDirectory(const std::string& name) const;
    /// The directory of the plug-ins inside this bundle.
    std::optional<std::string> plugInsPath() const;
    /// The Info.plist, read afresh; none when there is none, which is logged.
    std::optional<platform::Dictionary> infoDictionary() const;
    std::optional<std::string> bundleIdentifier() const;

    const std::shared_ptr<platform::LumBundle>& lumBundle() const { return bundle_; }

  private:
    explicit ZRBundle(std::shared_ptr<platform::LumBundle> bundle) : bundle_(std::move(bundle)) {}

    std::shared_ptr<platform::LumBundle> bundle_;
    mutable std::mutex mutex_;  // guards supportPath_
    mutable std::optional<std::string> supportPath_;
};

std::string describe(const ZRBundle& bundle);

}  // namespace zorvan
