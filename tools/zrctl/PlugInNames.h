#pragma once

#include <functional>
#include <string>
#include <variant>
#include <vector>

#include "platform/system/Error.h"
#include "platform/values/Uuid.h"
#include "platform/values/Value.h"
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

/// Calls `work` with a session and the plug-ins that names stand for.
Outcome withPlugIns(
    const std::string& service, const std::vector<std::string>& names,
    const std::function<Outcome(Session&, const std::vector<platform::Uuid>&)>& work);

/// The form of each of these plug-ins, in their order; or the outcome when one cannot be seen.
std::variant<std::vector<platform::Dictionary>, Outcome> formsOf(
    Session& session, const std::vector<platform::Uuid>& uuids);

/// The outcome of a request about these plug-ins that failed. The daemon does not say which UUID it
/// does not know; `remark` goes with that when it may be one of several.
Outcome failureWith(const std::vector<platform::Uuid>& uuids, const platform::Error& error,
                    const char* remark = "");

}  // namespace zrctl
