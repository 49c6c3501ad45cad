#pragma once

#include "platform/lum/Budget.h"

namespace platform::lum {

/// Bounds the memory of all unsent replies, by deciding when one more request may be served. A
/// request in service is expected to need as much as the largest reply that had to be kept lately,
/// so that many requests let in at the same moment cannot exceed a limit together. An origin that
/// has nothing in service and does not hold more than its quarter may always have one more, however
/// large its reply will be.
///
/// A share holds the unsent replies of its connection.
class ReplyBudget final : public Budget {
  public:
    explicit ReplyBudget(RunLoop& loop, std::chrono::milliseconds patience = kPatience)
        : Budget(loop, kMaxUnsentTotal, patience) {}

    /// Whether a request of the share's connection may be served now; if so it counts as in service
    /// until `leave`. Those in line come first. On the loop.
    bool tryEnter(const Share& share);
    /// From any thread.
    void leave(const Share& share);

  private:
    bool hasRoom(const Tally& tally, std::int64_t limit, std::int64_t wanted) const override;
    bool isOverfull(const Tally& tally, std::int64_t limit, std::int64_t wanted) const override;
    void heldChanged(std::int64_t by) override;
    std::string blame(std::int64_t held) const override;

    std::int64_t expected_ = kMaxUnsentPerConnection;  // guarded by the mutex
};

}  // namespace platform::lum
