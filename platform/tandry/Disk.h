#pragma once

#include <map>
#include <optional>
#include <string>

#include "platform/system/Error.h"
#include "platform/tandry/ApplicationScanner.h"
#include "platform/tandry/BundleReader.h"
#include "platform/tandry/DataContainers.h"
#include "platform/tandry/FolderWatch.h"
#include "platform/tandry/ForeignPlaces.h"
#include "platform/tandry/RegistryState.h"
#include "platform/tandry/UntrustedPlaces.h"
#include "platform/threads/SerialQueue.h"

namespace platform::tandry {

/// The disk, as the registry knows it, and all that looks at it. Who looks may have to wait for a
/// file system, so that is done on a thread of its own, while the registry's thread, to which it
/// belongs, waits (see `DiskWalks`).
class Disk {
  public:
    Disk(const Directories& directories, SdkDictionaries& sdks, SdkMerge merge,
         std::size_t mostWatches, RegistryState known);
    Disk(const Disk&) = delete;

    /// What came of a request to register or unregister a path.
    struct Outcome {
        std::optional<RegistryChanges> changes;  // none when no walk was needed to answer
        std::optional<Error> error;
        bool isRefused = false;  // because of where it lies; the error says where
    };
    Outcome registerBundle(const std::string& bundlePath);
    Outcome unregisterBundle(const std::string& bundlePath);

    RegistryState state;
    ForeignPlaces places;
    BundleReader reader;
    DataContainers containers;
    FolderWatch watch;
    UntrustedPlaces untrusted;
    ApplicationScanner scanner;

    SerialQueue thread{"walk"};  // the last member: what it still does uses the others

  private:
    RegistryChanges scanRegistered(const std::string& path, bool& hasPlugIns);
    bool forgetWithin(const std::string& path, RegistryChanges& changes);
    void dropApplications(const std::string& path, RegistryChanges& changes);
    bool dropRegistrations(const std::string& path, RegistryChanges& changes);
};

}  // namespace platform::tandry
