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
    enableNext(std::make_shared<Enabling>(Enabling{.plugIns = std::move(toEnable)}));
}

void Transaction::enableNext(const std::shared_ptr<Enabling>& enabling) {
    if (enabling->next == enabling->plugIns.size()) {
        if (enabling->firstFailure) return fail(kZRErrorInvalidRequest, *enabling->firstFailure);
        return done();
    }
    const auto& plugIn = enabling->plugIns[enabling->next++];
    const auto prepared = std::make_shared<ZRDPlugIn::Preparation>();
    platform::PlaceLooks::Look look{plugIn->path(), [plugIn, client = client_, prepared] {
                                        *prepared = plugIn->prepareForClient(*client);
                                    }};
    lookAtBundles({std::move(look)}, [=, this](const std::vector<bool>& isDone) {
        // Since it was looked at it may have been held, or gone.
        if (!server().findPlugIn(plugIn->uuid()))
            return fail(kZRErrorInvalidRequest, "no such plugin (uuid not found)");
        if (!admitToReady(*plugIn)) return;
        const ZRDPlugIn::Preparation tooLate{.service = nullptr, .failure = ETIMEDOUT};
        auto failure = plugIn->enableForClient(*client_, isDone[0] ? *prepared : tooLate);
        if (failure && !enabling->firstFailure) enabling->firstFailure = std::move(failure);
        enableNext(enabling);
    });
}

namespace {

/// Read access to a bundle that is asked for.
struct Access {
    std::shared_ptr<ZRDPlugIn> plugIn;
    platform::Result<std::string> token;
};

}  // namespace

void Transaction::accessPlugIns() {
    const auto sandbox = server().services().sandbox;
    const auto accesses = std::make_shared<std::vector<Access>>();
    const auto failAt = [this](const ZRDPlugIn& plugIn, int code) {
        fail(kZRErrorInvalidRequest,
             fmt::format("cannot create extension to {}: {}", plugIn.path(), code));
    };
    std::vector<std::size_t> late;
    bool completed = processUuidList([&](const std::shared_ptr<ZRDPlugIn>& plugIn) {
        auto token =
            sandbox->issueReadExtension(plugIn->bundleDirectory(), ".", platform::Wait::Never);
        const bool isLate = !token && token.error().code == EAGAIN;
        if (!token && !isLate) {
            failAt(*plugIn, token.error().code);
            return Walk::Stop;
        }
        if (isLate) late.push_back(accesses->size());
        accesses->push_back({plugIn, std::move(token)});
        return Walk::Continue;
    });
    if (!completed) return;
    std::vector<platform::PlaceLooks::Look> looks;
    looks.reserve(late.size());
    for (const std::size_t index : late)
        looks.push_back({(*accesses)[index].plugIn->path(), [sandbox, accesses, index] {
                             Access& access = (*accesses)[index];
                             access.token = sandbox->issueReadExtension(
                                 access.plugIn->bundleDirectory(), ".", platform::Wait::Allowed);
                         }});
    lookAtBundles(std::move(looks), [=, this](const std::vector<bool>& done) {
        for (std::size_t i = 0; i < done.size(); ++i) {
            const Access& access = (*accesses)[late[i]];
            if (!done[i]) return failAt(*access.plugIn, ETIMEDOUT);
            if (!access.token) return failAt(*access.plugIn, access.token.error().code);
        }
        Array tokens;
        for (Access& access : *accesses) tokens.append(*std::move(access.token));
        reply_.set(message::kExtensions, std::move(tokens));
        this->done();
    });
}

}  // namespace zorvan
