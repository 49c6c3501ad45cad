#pragma once

#include <functional>
#include <memory>

#include "platform/system/Error.h"
#include "platform/tandry/ChangeGatherer.h"
#include "platform/tandry/Workspace.h"

namespace platform {

struct Directories;
class SdkDictionaries;

/// Merges an SDK dictionary (first) under a bundle's Info.plist (second); answers the merged one.
using SdkMerge = std::function<Dictionary(const Dictionary& sdk, const Dictionary& infoPlist)>;

namespace tandry {

/// The registry over this user's disk, with a catalogue at <data>/zorvan/Tandry.db. Once activated
/// it follows what changes on disk. `sdks` must outlive it. A catalogue that cannot be used is told
/// of in an error line, and the registry works in memory. Error: another process owns the catalogue
/// (EADDRINUSE).
Result<std::unique_ptr<Workspace>> openDiskWorkspace(const Directories& directories,
                                                     SdkDictionaries& sdks, SdkMerge merge,
                                                     const WatchSettings& settings = {});

}  // namespace tandry

}  // namespace platform
