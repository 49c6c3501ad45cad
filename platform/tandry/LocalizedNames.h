#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/values/Value.h"

namespace platform::tandry {

/// The user's languages in the order of preference, as the environment says (LC_ALL, LC_MESSAGES,
/// LANG and the list LANGUAGE): "de_DE.UTF-8" is "de_DE", then "de". Empty for the C locale.
std::vector<std::string> userLanguages();

struct LocalizedNames {
    std::optional<std::string> display;  // "QFBundleDisplayName", else "QFBundleName"
    std::optional<std::string> brief;    // "QFBundleName"
};

/// A bundle's names. Each key is looked up under the languages in `localized` (language to
/// dictionary), then in the Info.plist; what is no string counts as absent.
LocalizedNames localizedNames(const Dictionary& infoPlist, const Dictionary& localized,
                              const std::vector<std::string>& languages);

}  // namespace platform::tandry
