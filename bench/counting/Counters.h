#pragma once

#include <atomic>
#include <cstdint>

namespace bench {

/// What a process has called, since somebody began to count, on any of its threads.
struct Counters {
    std::atomic<std::uint64_t> allocations;   // also those that only grow what is there
    std::atomic<std::uint64_t> syncs;         // of files and directories
    std::atomic<std::uint64_t> replacements;  // of one file by another
};

/// In a program that begins with this in its environment, the calls are counted in the file that it
/// names.
inline constexpr const char* kCountersVariable = "ZRD_BENCH_COUNTERS";

/// Where the calls of this process are counted; null while nobody wants to know.
extern std::atomic<Counters*> countersInUse;

}  // namespace bench
