#pragma once

#include <chrono>
#include <cstddef>
#include <optional>

#include "platform/lum/Limits.h"

namespace platform::lum {

/// How long something has been expected of a peer without progress worth the name: whoever moves a
/// byte now and then is stalled all the same.
class StallClock {
  public:
    using Time = std::chrono::steady_clock::time_point;

    /// Whether something is expected now.
    void expect(bool expected) {
        if (expected && !expected_) restart();
        expected_ = expected;
    }
    void progress(std::size_t bytes) {
        bytes_ += bytes;
        if (bytes_ >= kLeastProgress) restart();
    }

    /// None while nothing is expected.
    std::optional<Time> since() const { return expected_ ? std::optional(since_) : std::nullopt; }

  private:
    void restart() {
        since_ = std::chrono::steady_clock::now();
        bytes_ = 0;
    }

    bool expected_ = false;
    Time since_;
    std::size_t bytes_ = 0;  // moved since then
};

}  // namespace platform::lum
