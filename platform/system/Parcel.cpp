#include "platform/system/Parcel.h"

#include <sys/socket.h>

#include <cerrno>
#include <cstring>
#include <utility>

namespace platform {

namespace {

constexpr const char* kText = "a process of the daemon's";

union Control {
    cmsghdr alignment;
    char bytes[CMSG_SPACE(sizeof(int) * Parcel::kMostDescriptors)];
};

std::vector<UniqueFd> descriptorsOf(const msghdr& message) {
    std::vector<UniqueFd> descriptors;
    const cmsghdr* header = CMSG_FIRSTHDR(&message);
    if (!header || header->cmsg_type != SCM_RIGHTS) return descriptors;
    descriptors.resize((header->cmsg_len - CMSG_LEN(0)) / sizeof(int));
    for (std::size_t i = 0; i < descriptors.size(); ++i) {
        int fd = -1;
        std::memcpy(&fd, CMSG_DATA(header) + i * sizeof fd, sizeof fd);
        descriptors[i].reset(fd);
    }
    return descriptors;
}

}  // namespace

Result<Parcel> Parcel::receive(int socket) {
    Parcel parcel;
    parcel.bytes.resize(kMostBytes);
    iovec data{parcel.bytes.data(), parcel.bytes.size()};
    Control control{};
    msghdr message{};
    message.msg_iov = &data;
    message.msg_iovlen = 1;
    message.msg_control = &control;
    message.msg_controllen = sizeof control;
    ssize_t count = -1;
    do {
        count = ::recvmsg(socket, &message, MSG_CMSG_CLOEXEC);
    } while (count < 0 && errno == EINTR);
    if (count < 0) return Error::posix(errno, kText);
    parcel.descriptors = descriptorsOf(message);
    if (count == 0) return Error::posix(EPIPE, kText);
    // There is room for all that is ever sent: what is missing had no number to be had.
    if (message.msg_flags & MSG_CTRUNC) return Error::posix(EMFILE, kText);
    if (message.msg_flags & MSG_TRUNC) return Error::posix(EMSGSIZE, kText);
    parcel.bytes.resize(static_cast<std::size_t>(count));
    return parcel;
}

std::optional<Error> Parcel::send(int socket, std::string_view bytes,
                                  std::span<const int> descriptors) {
    if (bytes.size() > kMostBytes || descriptors.size() > kMostDescriptors)
        return Error::posix(EMSGSIZE, kText);
    iovec data{const_cast<char*>(bytes.data()), bytes.size()};
    Control control{};
    msghdr message{};
    message.msg_iov = &data;
    message.msg_iovlen = 1;
    if (!descriptors.empty()) {
        message.msg_control = &control;
        message.msg_controllen = CMSG_SPACE(descriptors.size_bytes());
        cmsghdr* header = CMSG_FIRSTHDR(&message);
        header->cmsg_level = SOL_SOCKET;
        header->cmsg_type = SCM_RIGHTS;
        header->cmsg_len = CMSG_LEN(descriptors.size_bytes());
        std::memcpy(CMSG_DATA(header), descriptors.data(), descriptors.size_bytes());
    }
    while (::sendmsg(socket, &message, MSG_NOSIGNAL) < 0)
        if (errno != EINTR) return Error::posix(errno, kText);
    return std::nullopt;
}

}  // namespace platform
