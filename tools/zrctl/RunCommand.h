#pragma once

#include "tools/zrctl/Options.h"
#include "tools/zrctl/Outcome.h"

namespace zrctl {

/// `zrctl run`: makes a plug-in ready for this process, starts it, and connects it with standard
/// input and output. The exit status is the plug-in's; SIGINT and SIGTERM end it. Call before there
/// are threads.
Outcome runPlugIn(const Options& options);

}  // namespace zrctl
