#pragma once

#include "platform/lum/Budget.h"

namespace platform::lum {

/// Bounds the memory of all unsent replies, by deciding when one more request may be served. A
/// request in service is expected to need as much as the largest reply that had to be kept lately,
/// so that many requests let in at the same moment cannot exceed the limit together.
///
/// A share holds the unsent replies of its connection.
class ReplyBudget final : public Budget {
  public:
    explicit ReplyBudget(RunLoop& loop, std::chrono::milliseconds patience = kPatience)
        : Budget(loop, patience) {}

    /// Whether a request may be served now; if so it counts as in service until `leave`. Those in
    /// line come first. On the loop.
    bool tryEnter();
    /// From any thread.
    void leave();

  private:
    bool hasRoom() const override;
    bool isOverfull() const override;
    void heldChanged(std::int64_t by) override;
    std::string blame(std::int64_t held) const override;

    // Guarded by the mutex.
    std::int64_t inService_ = 0;
    std::int64_t expected_ = kMaxUnsentPerConnection;
};

}  // namespace platform::lum
