#pragma once

#include <memory>
#include <optional>
#include <vector>

#include "platform/lum/LumBundle.h"
#include "platform/values/Value.h"

namespace platform {

/// Keys of a consent record (the path is that of the application), and the service that stands for
/// a keyboard's use of the network.
inline constexpr const char* kConsentGranted = "granted";
inline constexpr const char* kConsentService = "service";
inline constexpr const char* kConsentPath = "path";
inline constexpr const char* kKeyboardNetworkConsent = "com.orbel.consent.keyboard-network";

struct Directories;

/// What the user has allowed to applications.
class Consent {
  public:
    virtual ~Consent() = default;

    /// The consent records of an application: dictionaries with `kConsentGranted` (boolean) and
    /// `kConsentService` (text). None when they could not be read; an application about which
    /// nothing was ever recorded has an empty list. What was recorded of an application elsewhere
    /// is not among them, whatever identifier the two claim.
    virtual std::optional<std::vector<Dictionary>> copyConsentInformation(
        const LumBundle& application) = 0;
};

/// Consent in files: <config>/zorvan/Consent/<application's bundle identifier>.plist, a list of
/// records. A record is good for the application that its `kConsentPath` leads to.
std::unique_ptr<Consent> makeFileConsent(const Directories& directories);

}  // namespace platform
