// The holds: who keeps which plug-ins out of service.

#include <algorithm>

#include "Zorvan/LogHandles.h"
#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDPlugIn.h"
#include "zrd/ZRDServer.h"

namespace zorvan {

bool ZRDServer::holdOnPlugIn(const ZRDPlugIn& plugIn) {
    return syncQueue_.sync([&] { return heldPlugIns_.contains(plugIn.uuid()); });
}

std::vector<std::shared_ptr<ZRDPlugInHold>> ZRDServer::holds() {
    return syncQueue_.sync([&] { return holds_; });
}

void ZRDServer::addHold(const std::shared_ptr<ZRDPlugInHold>& hold) {
    syncQueue_.sync([&] {
        for (const auto& plugIn : hold->blocked()) ++heldPlugIns_[plugIn->uuid()];
        holds_.push_back(hold);
    });
    // Once the hold is there, "ready" refuses; what it granted before must not outlast that.
    for (const auto& plugIn : hold->blocked())
        services().launcher->removeExternalServices(plugIn->path());
    notifyAnnotationChange();
}

/// Takes a hold out of the list and answers its successor.
ZRDServer::HoldList::iterator ZRDServer::releaseHold(HoldList::iterator hold) {
    syncQueue_.assertCurrent();
    for (const auto& plugIn : (*hold)->blocked()) {
        auto count = heldPlugIns_.find(plugIn->uuid());
        if (--count->second == 0) heldPlugIns_.erase(count);
    }
    auto next = holds_.erase(hold);
    notifyAnnotationChange();
    return next;
}

void ZRDServer::unholdToken(const platform::Uuid& token) {
    syncQueue_.sync([&] {
        auto hold = std::ranges::find(holds_, token, &ZRDPlugInHold::uuid);
        if (hold == holds_.end()) return;
        EVLOG_DEBUG(ops(), "releasing plug-in hold {} at client's request", pub(token));
        releaseHold(hold);
    });
}

void ZRDServer::unholdClient(const ZRDLumClient& client) {
    syncQueue_.sync([&] {
        for (auto hold = holds_.begin(); hold != holds_.end();) {
            if ((*hold)->client().get() != &client) {
                ++hold;
                continue;
            }
            EVLOG_DEBUG(ops(), "releasing plug-in hold {} for dead client pid {}",
                        pub((*hold)->uuid()), client.pid());
            hold = releaseHold(hold);
        }
    });
}

}  // namespace zorvan
