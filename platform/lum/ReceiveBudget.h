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
        : Budget(loop, patience) {}

    /// Adds the bytes to the share if there is room and nobody in line comes first. On the loop.
    bool tryTake(Share& share, std::size_t bytes);

  private:
    bool fits(std::int64_t bytes) const;
    bool hasRoom() const override { return fits(firstWanted()); }
    bool isOverfull() const override { return !hasRoom(); }
    std::string blame(std::int64_t held) const override;
};

}  // namespace platform::lum
