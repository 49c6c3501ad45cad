#pragma once

#include "platform/lum/Budget.h"

namespace platform::lum {

/// Bounds the memory of all requests received and not served to their end.
///
/// A share holds the bytes of its connection's requests, less those that are free to every
/// connection. A request's are taken as soon as its length is known: once begun, it can be read to
/// its end, and requests that are all begun do not wait for one another.
class ReceiveBudget final : public Budget {
  public:
    explicit ReceiveBudget(RunLoop& loop, std::chrono::milliseconds patience = kPatience)
        : Budget(loop, kMaxReceivedTotal, patience) {}

    /// Adds the bytes to the share if there is room and nobody in line comes first. On the loop.
    bool tryTake(Share& share, std::size_t bytes);

  private:
    bool hasRoom(const Tally& tally, std::int64_t limit, std::int64_t wanted) const override {
        return tally.held + wanted <= limit;
    }
    bool isOverfull(const Tally& tally, std::int64_t limit, std::int64_t wanted) const override {
        return !hasRoom(tally, limit, wanted);
    }
    std::string blame(std::int64_t held) const override;
};

}  // namespace platform::lum
