#include "bench/Measure.h"

#include <time.h>

#include <algorithm>

#include "bench/Failure.h"
#include "bench/Interrupt.h"

namespace bench {

double now() {
    timespec time;
    ::clock_gettime(CLOCK_MONOTONIC, &time);
    return static_cast<double>(time.tv_sec) * 1e6 + static_cast<double>(time.tv_nsec) / 1e3;
}

double median(std::vector<double> samples) {
    if (samples.empty()) fail("nothing was measured");
    const auto middle = samples.begin() + static_cast<std::ptrdiff_t>(samples.size() / 2);
    std::nth_element(samples.begin(), middle, samples.end());
    return *middle;
}

std::vector<double> medianOfEach(const Plan& plan, const std::vector<Round>& sides) {
    for (const Round& side : sides) {
        for (int i = 0; i < plan.block; ++i) side();
    }
    std::vector<std::vector<double>> samples(sides.size());
    const double end = now() + plan.seconds * 1e6;
    for (int counted = 0; counted < plan.rounds; counted += plan.block) {
        if (counted >= 2 * plan.block && now() > end) break;
        checkInterrupted();
        for (std::size_t i = 0; i < sides.size(); ++i) {
            sides[i]();
            for (int round = 0; round < plan.block; ++round) samples[i].push_back(sides[i]());
        }
    }
    std::vector<double> medians;
    for (std::vector<double>& side : samples) medians.push_back(median(std::move(side)));
    return medians;
}

platform::UniqueFd waitForSocket(const std::string& socketPath, const Child& process) {
    constexpr timespec kPause{0, 200'000};
    for (const double end = now() + 60e6; now() < end;) {
        checkInterrupted();
        if (auto socket = tryConnect(socketPath)) return std::move(*socket);
        if (!process.running()) fail("the process for {} ended at once", socketPath);
        // Pausing leaves the CPU to the process that is waited for.
        ::nanosleep(&kPause, nullptr);
    }
    fail("nobody listens at {} after a minute", socketPath);
}

}  // namespace bench
