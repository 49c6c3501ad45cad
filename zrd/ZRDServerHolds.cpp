// The holds: who keeps which plug-ins out of service.

#include "Zorvan/LogHandles.h"
#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDPlugIn.h"
#include "zrd/ZRDServer.h"

namespace zorvan {

bool ZRDServer::holdOnPlugIn(const ZRDPlugIn& plugIn) {
    // Asked of every candidate; mostly there are none.
    return areHolds_ && syncQueue_.sync([&] { return holds_.has(plugIn); });
}

std::vector<std::shared_ptr<ZRDPlugInHold>> ZRDServer::holds() {
    return syncQueue_.sync([&] { return holds_.all(); });
}

void ZRDServer::addHold(const std::shared_ptr<ZRDPlugInHold>& hold) {
    syncQueue_.sync([&] {
        holds_.add(hold);
        areHolds_ = true;
    });
    // Once the hold is there, "ready" refuses; what it granted before must not outlast that.
    for (const auto& plugIn : hold->blocked())
        services().launcher->removeExternalServices(plugIn->path());
    notifyAnnotationChange();
}

void ZRDServer::unholdToken(const platform::Uuid& token) {
    syncQueue_.sync([&] {
        if (!holds_.take(token)) return;
        areHolds_ = !holds_.empty();
        EVLOG_DEBUG(ops(), "releasing plug-in hold {} at client's request", pub(token));
        notifyAnnotationChange();
    });
}

void ZRDServer::unholdClient(const ZRDLumClient& client) {
    syncQueue_.sync([&] {
        while (const auto hold = holds_.takeOldestOf(client)) {
            areHolds_ = !holds_.empty();
            EVLOG_DEBUG(ops(), "releasing plug-in hold {} for dead client pid {}",
                        pub(hold->uuid()), client.pid());
            notifyAnnotationChange();
        }
    });
}

}  // namespace zorvan
