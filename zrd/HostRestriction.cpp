#include "zrd/HostRestriction.h"

#include "Zorvan/Keys.h"
#include "zrd/HostProcess.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

namespace {

/// Entitlements are files that the user installed.
constexpr std::size_t kTimes = 4;

}  // namespace

HostRestriction::HostRestriction(const HostProcess& host,
                                 const std::shared_ptr<platform::Types>& types) {
    const auto value = host.entitlementValueForKey(entitlement::kAllowedPlugIns);
    if (!value) return;
    const platform::Dictionary* rules = value->dictionary();
    isInvalid_ = !rules || !RuleSet::isAffordable(*rules, kTimes);
    if (!isInvalid_) rules_.emplace(*rules, types);
}

std::optional<std::string> HostRestriction::refusal(const ZRDPlugIn& plugIn) const {
    if (isInvalid_) return "invalid host restriction entitlement";
    if (!rules_ || plugIn.match(*rules_)) return std::nullopt;
    return "the host's plug-in entitlement does not allow this plug-in";
}

}  // namespace zorvan
