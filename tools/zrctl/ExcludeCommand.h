#pragma once

#include "tools/zrctl/Options.h"
#include "tools/zrctl/Outcome.h"

namespace zrctl {

/// `zrctl exclude list`, `add` and `remove`: the rules in the user's preferences that take plug-ins
/// out of every discovery. Needs no daemon, which sees the change at its next match. All else in
/// the preferences stays as it is.
Outcome runExclude(const Options& options);

}  // namespace zrctl
