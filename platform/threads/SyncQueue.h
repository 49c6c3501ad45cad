#pragma once

#include <atomic>
#include <mutex>
#include <string>
#include <thread>

#include "platform/threads/ProgrammingError.h"

namespace platform {

/// A lock that knows its owner: `sync` runs work on the calling thread, one at a time. Entering it
/// again from inside stops the process: a programming error.
class SyncQueue {
  public:
    explicit SyncQueue(std::string label) : label_(std::move(label)) {}
    SyncQueue(const SyncQueue&) = delete;

    /// Runs `work`, alone, before it returns, and answers what the work answers.
    template <class Work>
    decltype(auto) sync(Work&& work, CodePlace place = CodePlace::here()) {
        Entry entry(*this, place);
        return std::forward<Work>(work)();
    }

    /// Stops the process when the caller is not inside `sync` of this queue.
    void assertCurrent(CodePlace place = CodePlace::here()) const;

    const std::string& label() const { return label_; }

  private:
    class Entry {
      public:
        Entry(SyncQueue& queue, CodePlace place);
        ~Entry();

      private:
        SyncQueue& queue_;
    };

    std::string label_;
    std::mutex mutex_;
    std::atomic<std::thread::id> owner_{};
};

}  // namespace platform
