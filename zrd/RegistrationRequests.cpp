// The requests "add", "remove" and "bulk".

#include <fmt/format.h>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "zrd/Probes.h"
#include "zrd/Transaction.h"
#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDServer.h"

namespace zorvan {

namespace {

platform::Requester requesterOf(const ZRDLumClient& client) {
    return client.isConfined() ? platform::Requester::Confined : platform::Requester::Unconfined;
}

}  // namespace

void Transaction::addPlugIns() {
    processPaths([this](const std::string& path, bool resolved) {
        if (!resolved) {
            fail(kZRErrorPath, fmt::format("invalid plugin path: {}", path));
            return Walk::Stop;
        }
        probes::pluginAdd(path.c_str());
        if (server().addPlugIn(path, requesterOf(*client_))) {
            EVLOG_DEFAULT(ops(), "failed to register plug-in at {}", path);
            fail(kZRErrorRegistration, fmt::format("unable to register plug-in at {}", path));
            return Walk::Stop;
        }
        return Walk::Continue;
    });
}

void Transaction::removePlugIns() {
    processPaths([this](const std::string& path, bool resolved) {
        probes::pluginRemove(path.c_str(), resolved);
        if (!client_->hasEntitlement(entitlement::kManager)) {
            EVLOG_DEFAULT(platform::Log::defaultHandle(),
                          "refused request from pid={} to remove plug-in at {} - client lacks "
                          "required entitlement",
                          client_->pid(), pub(path));
            fail(kZRErrorDenied, "caller lacks entitlement for this operation");
            return Walk::Stop;
        }
        if (server().removePlugIn(path, requesterOf(*client_))) {
            fail(kZRErrorPath, fmt::format("no plugin at {}", path));
            return Walk::Stop;
        }
        return Walk::Continue;
    });
}

void Transaction::bulkPlugIns() {
    auto flags = static_cast<std::uint32_t>(unsignedUnder(message::kFlags));
    EVLOG_INFO(ops(), "bulk options {:#x} not supported", flags);
    done();
}

}  // namespace zorvan
