#pragma once

#include <memory>
#include <optional>
#include <string>

#include "zrd/RuleSet.h"

namespace zorvan {

class HostProcess;
class ZRDPlugIn;

/// The plug-ins that a host's own entitlements restrict it to, read once to be asked of many of
/// them. Used by one thread at a time.
class HostRestriction {
  public:
    HostRestriction(const HostProcess& host, const std::shared_ptr<platform::Types>& types);

    /// Why it keeps a plug-in from the host; none: it does not. A restriction that is no rules, or
    /// more than a host may ask for, keeps every one.
    std::optional<std::string> refusal(const ZRDPlugIn& plugIn) const;

  private:
    bool isInvalid_ = false;
    std::optional<RuleSet> rules_;
};

}  // namespace zorvan
