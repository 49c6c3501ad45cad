#include "tools/zrctl/HoldCommands.h"

#include <poll.h>

#include <cerrno>

#include "Zorvan/Keys.h"
#include "Zorvan/ZRError.h"
#include "tools/zrctl/Interruption.h"
#include "tools/zrctl/RegistrationCommands.h"
#include "tools/zrctl/Session.h"

using platform::Error;
using platform::Message;
using platform::Result;
using platform::UniqueFd;
using platform::Uuid;
using platform::Value;

namespace zrctl {

namespace {

/// Who is busy, as a refusal says.
std::string conflictsIn(const zorvan::ZRDaemonClient::Reply& reply) {
    const auto* message = std::get_if<Message>(&reply);
    const Value* conflicts = message ? message->find(zorvan::message::kConflicts) : nullptr;
    std::string text;
    if (!conflicts || !conflicts->array()) return text;
    for (const Value& entry : *conflicts->array()) {
        const auto* conflict = entry.dictionary();
        const Value* who = conflict ? conflict->find(zorvan::conflict::kBundleIdentifier) : nullptr;
        if (who && who->string()) text.append(text.empty() ? ": " : ", ").append(*who->string());
    }
    return text;
}

Outcome release(Session& session, const Uuid& token) {
    const auto reply = session.ask(
        [&](auto& client, const auto& callback) { client.releaseHold(token, callback); });
    return reply ? Outcome{} : Outcome::failure(reply.error().text);
}

/// Waits for the end of the hold, and gives it back.
Outcome keep(Session& session, const Uuid& token, int stop) {
    const auto lost = Event::make();
    if (!lost) return Outcome::failure(lost.error().text);
    session.onEnd([event = *lost] { event->happen(); });
    if (Outcome written = writeOut(token.string() + '\n'); written.status != kDone) return written;
    pollfd waited[] = {{stop, POLLIN, 0}, {(*lost)->descriptor(), POLLIN, 0}};
    while (::poll(waited, 2, -1) < 0)
        if (errno != EINTR) return Outcome::failure(Error::posix(errno, "poll").text);
    if (waited[1].revents) return Outcome::failure("zrd went away, and the hold with it");
    return release(session, token);
}

}  // namespace

Outcome runHold(const Options& options) {
    const Result<UniqueFd> stop = interruption();
    if (!stop) return Outcome::failure(stop.error().text);
    const auto paths = absolutePaths(options.paths);
    if (const auto* outcome = std::get_if<Outcome>(&paths)) return *outcome;
    Session session(options.service);
    const auto reply = session.replyTo([&](auto& client, const auto& callback) {
        client.holdPlugins(std::get<std::vector<std::string>>(paths), options.flags, callback);
    });
    const Result<Message> contents = Session::contentsOf(reply);
    if (!contents) return Outcome::failure(contents.error().text + conflictsIn(reply));
    const Value* token = contents->find(zorvan::message::kUuids);
    if (!token || !token->uuid()) return Outcome::failure("zrd's reply has no token");
    return keep(session, *token->uuid(), stop->get());
}

Outcome runRelease(const Options& options) {
    std::vector<Uuid> tokens;
    for (const std::string& text : options.tokens) {
        const auto token = Uuid::parse(text);
        if (!token) return Outcome::usage(text + ": no token of a hold");
        tokens.push_back(*token);
    }
    Session session(options.service);
    for (const Uuid& token : tokens)
        if (Outcome outcome = release(session, token); outcome.status != kDone) return outcome;
    return {};
}

}  // namespace zrctl
