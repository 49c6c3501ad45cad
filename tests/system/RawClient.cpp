#include "tests/system/RawClient.h"

#include <arpa/inet.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

#include "platform/lum/Frame.h"
#include "platform/lum/Limits.h"

namespace test {

RawClient::RawClient(const std::string& socketPath)
    : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
    const timeval patience{.tv_sec = 30, .tv_usec = 0};
    ::setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    if (::connect(socket_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
        socket_.reset();
}

void RawClient::send(std::string_view bytes) const {
    ::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
}

void RawClient::sendNothingMore() const {
    ::shutdown(socket_.get(), SHUT_WR);
}

/// Whether all of it has come. Because of the limit of time, a stop of this process (by whoever
/// wants the machine for himself for a while) ends a receive early.
bool RawClient::receiveAll(void* buffer, std::size_t size) const {
    for (auto* place = static_cast<char*>(buffer); size > 0;) {
        const ssize_t count = ::recv(socket_.get(), place, size, MSG_WAITALL);
        if (count < 0 && errno == EINTR) continue;
        if (count <= 0) return false;
        place += count;
        size -= static_cast<std::size_t>(count);
    }
    return true;
}

std::string RawClient::receive() const {
    std::uint32_t size = 0;
    if (!receiveAll(&size, sizeof size)) return {};
    std::string payload(ntohl(size), '\0');
    return receiveAll(payload.data(), payload.size()) ? payload : std::string();
}

std::string RawClient::frame(std::string_view payload) {
    const std::uint32_t size = htonl(static_cast<std::uint32_t>(payload.size()));
    std::string bytes(reinterpret_cast<const char*>(&size), sizeof size);
    return bytes.append(payload);
}

std::string RawClient::request(const platform::Dictionary& contents) {
    platform::Message message(contents);
    message.setSerial(1);
    return platform::lum::encodeFrame(platform::lum::FrameKind::Request, message,
                                      platform::lum::kMaxRequestPayload)
        ->string();
}

}  // namespace test
