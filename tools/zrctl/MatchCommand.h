#pragma once

#include "tools/zrctl/Options.h"
#include "tools/zrctl/Outcome.h"

namespace zrctl {

/// `zrctl match`: asks the daemon for the plug-ins that fit the rules and lists them. Done when
/// there are any.
Outcome runMatch(const Options& options);

}  // namespace zrctl
