#pragma once

#include <poll.h>

#include <atomic>
#include <cstddef>
#include <deque>
#include <mutex>
#include <optional>

#include "platform/system/UniqueFd.h"
#include "platform/values/SliceList.h"

namespace platform::lum {

/// A connected stream socket. Frames are sent from any thread and never block it; receiving,
/// flushing and closing belong to the one thread that watches the socket.
class FrameSocket {
  public:
    explicit FrameSocket(UniqueFd socket) : socket_(std::move(socket)) {}

    /// Borrows. -1 once closed.
    int fd() const { return socket_.get(); }

    struct Sent {
        std::size_t kept = 0;        // bytes of frames that this call has added to `held`
        bool awaitWritable = false;  // somebody has to call `flush` once the socket is writable
        bool isStarved = false;      // it may be writable and yet take nothing: call it later
    };
    /// Writes what the socket takes at once and keeps the frame while a rest of it is unsent. On a
    /// closed or broken socket the frame vanishes.
    /// A descriptor goes with the frame's first byte.
    Sent send(SliceList frame, UniqueFd descriptor = {});

    struct Flushed {
        std::size_t written = 0;     // bytes that the socket took
        std::size_t freed = 0;       // bytes of frames that are held no more
        bool awaitWritable = false;  // more is left
        bool isStarved = false;      // as above
    };
    /// Writes on, at most about a megabyte, so that a fast reader does not occupy the thread.
    Flushed flush();

    /// Bytes of frames that are not sent whole: what their memory costs.
    std::size_t held() const { return held_.load(std::memory_order_relaxed); }
    /// Whether a descriptor waits to be sent.
    bool holdsDescriptor() const;

    /// Receives into `buffer`: the number of bytes, 0 at the end of the stream (or when the peer is
    /// gone); none when there is nothing to be had now.
    std::optional<std::size_t> receive(char* buffer, std::size_t size);
    /// The same, and keeps a descriptor that came along. The bytes end before a second one.
    std::optional<std::size_t> receive(char* buffer, std::size_t size, UniqueFd& descriptor);

    /// Whether both ends are closed, or the socket cannot be used on for another reason.
    bool isHungUp() const;

    /// Whether there is something to receive, or room to send, at this moment.
    bool isReadable() const { return polls(POLLIN); }
    bool isWritable() const { return polls(POLLOUT); }

    /// Whether out-of-band data is to be had, which frames never are.
    bool hasOutOfBandData() const;

    /// Closes and drops what is unsent; answers how many bytes were held.
    std::size_t close();

  private:
    struct Outgoing {
        SliceList bytes;
        UniqueFd descriptor;  // until the first byte is sent
    };
    /// Sends `most` bytes of `frame` (or somewhat more, or all it has) and consumes them; false
    /// when the socket takes no more for now.
    bool write(Outgoing& frame, std::size_t most);
    std::size_t dropUnsent();
    bool polls(short events) const;

    mutable std::mutex mutex_;
    // Written under the mutex, so that nobody sends on a descriptor number that has been closed.
    UniqueFd socket_;
    std::deque<Outgoing> unsent_;  // guarded by mutex_
    bool broken_ = false;          // guarded by mutex_: the peer reads no more
    bool starved_ = false;  // guarded by mutex_: the system lacks what the last write would take
    std::atomic<std::size_t> held_ = 0;
};

}  // namespace platform::lum
