#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/lum/PeerLooks.h"

namespace platform {

/// Looks at places on disk that everybody may ask about, such as registered bundles, whose file
/// systems need not answer. What hangs is not charged to those who ask: each file system has one
/// thread at a time, and while one that was given up still waits, nobody else waits for that file
/// system. On the machine's own (that of "/", and those of block devices) this holds for each path:
/// there it is something beneath the path that hangs. The looks at one are made one after another,
/// and those that do not get their turn within the patience are not made; one that gets it has all
/// of the patience for itself.
///
/// Its run loop must outlive it; it goes where the loop runs, or while it does not. Its end waits
/// for the looks that run.
class PlaceLooks {
  public:
    struct Look {
        std::string path;            // canonical
        std::function<void()> work;  // runs on a thread
    };
    /// Runs on the loop, once, with the number of looks and which of them are done. What the others
    /// write may not be read: they may still run.
    using Outcome = std::function<void(const std::vector<bool>& done)>;

    explicit PlaceLooks(RunLoop& loop, std::chrono::milliseconds patience = PeerLooks::kPatience);
    PlaceLooks(const PlaceLooks&) = delete;
    ~PlaceLooks();

    /// Has looks made, and both functions destroyed on the loop. From any thread.
    void make(std::vector<Look> looks, Outcome outcome);

  private:
    struct State;
    const std::shared_ptr<State> state_;
};

}  // namespace platform
