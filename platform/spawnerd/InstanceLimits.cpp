#include "platform/spawnerd/InstanceLimits.h"

#include <sys/resource.h>

#include <algorithm>

namespace platform::spawnerd {

namespace {

/// Never above what was allowed before.
bool setLimit(pid_t process, __rlimit_resource resource, std::uint64_t soft, std::uint64_t hard) {
    rlimit before{};
    if (::prlimit(process, resource, nullptr, &before) != 0) return false;
    const rlimit after{.rlim_cur = std::min<rlim_t>(soft, before.rlim_max),
                       .rlim_max = std::min<rlim_t>(hard, before.rlim_max)};
    return ::prlimit(process, resource, &after, nullptr) == 0;
}

}  // namespace

bool setProcessLimits(pid_t first, const InstanceLimits& limits) {
    return setLimit(first, RLIMIT_NPROC, limits.processes, limits.processes) &&
           setLimit(first, RLIMIT_NOFILE, limits.descriptors, kMostDescriptors) &&
           setLimit(first, RLIMIT_CORE, 0, 0);
}

}  // namespace platform::spawnerd
