#pragma once

#include <string>
#include <variant>
#include <vector>

#include "platform/Error.h"
#include "platform/Uuid.h"
#include "platform/Value.h"
#include "tools/zrctl/Outcome.h"
#include "tools/zrctl/Session.h"

namespace zrctl {

/// The plug-ins that names stand for, in their order. A name is a UUID, which is taken as it is, or
/// an identifier that just one plug-in has; else the outcome says which plug-ins have it, or that
/// none does.
std::variant<std::vector<platform::Uuid>, Outcome> plugInsNamed(
    Session& session, const std::vector<std::string>& names);

/// The forms of all plug-ins that fit the rules, of every version, as far as this caller may see
/// them.
platform::Result<platform::Array> visiblePlugIns(Session& session,
                                                 const platform::Dictionary& rules);

/// The outcome for plug-ins that do not exist.
Outcome noSuchPlugIn(const std::string& name);

}  // namespace zrctl
