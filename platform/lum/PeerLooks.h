#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>

#include "platform/lum/Origin.h"

namespace platform {

class RunLoop;

/// Looks, for peers, at what they can let hang: a file system need not answer, and a thread that
/// waits for it cannot be called back. Each look has a thread from a small pool, which grows while
/// threads hang; the looks of one origin have a quarter of it at the most, or fewer, and wait in
/// their own line for more.
///
/// Used on its run loop, which must outlive it. Its end waits for the looks that run.
class PeerLooks {
  public:
    /// How far a look has come.
    class Pace {
      public:
        /// Called by the look when it gets on. What it wrote before can be read by whoever sees the
        /// step.
        void step() { steps_.fetch_add(1, std::memory_order_release); }
        std::size_t steps() const { return steps_.load(std::memory_order_acquire); }

      private:
        std::atomic<std::size_t> steps_{0};
    };

    /// Runs on a thread of the pool.
    using Look = std::function<void(Pace& pace)>;
    /// Runs on the loop, once. Of a look that is not done, only what it wrote before one of `steps`
    /// may be read: it may still run.
    using Outcome = std::function<void(bool isDone, std::size_t steps)>;

    /// A look that has made no step for so long is given up, and one that has not begun.
    static constexpr std::chrono::milliseconds kPatience{2000};
    static constexpr std::size_t kMostThreads = 32;

    explicit PeerLooks(RunLoop& loop, std::chrono::milliseconds patience = kPatience,
                       std::size_t mostOfOne = kMostThreads / 4);
    PeerLooks(const PeerLooks&) = delete;
    ~PeerLooks();

    /// Has a look made. Both functions are destroyed on the loop.
    void look(const Origin& origin, Look look, Outcome outcome);

  private:
    struct State;
    std::shared_ptr<State> state_;
};

}  // namespace platform
