#include "tools/zrctl/ReadyCommands.h"

#include "Zorvan/Keys.h"
#include "tools/zrctl/PlugInNames.h"

using platform::Uuid;
using platform::Value;

namespace zrctl {

Outcome runReady(const Options& options) {
    return withPlugIns(options.service, options.plugIns,
                       [](Session& session, const std::vector<Uuid>& uuids) {
                           const auto reply = session.ask([&](auto& client, const auto& callback) {
                               client.readyPlugIns(uuids, 0, callback);
                           });
                           return reply ? Outcome{} : failureWith(uuids, reply.error());
                       });
}

Outcome runAccess(const Options& options) {
    return withPlugIns(
        options.service, options.plugIns, [](Session& session, const std::vector<Uuid>& uuids) {
            const auto reply = session.ask([&](auto& client, const auto& callback) {
                client.accessPlugIns(uuids, 0, callback);
            });
            if (!reply) return failureWith(uuids, reply.error());
            const Value* tokens = reply->find(zorvan::message::kExtensions);
            if (!tokens || !tokens->array() || tokens->array()->size() != uuids.size())
                return Outcome::failure("zrd's reply has no tokens");
            Outcome outcome;
            for (const Value& token : *tokens->array())
                outcome.output +=
                    (token.string() ? token.string()->string() : std::string()) + '\n';
            return outcome;
        });
}

}  // namespace zrctl
