#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/lum/Connection.h"
#include "platform/lum/Message.h"
#include "platform/system/Error.h"

namespace platform::spawnerd {

/// What a host asks of the launcher, and where the reply goes. It holds its connection's turn as
/// long as it, or a copy, is kept.
class SpawnRequest {
  public:
    SpawnRequest(std::weak_ptr<Connection> connection, Message message)
        : connection_(std::move(connection)), message_(std::move(message)) {}

    /// The text under a key, or null.
    const Text* text(const char* key) const;
    /// The arguments of a "start"; none of them when the key is absent.
    Result<std::vector<std::string>> arguments() const;
    /// The number of the instance that it is about, if it has one.
    std::optional<std::uint64_t> instance() const;

    /// The same to be answered later, while the connection goes on: without contents and turn.
    SpawnRequest withoutTurn() const;
    /// Whether nobody is there any more to be answered.
    bool isAbandoned() const { return connection_.expired(); }

    /// An empty reply, to be filled.
    Message emptyReply() const { return Message::replyTo(message_); }
    void reply(const Message& message) const;
    void replyStatus(int status) const;
    void refuse(const Error& error) const;

  private:
    std::weak_ptr<Connection> connection_;
    Message message_;
};

}  // namespace platform::spawnerd
