#pragma once

#include <memory>
#include <string>

namespace platform {

/// The registry's record of one application. Immutable once shared.
struct TDApplicationProxy {
    std::string bundlePath;        // the canonical path of the `.app` directory
    std::string bundleIdentifier;  // empty when its Info.plist names none
    std::string localizedName;     // display name in the user's language; may be empty
    bool isPlaceholder = false;    // still being installed

    friend bool operator==(const TDApplicationProxy&, const TDApplicationProxy&) = default;
};

using TDApplicationProxyRef = std::shared_ptr<const TDApplicationProxy>;

}  // namespace platform
