// The requests "ready" and "access".

#include <fmt/format.h>

#include <cerrno>
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

namespace {

/// Tokens that are issued, or plug-ins that are prepared, in one go, some 25 µs each; then others
/// have their turn.
constexpr std::size_t kMostAtOnce = 32;

}  // namespace

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
    prepareNext(std::make_shared<Enabling>(Enabling{.plugIns = std::move(toEnable)}));
}

void Transaction::prepareNext(const std::shared_ptr<Enabling>& enabling) {
    if (!client_->acceptWork()) return;
    auto& done = enabling->prepared;
    std::shared_ptr<ZRDPlugIn> plugIn;
    platform::Dictionary overlay;
    for (std::size_t atOnce = 0; !plugIn; ++atOnce) {
        if (done.size() == enabling->plugIns.size()) return enable(*enabling);
        if (atOnce == kMostAtOnce)
            return onServiceQueue([this, enabling] { prepareNext(enabling); })();
        const auto& next = enabling->plugIns[done.size()];
        overlay = next->overlayForClient(*client_);
        if (auto again = next->prepareAgain(overlay))
            done.push_back(*std::move(again));
        else
            plugIn = next;
    }
    const auto prepared = std::make_shared<ZRDPlugIn::Preparation>();
    platform::PlaceLooks::Look look{plugIn->path(), [plugIn, overlay, client = client_, prepared] {
                                        *prepared = plugIn->prepareForClient(*client, overlay);
                                    }};
    lookAtBundles({std::move(look)}, [=, this](const std::vector<bool>& isDone) {
        enabling->prepared.push_back(isDone[0] ? std::move(*prepared)
                                               : plugIn->couldNotPrepareFor(*client_, ETIMEDOUT));
        prepareNext(enabling);
    });
}

void Transaction::enable(const Enabling& enabling) {
    // Since they were looked at they may have been held, or gone: then none is enabled.
    for (const auto& plugIn : enabling.plugIns) {
        if (!server().isRegistered(plugIn->uuid()))
            return fail(kZRErrorInvalidRequest, "no such plugin (uuid not found)");
        if (!admitToReady(*plugIn)) return;
    }
    std::optional<ZRError> firstFailure;
    for (std::size_t i = 0; i < enabling.plugIns.size(); ++i) {
        auto failure = enabling.plugIns[i]->enableForClient(*client_, enabling.prepared[i]);
        if (failure && !firstFailure) firstFailure = std::move(failure);
    }
    if (firstFailure) return fail(kZRErrorInvalidRequest, *firstFailure);
    done();
}

void Transaction::accessPlugIns() {
    accessFrom(0, {});
}

void Transaction::accessFrom(std::size_t first, Array tokens) {
    if (!client_->acceptWork()) return;
    const auto sandbox = server().services().sandbox;
    std::shared_ptr<ZRDPlugIn> late;
    bool isPausing = false;
    const bool completed = processUuidList(
        [&](const std::shared_ptr<ZRDPlugIn>& plugIn) {
            isPausing = tokens.size() == first + kMostAtOnce;
            if (isPausing) return Walk::Stop;
            auto token =
                sandbox->issueReadExtension(plugIn->bundleDirectory(), ".", platform::Wait::Never);
            if (!token) {
                if (token.error().code == EAGAIN)
                    late = plugIn;
                else
                    failToAccess(*plugIn, token.error().code);
                return Walk::Stop;
            }
            tokens.append(*std::move(token));
            return Walk::Continue;
        },
        first);
    if (completed) {
        reply_.set(message::kExtensions, std::move(tokens));
        return done();
    }
    if (isPausing)
        return server().submitWork(
            [self = shared_from_this(), next = first + kMostAtOnce,
             tokens = std::move(tokens)]() mutable { self->accessFrom(next, std::move(tokens)); });
    if (!late) return;
    const auto token = std::make_shared<platform::Result<std::string>>(std::string());
    platform::PlaceLooks::Look look{late->path(), [sandbox, late, token] {
                                        *token = sandbox->issueReadExtension(
                                            late->bundleDirectory(), ".", platform::Wait::Allowed);
                                    }};
    lookAtBundles({std::move(look)}, [this, late, token, tokens = std::move(tokens)](
                                         const std::vector<bool>& isDone) mutable {
        if (!isDone[0]) return failToAccess(*late, ETIMEDOUT);
        if (!*token) return failToAccess(*late, token->error().code);
        tokens.append(**token);
        const std::size_t next = tokens.size();
        accessFrom(next, std::move(tokens));
    });
}

void Transaction::failToAccess(const ZRDPlugIn& plugIn, int code) {
    fail(kZRErrorInvalidRequest,
         fmt::format("cannot create extension to {}: {}", plugIn.path(), code));
}

}  // namespace zorvan
