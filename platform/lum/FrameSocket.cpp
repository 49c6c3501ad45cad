#include "platform/lum/FrameSocket.h"

#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

namespace platform::lum {

namespace {

/// The socket is not what it wants for: memory, or a place among the descriptors that the user may
/// have on their way, which another process may have used up. No event tells of its end.
bool isStarvation(int error) {
    return error == ENOBUFS || error == ENOMEM || error == ETOOMANYREFS;
}

/// Room for the one descriptor that a message carries.
struct DescriptorBuffer {
    alignas(cmsghdr) char bytes[CMSG_SPACE(sizeof(int))] = {};

    void attachTo(msghdr& message) {
        message.msg_control = bytes;
        message.msg_controllen = sizeof bytes;
    }
};

void addDescriptor(msghdr& message, int descriptor) {
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof descriptor);
    std::memcpy(CMSG_DATA(header), &descriptor, sizeof descriptor);
}

UniqueFd descriptorIn(msghdr& message) {
    const cmsghdr* header = CMSG_FIRSTHDR(&message);
    if (!header || header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS) return {};
    int descriptor = -1;
    std::memcpy(&descriptor, CMSG_DATA(header), sizeof descriptor);
    return UniqueFd(descriptor);
}

}  // namespace

bool FrameSocket::write(Outgoing& frame, std::size_t most) {
    SliceList& bytes = frame.bytes;
    const std::size_t left = bytes.remaining() - std::min(bytes.remaining(), most);
    starved_ = false;
    while (bytes.remaining() > left) {
        iovec vectors[64];
        msghdr message{};
        message.msg_iov = vectors;
        message.msg_iovlen = bytes.gather(vectors);
        DescriptorBuffer control;
        if (frame.descriptor) {
            control.attachTo(message);
            addDescriptor(message, frame.descriptor.get());
        }
        const ssize_t count = ::sendmsg(socket_.get(), &message, MSG_NOSIGNAL | MSG_DONTWAIT);
        if (count >= 0) {
            bytes.consume(static_cast<std::size_t>(count));
            frame.descriptor.reset();
        } else if (errno != EINTR) {
            starved_ = isStarvation(errno);
            broken_ = errno != EAGAIN && !starved_;
            return false;
        }
    }
    return true;
}

FrameSocket::Sent FrameSocket::send(SliceList bytes, UniqueFd descriptor) {
    Outgoing frame{std::move(bytes), std::move(descriptor)};
    std::lock_guard lock(mutex_);
    if (!socket_ || broken_) return {};
    const bool first = unsent_.empty();
    if (first && (write(frame, frame.bytes.size()) || broken_)) return {};
    const std::size_t size = frame.bytes.size();
    unsent_.push_back(std::move(frame));
    held_ += size;
    return {size, first, first && starved_};
}

FrameSocket::Flushed FrameSocket::flush() {
    constexpr std::size_t kMostAtOnce = 1u << 20;
    std::lock_guard lock(mutex_);
    if (!socket_) return {};
    std::size_t written = 0;
    std::size_t freed = 0;
    while (!unsent_.empty() && written < kMostAtOnce) {
        Outgoing& next = unsent_.front();
        const std::size_t before = next.bytes.remaining();
        const bool goesOn = write(next, kMostAtOnce - written);
        written += before - next.bytes.remaining();
        if (next.bytes.remaining() == 0) {
            freed += next.bytes.size();
            unsent_.pop_front();
        }
        if (!goesOn) break;
    }
    held_ -= freed;
    if (broken_) freed += dropUnsent();
    return {written, freed, !unsent_.empty(), !unsent_.empty() && starved_};
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

std::optional<std::size_t> FrameSocket::receive(char* buffer, std::size_t size,
                                                UniqueFd& descriptor) {
    for (;;) {
        iovec vector{buffer, size};
        msghdr message{};
        message.msg_iov = &vector;
        message.msg_iovlen = 1;
        DescriptorBuffer control;
        control.attachTo(message);
        const ssize_t count = ::recvmsg(socket_.get(), &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
        if (count >= 0) {
            descriptor = descriptorIn(message);
            return static_cast<std::size_t>(count);
        }
        if (errno == EAGAIN) return std::nullopt;
        if (errno != EINTR) return 0;
    }
}

bool FrameSocket::holdsDescriptor() const {
    std::lock_guard lock(mutex_);
    return std::ranges::any_of(unsent_,
                               [](const Outgoing& frame) { return bool(frame.descriptor); });
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
