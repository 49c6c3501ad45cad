#include "tools/zrctl/Session.h"

#include <fmt/core.h>

#include <future>

#include "platform/Directories.h"
#include "platform/lum/Listener.h"

using platform::ConnectionError;
using platform::Error;
using zorvan::ZRDaemonClient;

namespace zrctl {

Session::Session(std::string service)
    : service_(std::move(service)),
      client_(ZRDaemonClient::initWithServiceName(service_.c_str())) {}

platform::Result<platform::Message> Session::ask(const Question& question) {
    // Shared with the callback: the reply queue may still be leaving it when this returns.
    auto promise = std::make_shared<std::promise<ZRDaemonClient::Reply>>();
    question(*client_,
             [promise](const ZRDaemonClient::Reply& reply) { promise->set_value(reply); });
    const ZRDaemonClient::Reply reply = promise->get_future().get();

    if (const auto* broken = std::get_if<ConnectionError>(&reply)) return whyNoAnswer(*broken);
    if (const auto refused = ZRDaemonClient::errorInReply(reply))
        return Error{refused->domain, refused->code, describe(*refused)};
    return std::get<platform::Message>(reply);
}

Error Session::whyNoAnswer(const ConnectionError& error) const {
    const auto path = platform::lum::socketPath(platform::Directories::fromEnvironment(), service_);
    if (!path) return path.error();
    if (error.kind == ConnectionError::Kind::Invalid)
        return {"zrctl", 0, fmt::format("zrd is not running: no service at {}", *path)};
    return {"zrctl", 0, fmt::format("zrd ended the connection at {}: {}", *path, error.text)};
}

}  // namespace zrctl
