#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "Zorvan/ZRDaemonClient.h"
#include "platform/system/Error.h"
#include "platform/values/Value.h"

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
    /// The same in two steps, for who wants to see more of a refusal than its text.
    zorvan::ZRDaemonClient::Reply replyTo(const Question& question);
    static platform::Result<platform::Message> contentsOf(
        const zorvan::ZRDaemonClient::Reply& reply);

    /// Calls `handler`, on a thread of its own, when the daemon has gone away.
    void onEnd(std::function<void()> handler) { client_->setEndHandler(std::move(handler)); }

    /// The forms of the plug-ins that fit the rules; `flags`: ZRDiscover… in Zorvan/Keys.h.
    platform::Result<platform::Array> match(const platform::Dictionary& rules, std::uint64_t flags);

  private:
    std::shared_ptr<zorvan::ZRDaemonClient> client_;
};

}  // namespace zrctl
