// The requests "ready" and "access".

#include <fmt/format.h>

#include <unordered_set>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/sandbox/Sandbox.h"
#include "zrd/Probes.h"
#include "zrd/Transaction.h"
#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDPlugIn.h"
#include "zrd/ZRDServer.h"

namespace zorvan {

using platform::Array;

const HostRestriction& Transaction::hostRestriction() {
    if (!hostRestriction_) hostRestriction_.emplace(*client_, server().services().types);
    return *hostRestriction_;
}

bool Transaction::admitToReady(const ZRDPlugIn& plugIn) {
    std::optional<std::string> reason;
    if (server().holdOnPlugIn(plugIn)) {
        EVLOG_DEFAULT(ops(), "denied access to {} for plugin {}({}): the plug-in is on hold",
                      client_->pid(), plugIn.identifier(), pub(plugIn.uuid()));
        reason = "the plug-in is on hold";
    } else if (!plugIn.isData() && (reason = plugIn.allowForClient(*client_, hostRestriction()))) {
        EVLOG_DEFAULT(ops(), "denied access to {} for plugin {}({}): {}", client_->pid(),
                      plugIn.identifier(), pub(plugIn.uuid()), pub(*reason));
    }
    if (!reason) return true;
    fail(kZRErrorDenied,
         fmt::format("access to plugin {} denied: {}", plugIn.identifier(), *reason));
    return false;
}

void Transaction::readyPlugIns() {
    ZRDPlugInList toEnable;
    std::unordered_set<platform::Uuid> listed;
    bool completed = processUuidList([&](const std::shared_ptr<ZRDPlugIn>& plugIn) {
        probes::pluginReady(plugIn->uuid().string().c_str());
        if (!admitToReady(*plugIn)) return Walk::Stop;
        if (!plugIn->isData() && listed.insert(plugIn->uuid()).second) toEnable.push_back(plugIn);
        return Walk::Continue;
    });
    if (!completed) return;
    std::optional<ZRError> firstFailure;
    for (const auto& plugIn : toEnable) {
        auto failure = plugIn->enableForClient(*client_);
        if (failure && !firstFailure) firstFailure = std::move(failure);
    }
    if (firstFailure) return fail(kZRErrorInvalidRequest, *firstFailure);
    done();
}

void Transaction::accessPlugIns() {
    Array tokens;
    bool completed = processUuidList([&](const std::shared_ptr<ZRDPlugIn>& plugIn) {
        auto token =
            server().services().sandbox->issueReadExtension(plugIn->bundleDirectory(), ".");
        if (!token) {
            fail(kZRErrorInvalidRequest, fmt::format("cannot create extension to {}: {}",
                                                     plugIn->path(), token.error().code));
            return Walk::Stop;
        }
        tokens.append(*std::move(token));
        return Walk::Continue;
    });
    if (!completed) return;
    reply_.set(message::kExtensions, std::move(tokens));
    done();
}

}  // namespace zorvan
