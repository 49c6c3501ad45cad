#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "Zorvan/ZRDaemonClient.h"
#include "platform/Error.h"
#include "platform/Value.h"

namespace zrctl {

/// One connection to the daemon, asked one question after the other. Use from one thread.
class Session {
  public:
    /// Connects to a named service of this user.
    explicit Session(const std::string& service);

    using Question =
        std::function<void(zorvan::ZRDaemonClient&, const zorvan::ZRDaemonClient::ReplyCallback&)>;
    /// Puts a question and waits for its reply. The error is for people: what the daemon answered,
    /// or why there was no answer.
    platform::Result<platform::Message> ask(const Question& question);

    /// Unpacks a value of a reply; none when it was not packed.
    std::optional<platform::Value> unpack(const platform::Value& value) const {
        return client_->convertFromLum(value);
    }

  private:
    std::shared_ptr<zorvan::ZRDaemonClient> client_;
};

}  // namespace zrctl
