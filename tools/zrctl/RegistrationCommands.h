#pragma once

#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/system/Error.h"
#include "tools/zrctl/Options.h"
#include "tools/zrctl/Outcome.h"

namespace zrctl {

/// `zrctl add` and `zrctl remove`: registers or unregisters bundles by path, in order, up to the
/// first that the daemon refuses; those before it stay done.
Outcome runRegistration(const Options& options);

/// A path from the command line as the daemon takes it: absolute, a relative one within
/// `directory`; nothing is resolved. Error: it could not be sent (it is empty, or no UTF-8).
platform::Result<std::string> absolutePath(const std::string& path, std::string_view directory);

/// The same for several within the current directory; or the outcome when that fails.
std::variant<std::vector<std::string>, Outcome> absolutePaths(
    const std::vector<std::string>& paths);

}  // namespace zrctl
