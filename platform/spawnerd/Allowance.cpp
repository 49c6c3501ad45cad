#include "platform/spawnerd/Allowance.h"

#include <algorithm>
#include <cstdint>
#include <iterator>
#include <string>

#include "platform/log/OpsLog.h"
#include "platform/spawnerd/Grant.h"
#include "platform/spawnerd/SandboxProfile.h"

namespace platform::spawnerd {

namespace {

constexpr const char* kNetwork = "network";

/// The numbers that there are, as people write them: in units of so much, from a least to a most.
struct Limit {
    std::string_view key;
    std::uint64_t InstanceLimits::*place;
    std::uint64_t unit, least, most;
};
constexpr std::uint64_t kMostMiB = 1u << 24;
constexpr Limit kLimits[] = {
    {"memory", &InstanceLimits::memory, kMiB, 16, kMostMiB},
    {"processes", &InstanceLimits::processes, 1, 1, 1u << 15},
    {"descriptors", &InstanceLimits::descriptors, 1, 32, 1u << 20},
    {"shared-memory", &InstanceLimits::sharedMemory, kMiB, 1, kMostMiB},
    {"temporary", &InstanceLimits::temporary, kMiB, 1, kMostMiB},
    {"cpu-weight", &InstanceLimits::cpuWeight, 1, 1, 10000},
};

/// False when there is no such setting, or not with such a value.
bool apply(std::string_view key, const Value& value, bool profileHasNetwork, Allowance& allowance) {
    if (key == kNetwork) {
        const auto wanted = value.boolean();
        if (wanted) allowance.network = *wanted && profileHasNetwork;
        return wanted.has_value();
    }
    const auto limit = std::ranges::find(kLimits, key, &Limit::key);
    const auto number = value.unsignedInteger();
    if (limit == std::end(kLimits) || !number || *number < limit->least || *number > limit->most)
        return false;
    allowance.limits.*limit->place = *number * limit->unit;
    return true;
}

}  // namespace

Allowance allowanceFor(const Grant& grant, const LauncherSettings& settings) {
    const bool hasNetwork = grant.profile->network;
    Allowance allowance{grant.profile->limits, hasNetwork && grant.wantsNetwork};
    if (!settings) return allowance;
    for (const auto& [kind, name] : {std::pair("extension-points", &grant.extensionPoint),
                                     std::pair("plug-ins", &grant.plugInIdentifier)}) {
        const std::optional<Value> all = settings(kind);
        const Value* own = all && all->dictionary() ? all->dictionary()->find(*name) : nullptr;
        if (all && (!all->dictionary() || (own && !own->dictionary())))
            EVLOG_ERROR(ops(), "ignoring the limits of {} {}: no dictionary", pub(kind), *name);
        if (!own || !own->dictionary()) continue;
        for (const auto& [key, value] : *own->dictionary())
            if (!apply(key, value, hasNetwork, allowance))
                EVLOG_ERROR(ops(),
                            "ignoring the limit \"{}\" of {} {}: no such limit, or out of bounds",
                            key, pub(kind), *name);
    }
    return allowance;
}

}  // namespace platform::spawnerd
