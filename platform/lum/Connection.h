#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <string>
#include <variant>

#include "platform/lum/AuditToken.h"
#include "platform/lum/Message.h"
#include "platform/lum/Origin.h"

namespace platform {

/// An error event of a connection.
struct ConnectionError {
    enum class Kind {
        Invalid,              // the peer is gone, or broke the protocol; nothing follows this event
        TerminationImminent,  // the peer will send nothing more but still reads replies
        Interrupted,          // on the host's side: the daemon went away
        Refused,              // likewise: no service takes this request; it was not sent
    };
    Kind kind;
    std::string text;  // for people
};

/// A well-formed item that is no message.
struct UnknownObject {
    std::string text;  // its description
};

using ConnectionEvent = std::variant<Message, ConnectionError, UnknownObject>;

std::string describe(const ConnectionError& error);
std::string describe(const UnknownObject& object);

/// The daemon's end of one connected host.
///
/// Its events are delivered on the listener's queue, in the order in which they happened, never two
/// at once; none before `resume`. A message is delivered only when the one before it is done with
/// (see `Message::setTurn`) and the limits on unsent replies (lum/Limits.h) allow it; other events
/// do not wait for that, except that they never overtake a message that was received before them,
/// unless the connection has become invalid: then messages that were still waiting are dropped.
class Connection {
  public:
    using EventHandler = std::function<void(const ConnectionEvent&)>;

    virtual ~Connection() = default;

    virtual pid_t pid() const = 0;
    virtual const AuditToken& auditToken() const = 0;
    /// Where its peer came from when it was accepted.
    virtual Origin origin() const = 0;

    /// Keeps `context` alive until the connection is destroyed, or its listener closed.
    virtual void setContext(std::shared_ptr<void> context) = 0;
    /// Set before `resume`. Released when the connection has become invalid.
    virtual void setEventHandler(EventHandler handler) = 0;
    virtual void resume() = 0;

    /// Sends a reply (made with `Message::replyTo`); never blocks. What cannot be written at once
    /// is kept and written later. The reply's descriptor, if it has one, is taken from it. On a
    /// dead connection it vanishes. A reply over its limit ends the connection. From any thread.
    virtual void send(const Message& reply) = 0;

    virtual std::string description() const = 0;
};

}  // namespace platform
