#pragma once

#include "tools/zrctl/Options.h"
#include "tools/zrctl/Outcome.h"

namespace zrctl {

/// `zrctl hold`: takes plug-ins out of service, writes the token of the hold, and keeps it until
/// SIGINT or SIGTERM comes, or the daemon goes away. Call before there are threads.
Outcome runHold(const Options& options);

/// `zrctl release`: gives holds back, whoever took them. Tokens of no hold are no failure.
Outcome runRelease(const Options& options);

}  // namespace zrctl
