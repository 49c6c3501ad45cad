#pragma once

#include "tools/zrctl/Options.h"
#include "tools/zrctl/Outcome.h"

namespace zrctl {

/// `zrctl elect`: makes one choice for every plug-in named.
Outcome runElect(const Options& options);

/// `zrctl annotate`: puts pairs into the "extension" of every plug-in named, beside what is there
/// or in its place.
Outcome runAnnotate(const Options& options);

}  // namespace zrctl
