#pragma once

#include <condition_variable>
#include <memory>
#include <mutex>

#include "platform/tandry/Snapshot.h"

namespace platform::tandry {

/// The snapshot that lookups use at the moment. Usable from any thread; its lock is held for the
/// copying of one pointer only.
class CurrentSnapshot {
  public:
    CurrentSnapshot() = default;
    CurrentSnapshot(const CurrentSnapshot&) = delete;

    void publish(std::shared_ptr<const Snapshot> snapshot);
    /// The latest snapshot; waits for the first. Null once closed.
    std::shared_ptr<const Snapshot> get();
    /// Ends all waiting, and returns when nobody is inside `get` any more.
    void close();

  private:
    std::mutex mutex_;  // guards all below
    std::condition_variable changed_;
    std::shared_ptr<const Snapshot> snapshot_;
    int waiting_ = 0;
    bool closed_ = false;
};

}  // namespace platform::tandry
