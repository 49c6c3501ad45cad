#pragma once

#include <functional>
#include <string>
#include <vector>

#include "bench/Child.h"
#include "bench/Frames.h"

namespace bench {

/// The monotonic clock, in microseconds.
double now();

double median(std::vector<double> samples);

/// One round of something measured: what it took, in microseconds.
using Round = std::function<double()>;

/// A round that runs `work` and takes its time.
template <class Work>
Round timed(Work work) {
    return [work = std::move(work)]() mutable {
        const double start = now();
        work();
        return now() - start;
    };
}

/// How long to measure: until there are `rounds` of each side or `seconds` are over, in blocks of
/// `block` rounds; at least two blocks.
struct Plan {
    int rounds;
    int block;
    double seconds;
};

/// The median of each side. Blocks of the sides take turns, so that all see the machine in the same
/// states. Each side's first block is its warm-up, and the first round of every block is not
/// counted: on one CPU it also pays for what the other side left to do.
std::vector<double> medianOfEach(const Plan& plan, const std::vector<Round>& sides);

/// A connection to a process just started, made as soon as it listens, which takes a minute at
/// most.
platform::UniqueFd waitForSocket(const std::string& socketPath, const Child& process);

}  // namespace bench
