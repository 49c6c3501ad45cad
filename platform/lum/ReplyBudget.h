#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>

#include "platform/RunLoop.h"
#include "platform/lum/Limits.h"

namespace platform::lum {

/// Keeps the memory of all unsent replies of a listener's connections bounded, by deciding when one
/// more request may be served. A request in service is expected to need as much as the largest
/// reply that had to be kept so far, so that many requests let in at the same moment cannot exceed
/// the limit together.
///
/// `tryEnter` and `await` belong to the loop's thread; the others may be called from any thread.
class ReplyBudget : public std::enable_shared_from_this<ReplyBudget> {
  public:
    /// `loop` must outlive it.
    explicit ReplyBudget(RunLoop& loop) : loop_(loop) {}

    /// Whether a request may be served now; if so it counts as in service until `leave`. Others
    /// that were refused before come first.
    bool tryEnter();
    /// Calls `retry` once, on the loop, when it has become worth trying again.
    void await(std::function<void()> retry);
    void leave();

    /// Unsent bytes come and go. They may be reported in either order.
    void add(std::size_t bytes);
    void remove(std::size_t bytes);

  private:
    bool hasRoom() const;
    void wake(std::unique_lock<std::mutex> lock);
    void retryAwaiting();

    RunLoop& loop_;
    std::deque<std::function<void()>> awaiting_;  // loop only
    bool retrying_ = false;                       // loop only

    std::mutex mutex_;  // guards what follows
    std::int64_t held_ = 0;
    std::int64_t inService_ = 0;
    std::int64_t expected_ = kMaxUnsentPerConnection;
    bool isAwaited_ = false;
    bool retryPosted_ = false;
};

}  // namespace platform::lum
