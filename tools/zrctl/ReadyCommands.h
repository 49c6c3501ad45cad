#pragma once

#include "tools/zrctl/Options.h"
#include "tools/zrctl/Outcome.h"

namespace zrctl {

/// `zrctl ready`: has the daemon admit this process to plug-ins, and prepare them for it: done when
/// it could start each of them.
Outcome runReady(const Options& options);

/// `zrctl access`: writes a token for read access to the bundle of each plug-in, a line each.
Outcome runAccess(const Options& options);

}  // namespace zrctl
