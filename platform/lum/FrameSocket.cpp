#include "platform/lum/FrameSocket.h"

#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <utility>

namespace platform::lum {

bool FrameSocket::write(const std::string& frame, std::size_t& offset, std::size_t most) {
    const std::size_t end = std::min(frame.size() - offset, most) + offset;
    while (offset < end) {
        const ssize_t count =
            ::send(socket_.get(), frame.data() + offset, end - offset, MSG_NOSIGNAL | MSG_DONTWAIT);
        if (count >= 0) {
            offset += static_cast<std::size_t>(count);
        } else if (errno != EINTR) {
            broken_ = errno != EAGAIN && errno != ENOBUFS && errno != ENOMEM;
            return false;
        }
    }
    return true;
}

FrameSocket::Sent FrameSocket::send(std::string frame) {
    std::lock_guard lock(mutex_);
    if (!socket_ || broken_) return {};
    std::size_t offset = 0;
    const bool first = unsent_.empty();
    if (first && (write(frame, offset, frame.size()) || broken_)) return {};
    const std::size_t size = frame.size();
    unsent_.push_back({std::move(frame), offset});
    held_ += size;
    return {size, first};
}

FrameSocket::Flushed FrameSocket::flush() {
    constexpr std::size_t kMostAtOnce = 1u << 20;
    std::lock_guard lock(mutex_);
    if (!socket_) return {};
    std::size_t freed = 0;
    std::size_t most = kMostAtOnce;
    while (!unsent_.empty() && most > 0) {
        Unsent& next = unsent_.front();
        const std::size_t before = next.offset;
        const bool goesOn = write(next.frame, next.offset, most);
        most -= next.offset - before;
        if (next.offset == next.frame.size()) {
            freed += next.frame.size();
            unsent_.pop_front();
        }
        if (!goesOn) break;
    }
    held_ -= freed;
    if (broken_) freed += dropUnsent();
    return {freed, !unsent_.empty()};
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

bool FrameSocket::isHungUp() const {
    pollfd state{socket_.get(), POLLPRI, 0};
    return ::poll(&state, 1, 0) > 0 && (state.revents & (POLLHUP | POLLERR | POLLNVAL | POLLPRI));
}

std::size_t FrameSocket::close() {
    std::lock_guard lock(mutex_);
    socket_.reset();
    return dropUnsent();
}

}  // namespace platform::lum
