#include "platform/spawnerd/InstanceLimits.h"

#include <sys/resource.h>

#include <algorithm>

namespace platform::spawnerd {

namespace {

// Counted by user, and more than anybody needs.
constexpr std::uint64_t kMostSignals = 1024, kMostQueueBytes = 64u << 10;

/// Never above what was allowed before.
bool setLimit(pid_t process, __rlimit_resource resource, std::uint64_t most) {
    rlimit before{};
    if (::prlimit(process, resource, nullptr, &before) != 0) return false;
    const rlim_t limit = std::min<rlim_t>(most, before.rlim_max);
    const rlimit after{.rlim_cur = limit, .rlim_max = limit};
    return ::prlimit(process, resource, &after, nullptr) == 0;
}

}  // namespace

bool setProcessLimits(pid_t first, const InstanceLimits& limits) {
    return setLimit(first, RLIMIT_NPROC, limits.processes) &&
           setLimit(first, RLIMIT_NOFILE, limits.descriptors) &&
           setLimit(first, RLIMIT_SIGPENDING, kMostSignals) &&
           setLimit(first, RLIMIT_MSGQUEUE, kMostQueueBytes) && setLimit(first, RLIMIT_CORE, 0) &&
           // What an administrator lets the user have, for sound for example, is not a plug-in's.
           setLimit(first, RLIMIT_RTPRIO, 0) && setLimit(first, RLIMIT_NICE, 0);
}

}  // namespace platform::spawnerd
