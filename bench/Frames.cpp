#include "bench/Frames.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstring>

#include "bench/Failure.h"

namespace bench {

namespace {

constexpr timeval kReplyDeadline{60, 0};

sockaddr_un addressOf(const std::string& socketPath) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (socketPath.size() >= sizeof address.sun_path) fail("{}: path too long", socketPath);
    std::memcpy(address.sun_path, socketPath.data(), socketPath.size());
    return address;
}

platform::UniqueFd streamSocket() {
    platform::UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!socket) failErrno("socket");
    return socket;
}

}  // namespace

std::string frameOf(std::string_view payload) {
    std::string frame;
    for (int shift = 24; shift >= 0; shift -= 8) {
        frame.push_back(static_cast<char>(payload.size() >> shift & 0xff));
    }
    return frame.append(payload);
}

std::size_t frameSize(const char* head) {
    std::size_t payload = 0;
    for (std::size_t i = 0; i < kFrameHead; ++i) {
        payload = payload << 8 | static_cast<std::uint8_t>(head[i]);
    }
    return kFrameHead + payload;
}

platform::UniqueFd listenAt(const std::string& socketPath) {
    platform::UniqueFd listener = streamSocket();
    const sockaddr_un address = addressOf(socketPath);
    ::unlink(socketPath.c_str());
    if (::bind(listener.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) < 0 ||
        ::listen(listener.get(), 64) < 0) {
        failErrno(socketPath);
    }
    return listener;
}

std::optional<platform::UniqueFd> tryConnect(const std::string& socketPath) {
    platform::UniqueFd socket = streamSocket();
    const sockaddr_un address = addressOf(socketPath);
    if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) < 0) {
        if (errno == ENOENT || errno == ECONNREFUSED) return {};
        failErrno(socketPath);
    }
    ::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &kReplyDeadline, sizeof kReplyDeadline);
    ::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &kReplyDeadline, sizeof kReplyDeadline);
    return socket;
}

platform::UniqueFd connectTo(const std::string& socketPath) {
    std::optional<platform::UniqueFd> socket = tryConnect(socketPath);
    if (!socket) fail("nobody listens at {}", socketPath);
    return std::move(*socket);
}

void sendAll(int socket, std::string_view bytes) {
    while (!bytes.empty()) {
        const ssize_t sent = ::send(socket, bytes.data(), bytes.size(), MSG_NOSIGNAL);
        if (sent < 0) failErrno("sending a frame");
        bytes.remove_prefix(static_cast<std::size_t>(sent));
    }
}

std::optional<std::string_view> tryReceive(int socket, std::vector<char>& buffer) {
    std::size_t have = 0;
    std::size_t total = 0;
    while (total == 0 || have < total) {
        const ssize_t got = ::read(socket, buffer.data() + have, buffer.size() - have);
        if (got < 0) failErrno("waiting for a frame");
        if (got == 0 && have == 0) return {};
        if (got == 0) fail("the connection ended inside a frame");
        have += static_cast<std::size_t>(got);
        if (total == 0 && have >= kFrameHead) {
            total = frameSize(buffer.data());
            if (buffer.size() < total) buffer.resize(total);
        }
    }
    if (have != total) fail("more than one frame arrived");
    return std::string_view(buffer.data(), total);
}

std::string_view receive(int socket, std::vector<char>& buffer) {
    const std::optional<std::string_view> frame = tryReceive(socket, buffer);
    if (!frame) fail("the connection was closed instead of a reply");
    return *frame;
}

}  // namespace bench
