#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/system/FileIdentity.h"
#include "platform/tandry/TDApplicationProxy.h"
#include "platform/values/LazyDictionary.h"
#include "platform/values/Uuid.h"
#include "platform/values/Value.h"

namespace platform {

/// The registry's record of one installed plug-in. Immutable once shared; tests build it directly.
///
/// Its dictionaries are the bundle's, completed (see tandry/Workspace.h). Values of unexpected
/// types are passed on as they are.
struct TDPlugInProxy {
    Uuid plugInUuid;
    std::optional<std::string> bundlePath;  // canonical path of the bundle directory
    FileIdentity bundleIdentity;            // which directory lay there when it was read
    std::string bundleIdentifier;           // "QFBundleIdentifier", else the identifier
    std::optional<std::string> plugInIdentifier;
    std::optional<std::string> originalIdentifier;
    std::string bundleVersion;  // may be empty
    Date registrationDate;
    bool onSystemPartition = false;
    TDApplicationProxyRef containingApplication;  // null outside an application
    LazyDictionary infoPlist;
    LazyDictionary entitlements;
    std::optional<std::string> localizedName;
    std::optional<std::string> localizedShortName;
    std::optional<std::string> dataContainerPath;

    /// "VXExtension" of the Info.plist when that is a dictionary, else null; likewise its
    /// attributes.
    const Dictionary* plugInDictionary() const;
    const Dictionary* attributes() const;
    /// The same of an Info.plist.
    static const Dictionary* attributesIn(const Dictionary& infoPlist);
};

using TDPlugInProxyRef = std::shared_ptr<const TDPlugInProxy>;

/// "<plug-in UUID> <identifier> at <path>"
std::string describe(const TDPlugInProxy& proxy);

}  // namespace platform
