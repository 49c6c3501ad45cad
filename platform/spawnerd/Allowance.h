#pragma once

#include "platform/spawnerd/InstanceLimits.h"
#include "platform/spawnerd/Launcher.h"

namespace platform::spawnerd {

struct Grant;

/// What an instance may have. A plain value.
struct Allowance {
    InstanceLimits limits;
    bool network;  // the user's, for a host that has it
};

/// What instances of a granted plug-in may have: what its profile says, and, in its bounds, what
/// the plug-in asks for; over that what the administrator says of its extension point, over that
/// what the administrator says of the plug-in. What is no good there is left out, with an error
/// line. `settings` may be null.
Allowance allowanceFor(const Grant& grant, const LauncherSettings& settings);

}  // namespace platform::spawnerd
