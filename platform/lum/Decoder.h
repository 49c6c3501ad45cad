#pragma once

#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>

#include "platform/lum/Origin.h"
#include "platform/threads/SerialQueue.h"

namespace platform::lum {

/// A thread for what large requests cost in time: they are decoded there, and freed. It is made
/// when it is first needed. What comes from one origin is done in order; the origins take turns, so
/// that nobody waits for all that a stranger has sent. From any thread.
class Decoder {
  public:
    using Work = std::function<void()>;

    Decoder() = default;
    Decoder(const Decoder&) = delete;
    /// As `close`.
    ~Decoder() { close(); }

    /// Once it is closed, the work is dropped.
    void async(const Origin& origin, Work work);
    /// Ends the thread, after what was submitted so far. Not on that thread.
    void close();

  private:
    void doNext();

    std::mutex mutex_;  // guards what follows
    std::map<Origin, std::deque<Work>> lines_;
    std::deque<Origin> turns_;  // of those with a line
    std::unique_ptr<SerialQueue> queue_;
    bool closed_ = false;
};

}  // namespace platform::lum
