#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/system/UniqueFd.h"

namespace bench {

/// The wire as bare as it can be: blocking sockets and frames (a length of 4 bytes, big-endian,
/// then the payload) that are neither made nor looked into. The daemon and the echo servers are
/// talked to with these same functions.

inline constexpr std::size_t kFrameHead = 4;

/// `payload` with its length before it.
std::string frameOf(std::string_view payload);
/// The size of the whole frame that begins with these bytes (at least `kFrameHead` of them).
std::size_t frameSize(const char* head);

/// Listens at a path; what an earlier listener left there is replaced.
platform::UniqueFd listenAt(const std::string& socketPath);
/// Connects; none when nobody listens there. A reader of the connection waits a minute at most.
std::optional<platform::UniqueFd> tryConnect(const std::string& socketPath);
/// The same for a socket that must be there.
platform::UniqueFd connectTo(const std::string& socketPath);

void sendAll(int socket, std::string_view bytes);
/// Reads one frame to its last byte into `buffer`, which grows as needed, and answers the whole
/// frame, good until `buffer` is used again. None when the peer closed before the first byte. The
/// peer must send nothing after the frame before it is asked to.
std::optional<std::string_view> tryReceive(int socket, std::vector<char>& buffer);
/// The same for a frame that must come.
std::string_view receive(int socket, std::vector<char>& buffer);

/// One connection and the buffer of its replies.
class FrameClient {
  public:
    explicit FrameClient(const std::string& socketPath) : socket_(connectTo(socketPath)) {}
    explicit FrameClient(platform::UniqueFd socket) : socket_(std::move(socket)) {}

    int socket() const { return socket_.get(); }
    /// Sends a request and reads the reply to its last byte; both are whole frames.
    std::string_view exchange(std::string_view request) {
        sendAll(socket_.get(), request);
        return receive(socket_.get(), buffer_);
    }

  private:
    platform::UniqueFd socket_;
    std::vector<char> buffer_ = std::vector<char>(64u << 10);
};

}  // namespace bench
