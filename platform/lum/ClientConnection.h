#pragma once

#include <functional>
#include <memory>
#include <string>
#include <variant>

#include "platform/lum/Connection.h"
#include "platform/lum/Message.h"
#include "platform/threads/SerialQueue.h"

namespace platform {

struct Directories;

/// A host's end of a connection to a named service. It connects once, when resumed, and never again
/// by itself. Operations may be called from any thread; callbacks run on the queue given.
class ClientConnection {
  public:
    using EventHandler = std::function<void(const ConnectionError&)>;
    using Reply = std::variant<Message, ConnectionError>;
    using ReplyHandler = std::function<void(const Reply&)>;

    /// `queue` must outlive the connection.
    ClientConnection(const Directories& directories, const std::string& serviceName,
                     SerialQueue& queue);
    ClientConnection(const ClientConnection&) = delete;
    /// Closes. Replies that have not arrived are not reported any more. Not from inside a callback,
    /// unless nothing else uses the connection.
    ~ClientConnection();

    /// Called for the connection's error events: no service at the name (Invalid), the daemon went
    /// away (Interrupted). Set before `resume`.
    void setEventHandler(EventHandler handler);
    /// Connects before it returns; requests before it are answered with an error event.
    void resume();

    /// Sends `request` and calls `reply` once: with the reply, or with the error event when the
    /// connection broke before it came, is broken already, or the request is over its limit.
    void sendWithReply(Message request, ReplyHandler reply);

    std::string description() const;

  private:
    struct State;
    std::shared_ptr<State> state_;
};

}  // namespace platform
