#include "platform/tandry/ChangeGatherer.h"

#include <algorithm>
#include <utility>

namespace platform::tandry {

namespace {

/// With more of them than this, one walk over everything is as good, and needs no more memory.
constexpr std::size_t kMostScopes = 8192;

}  // namespace

ChangeGatherer::ChangeGatherer(RunLoop& loop, FolderWatch& watch, const WatchSettings& settings,
                               Handler handler)
    : loop_(loop),
      watch_(watch),
      settings_(settings),
      handler_(std::move(handler)),
      burstTimer_(loop),
      retryTimer_(loop) {}

void ChangeGatherer::walkEnded(bool isComplete) {
    if (!readable_ && watch_.descriptor() >= 0) {
        readable_.emplace(loop_, watch_.descriptor());
        awaitChanges();
    }
    if (isComplete || std::exchange(willRetry_, true)) return;
    retryTimer_.start(settings_.retry, [this] {
        willRetry_ = false;
        touched_.emplace();
        finishBurst();
    });
}

void ChangeGatherer::published() {
    if (touched_.empty() && !willRetry_) watch_.settle();
}

void ChangeGatherer::awaitChanges() {
    readable_->awaitReadable([this] {
        gather(watch_.takeTouched());
        awaitChanges();
    });
}

void ChangeGatherer::gather(const Touches& touched) {
    // Nothing that matters: what was published still holds.
    if (touched.empty()) return published();
    const Clock::time_point now = Clock::now();
    if (touched_.empty()) burstBegan_ = now;
    for (const auto& [scope, isWhole] : touched) {
        touched_.insert(scope);
        if (isWhole)
            inPieces_.erase(scope);
        else
            inPieces_.insert(scope);
    }
    if (touched_.size() > kMostScopes) touched_ = inPieces_ = {std::string()};
    const auto rest = burstBegan_ + settings_.longest - now;
    const auto delay =
        std::clamp(std::chrono::ceil<std::chrono::milliseconds>(rest), std::chrono::milliseconds(0),
                   inPieces_.empty() ? settings_.quietWhenWhole : settings_.quiet);
    burstTimer_.start(delay, [this] { finishBurst(); });
}

void ChangeGatherer::finishBurst() {
    burstTimer_.cancel();
    inPieces_.clear();
    handler_(std::exchange(touched_, {}));
}

}  // namespace platform::tandry
