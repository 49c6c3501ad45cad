#include "tools/zrctl/RunCommand.h"

#include "Zorvan/ZRPlugInCore.h"
#include "Zorvan/ZRPlugInProcess.h"
#include "tools/zrctl/Interruption.h"
#include "tools/zrctl/PlugInNames.h"
#include "tools/zrctl/Relay.h"

using platform::Dictionary;
using platform::Result;
using platform::UniqueFd;
using platform::Uuid;
using zorvan::ZRPlugInProcess;

namespace zrctl {

namespace {

Outcome serve(ZRPlugInProcess& process, int stop) {
    const auto ended = Event::make();
    if (!ended) return Outcome::failure(ended.error().text);
    process.setEndHandler([event = *ended](std::optional<int>) { event->happen(); });
    Relay relay(process.takeConnection());
    const Result<bool> hasEnded = relay.run((*ended)->descriptor(), stop);
    if (!hasEnded) return Outcome::failure(hasEnded.error().text);
    if (!*hasEnded) process.terminate();
    const std::optional<int> status = process.wait();
    if (!status) return Outcome::failure("zrd went away, and the plug-in with it");
    return {*status, {}, {}};
}

}  // namespace

Outcome runPlugIn(const Options& options) {
    const Result<UniqueFd> stop = interruption();
    if (!stop) return Outcome::failure(stop.error().text);
    return withPlugIns(
        options.service, options.plugIns,
        [&](Session& session, const std::vector<Uuid>& uuids) -> Outcome {
            const auto forms = formsOf(session, uuids);
            if (const auto* outcome = std::get_if<Outcome>(&forms)) return *outcome;
            const auto reply = session.ask([&](auto& client, const auto& callback) {
                client.readyPlugIns(uuids, 0, callback);
            });
            if (!reply) return failureWith(uuids, reply.error());
            const auto plugIn =
                zorvan::ZRPlugInCore::initWithForm(std::get<std::vector<Dictionary>>(forms)[0]);
            if (!plugIn) return Outcome::failure("zrd's reply has a form that is none");
            std::optional<zorvan::ZRError> error;
            const auto process =
                ZRPlugInProcess::start(options.service.c_str(), *plugIn, options.arguments, error);
            return process ? serve(*process, stop->get()) : Outcome::failure(describe(*error));
        });
}

}  // namespace zrctl
