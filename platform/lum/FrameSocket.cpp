#include "platform/lum/FrameSocket.h"

#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <utility>

namespace platform::lum {

bool FrameSocket::write(SliceList& frame, std::size_t most) {
    const std::size_t left = frame.remaining() - std::min(frame.remaining(), most);
    while (frame.remaining() > left) {
        iovec vectors[64];
        msghdr message{};
        message.msg_iov = vectors;
        message.msg_iovlen = frame.gather(vectors);
        const ssize_t count = ::sendmsg(socket_.get(), &message, MSG_NOSIGNAL | MSG_DONTWAIT);
        if (count >= 0) {
            frame.consume(static_cast<std::size_t>(count));
        } else if (errno != EINTR) {
            broken_ = errno != EAGAIN && errno != ENOBUFS && errno != ENOMEM;
            return false;
        }
    }
    return true;
}

FrameSocket::Sent FrameSocket::send(SliceList frame) {
    std::lock_guard lock(mutex_);
    if (!socket_ || broken_) return {};
    const bool first = unsent_.empty();
    if (first && (write(frame, frame.size()) || broken_)) return {};
    const std::size_t size = frame.size();
    unsent_.push_back(std::move(frame));
    held_ += size;
    return {size, first};
}

FrameSocket::Flushed FrameSocket::flush() {
    constexpr std::size_t kMostAtOnce = 1u << 20;
    std::lock_guard lock(mutex_);
    if (!socket_) return {};
    std::size_t written = 0;
    std::size_t freed = 0;
    while (!unsent_.empty() && written < kMostAtOnce) {
        SliceList& next = unsent_.front();
        const std::size_t before = next.remaining();
        const bool goesOn = write(next, kMostAtOnce - written);
        written += before - next.remaining();
        if (next.remaining() == 0) {
            freed += next.size();
            unsent_.pop_front();
        }
        if (!goesOn) break;
    }
    held_ -= freed;
    if (broken_) freed += dropUnsent();
    return {written, freed, !unsent_.empty()};
}

std::size_t FrameSocket::dropUnsent() {
    unsent_.clear();
    return held_.exchange(0);
}

std::optional<std::size_t> FrameSocket::receive(char* buffer, std::size_t size) {
    for (;;) {
        const ssize_t count = ::recv(socket_.get(), buffer, size, MSG_DONTWAIT);
        if (count >= 0) return static_cast<std::size_t>(count);
        if (errno == EAGAIN) return std::nullopt;
        if (errno != EINTR) return 0;
    }
}

bool FrameSocket::polls(short events) const {
    pollfd state{socket_.get(), events, 0};
    return ::poll(&state, 1, 0) > 0 && (state.revents & events);
}

bool FrameSocket::isHungUp() const {
    return polls(POLLHUP | POLLERR | POLLNVAL);
}

bool FrameSocket::hasOutOfBandData() const {
    return polls(POLLPRI);
}

std::size_t FrameSocket::close() {
    std::lock_guard lock(mutex_);
    socket_.reset();
    return dropUnsent();
}

}  // namespace platform::lum
