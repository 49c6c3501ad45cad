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

void Transaction::processPaths(const RegistryChange& change, std::size_t from) {
    const platform::Array* paths = requestedPaths();
    if (!paths) return;
    if (from == paths->size()) return done();
    const auto path = namedPath(*paths, from);
    if (!path || (this->*change.prepare)(*path) == Walk::Stop) return;
    server().submitRegistration(
        [self = shared_from_this(), path = path->path, change, from]() mutable {
            const bool isRefused = (self.get()->*change.make)(path).has_value();
            ZRDServer& server = self->server();
            // Handed on, so that nothing of the request goes on this thread.
            server.submitWork([self = std::move(self), path, change, from, isRefused] {
                if (isRefused) return (self.get()->*change.refuse)(path);
                self->processPaths(change, from + 1);
            });
        });
}

void Transaction::addPlugIns() {
    processPaths({&Transaction::prepareAdding, &Transaction::add, &Transaction::refuseAdding});
}

Transaction::Walk Transaction::prepareAdding(const NamedPath& path) {
    if (!path.resolved) {
        fail(kZRErrorPath, fmt::format("invalid plugin path: {}", path.path));
        return Walk::Stop;
    }
    probes::pluginAdd(path.path.c_str());
    return Walk::Continue;
}

std::optional<ZRError> Transaction::add(const std::string& path) {
    return server().addPlugIn(path, requesterOf(*client_));
}

void Transaction::refuseAdding(const std::string& path) {
    EVLOG_DEFAULT(ops(), "failed to register plug-in at {}", path);
    fail(kZRErrorRegistration, fmt::format("unable to register plug-in at {}", path));
}

void Transaction::removePlugIns() {
    processPaths(
        {&Transaction::prepareRemoving, &Transaction::remove, &Transaction::refuseRemoving});
}

Transaction::Walk Transaction::prepareRemoving(const NamedPath& path) {
    probes::pluginRemove(path.path.c_str(), path.resolved);
    if (client_->hasEntitlement(entitlement::kManager)) return Walk::Continue;
    EVLOG_DEFAULT(platform::Log::defaultHandle(),
                  "refused request from pid={} to remove plug-in at {} - client lacks "
                  "required entitlement",
                  client_->pid(), pub(path.path));
    fail(kZRErrorDenied, "caller lacks entitlement for this operation");
    return Walk::Stop;
}

std::optional<ZRError> Transaction::remove(const std::string& path) {
    return server().removePlugIn(path, requesterOf(*client_));
}

void Transaction::refuseRemoving(const std::string& path) {
    fail(kZRErrorPath, fmt::format("no plugin at {}", path));
}

void Transaction::bulkPlugIns() {
    auto flags = static_cast<std::uint32_t>(unsignedUnder(message::kFlags));
    EVLOG_INFO(ops(), "bulk options {:#x} not supported", flags);
    done();
}

}  // namespace zorvan
