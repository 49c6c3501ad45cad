#pragma once

#include <memory>

#include "platform/lum/PeerLooks.h"
#include "platform/lum/PlaceLooks.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/services/Assertions.h"
#include "platform/services/CodeSigning.h"
#include "platform/services/Consent.h"
#include "platform/services/Notifications.h"
#include "platform/services/SdkDictionaries.h"
#include "platform/services/Types.h"
#include "platform/spawnerd/Launcher.h"
#include "platform/system/Directories.h"
#include "platform/tandry/Workspace.h"
#include "platform/threads/RunLoop.h"

namespace platform {

/// What the daemon needs of the system, built by its entry point; tests replace single members.
/// Shared with whoever uses a service.
struct Services {
    Directories directories;
    std::shared_ptr<RunLoop> mainLoop;
    std::shared_ptr<PeerLooks> looks;         // at hosts' executables, on that loop
    std::shared_ptr<PeerLooks> pathLooks;     // at what they name, so that it is in nobody's way
    std::shared_ptr<PlaceLooks> bundleLooks;  // at registered bundles, on that loop
    std::shared_ptr<SdkDictionaries> sdks;    // used by the registry, so it goes after it
    std::shared_ptr<Workspace> workspace;     // null when the registry could not be opened
    std::shared_ptr<CodeSigning> codeSigning;
    std::shared_ptr<Sandbox> sandbox;
    std::shared_ptr<Assertions> assertions;
    std::shared_ptr<Consent> consent;
    std::shared_ptr<Launcher> launcher;
    std::shared_ptr<Notifications> notifications;
    std::shared_ptr<Types> types;
};

}  // namespace platform
