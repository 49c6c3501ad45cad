#pragma once

#include <sys/types.h>

#include <cstdint>

namespace platform::spawnerd {

/// What an instance may use of the machine. A plain value.
struct InstanceLimits {
    std::uint64_t memory;        // bytes, of all its processes; where there are groups
    std::uint64_t processes;     // and threads
    std::uint64_t descriptors;   // of each process
    std::uint64_t sharedMemory;  // bytes in /dev/shm
    std::uint64_t temporary;     // bytes in /tmp
    std::uint64_t cpuWeight;     // beside others, which have 100; where there are groups
};

inline constexpr std::uint64_t kMiB = 1u << 20;
/// Half of what most programs of the user have: descriptors that are on their way through sockets
/// count for all of the user's processes together, and each may send more as long as there are no
/// more of them than its own limit says.
inline constexpr std::uint64_t kUsualDescriptors = 512;

/// For what has to load what the user works with.
inline constexpr InstanceLimits kWorkLimits{.memory = 2048 * kMiB,
                                            .processes = 512,
                                            .descriptors = kUsualDescriptors,
                                            .sharedMemory = 64 * kMiB,
                                            .temporary = 64 * kMiB,
                                            .cpuWeight = 50};
/// For what waits most of its time, and there is much of.
inline constexpr InstanceLimits kSmallLimits{.memory = 512 * kMiB,
                                             .processes = 128,
                                             .descriptors = kUsualDescriptors,
                                             .sharedMemory = 16 * kMiB,
                                             .temporary = 64 * kMiB,
                                             .cpuWeight = 100};

/// Sets what the kernel limits by process on the first process of a sandbox, before it starts any
/// other: they all inherit it. Not memory: a process has a limit of addresses only, and runtimes
/// reserve far more of these than they use. From Linux 5.14 on the number of processes counts in
/// the sandbox's own user namespace, and so has to be set on a process in there; root's have no
/// such limit. False, with errno set, when that failed.
bool setProcessLimits(pid_t first, const InstanceLimits& limits);

}  // namespace platform::spawnerd
