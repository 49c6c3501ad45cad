#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>

#include "platform/tandry/FolderWatch.h"
#include "platform/threads/RunLoop.h"

namespace platform::tandry {

/// How changes on disk are followed.
struct WatchSettings {
    /// A burst of changes is over after this time without any, ...
    std::chrono::milliseconds quiet{200};
    /// ... or after this time, once everything that it touched was renamed into place in whole, ...
    std::chrono::milliseconds quietWhenWhole{5};
    /// ... or this time after its first.
    std::chrono::milliseconds longest{400};
    /// How often everything is looked at while something cannot be watched or read.
    std::chrono::milliseconds retry{30'000};
    /// How long a walk waits for a mount of somebody else's.
    std::chrono::milliseconds patience{2000};
    /// Most directories that are watched.
    std::size_t mostWatches = std::numeric_limits<std::size_t>::max();
};

/// Gathers what a folder watch reports into bursts. Made, used and destroyed on the run loop's
/// thread.
class ChangeGatherer {
  public:
    using Handler = std::function<void(const Scopes& touched)>;

    /// `watch` and `loop` must outlive this. `handler` is called with each burst.
    ChangeGatherer(RunLoop& loop, FolderWatch& watch, const WatchSettings& settings,
                   Handler handler);
    ChangeGatherer(const ChangeGatherer&) = delete;

    /// To be called after each walk. After one that was not `isComplete`, everything counts as
    /// touched once the time to try again has come.
    void walkEnded(bool isComplete);
    /// To be called when what a walk found is there for all to see. Settles the watch, unless
    /// something was touched that no walk has looked at since.
    void published();

  private:
    using Clock = std::chrono::steady_clock;

    void awaitChanges();
    void gather(const Touches& touched);
    void finishBurst();

    RunLoop& loop_;
    FolderWatch& watch_;
    const WatchSettings settings_;
    const Handler handler_;
    std::optional<RunLoop::Watch> readable_;  // none while there is no descriptor
    RunLoop::Timer burstTimer_;
    RunLoop::Timer retryTimer_;
    Scopes touched_;
    Scopes inPieces_;  // of these, what may not be there in whole
    Clock::time_point burstBegan_;
    bool willRetry_ = false;
};

}  // namespace platform::tandry
