#pragma once

#include "tools/zrctl/Outcome.h"

namespace zrctl {

/// `zrctl watch`: writes a line for each change notification, at once, until SIGINT or SIGTERM
/// comes or nobody reads the lines any more. Needs no daemon. Call before there are threads: the
/// signals are blocked from then on.
Outcome runWatch();

}  // namespace zrctl
