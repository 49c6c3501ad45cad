#pragma once

#include <string>
#include <string_view>

#include "platform/system/UniqueFd.h"
#include "platform/values/Value.h"

namespace test {

/// A client that speaks to a socket byte by byte.
class RawClient {
  public:
    /// Connects; `isConnected` tells whether that worked.
    explicit RawClient(const std::string& socketPath);

    bool isConnected() const { return bool(socket_); }
    /// Sends as much as the socket takes without waiting.
    void send(std::string_view bytes) const;
    void sendNothingMore() const;

    /// The next frame's payload; empty at the end of the stream (or after half a minute without
    /// anything).
    std::string receive() const;
    bool isClosed() const { return receive().empty(); }

    static std::string frame(std::string_view payload);
    static std::string request(const platform::Dictionary& contents);

  private:
    bool receiveAll(void* buffer, std::size_t size) const;

    platform::UniqueFd socket_;
};

}  // namespace test
