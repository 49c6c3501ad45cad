#include "tools/zrctl/Session.h"

#include <future>

#include "Zorvan/Keys.h"

using platform::ConnectionError;
using platform::Error;
using zorvan::ZRDaemonClient;

namespace zrctl {

namespace {

Error whyNoAnswer(const ConnectionError& error) {
    if (error.kind == ConnectionError::Kind::Interrupted)
        return {"zrctl", 0, "zrd ended the connection: " + error.text};
    if (error.kind == ConnectionError::Kind::Refused) return {"zrctl", 0, describe(error)};
    // The text names the socket, or says what is wrong with the service's name.
    const bool noService = error.text.starts_with("no service at ");
    return {"zrctl", 0, noService ? "zrd is not running: " + error.text : error.text};
}

}  // namespace

Session::Session(const std::string& service)
    : client_(ZRDaemonClient::initWithServiceName(service.c_str())) {}

ZRDaemonClient::Reply Session::replyTo(const Question& question) {
    // Shared with the callback: the reply queue may still be leaving it when this returns.
    auto promise = std::make_shared<std::promise<ZRDaemonClient::Reply>>();
    question(*client_,
             [promise](const ZRDaemonClient::Reply& reply) { promise->set_value(reply); });
    return promise->get_future().get();
}

platform::Result<platform::Message> Session::ask(const Question& question) {
    return contentsOf(replyTo(question));
}

platform::Result<platform::Message> Session::contentsOf(const ZRDaemonClient::Reply& reply) {
    if (const auto* broken = std::get_if<ConnectionError>(&reply)) return whyNoAnswer(*broken);
    if (const auto refused = ZRDaemonClient::errorInReply(reply))
        return Error{refused->domain, refused->code, describe(*refused)};
    return std::get<platform::Message>(reply);
}

platform::Result<platform::Array> Session::match(const platform::Dictionary& rules,
                                                 std::uint64_t flags) {
    const platform::Result<platform::Message> reply = ask(
        [&](auto& client, const auto& callback) { client.matchPlugIns(rules, flags, callback); });
    if (!reply) return reply.error();
    const platform::Value* packed = reply->find(zorvan::message::kMatches);
    const auto forms = packed ? client_->convertFromLum(*packed) : std::nullopt;
    if (!forms || !forms->array()) return Error{"zrctl", 0, "zrd's reply has no list of matches"};
    return *forms->array();
}

}  // namespace zrctl
