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
    /// Connects before it returns, if the service has room for one more that waits to be let in;
    /// otherwise as soon as it has, and what is sent meanwhile waits. It does not block. Requests
    /// before it are answered with an error event.
    void resume();

    /// Sends `request` and calls `reply` once: with the reply, with the error event when the
    /// connection broke before it came or is broken already, or with an error (Refused) when the
    /// request is beyond what any service takes. Then it is not sent, and the connection goes on.
    void sendWithReply(Message request, ReplyHandler reply);

    std::string description() const;

  private:
    struct State;
    std::shared_ptr<State> state_;
};

}  // namespace platform
