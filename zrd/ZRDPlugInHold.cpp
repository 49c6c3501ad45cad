#include "zrd/ZRDPlugInHold.h"

#include "zrd/ZRDPlugIn.h"

namespace zorvan {

ZRDPlugInHold::ZRDPlugInHold(HoldSubject subject, std::weak_ptr<ZRDLumClient> client,
                             platform::Pool::Share share, platform::Launcher& launcher)
    : blocked_(subject.plugIns.begin(), subject.plugIns.end()),
      applications_(std::move(subject.applications)),
      client_(std::move(client)),
      share_(std::move(share)),
      workMarker_(launcher.beginOutstandingWork()) {}

std::size_t PlugInIdentity::operator()(const std::shared_ptr<ZRDPlugIn>& plugIn) const {
    return plugIn->hash();
}

bool PlugInIdentity::operator()(const std::shared_ptr<ZRDPlugIn>& a,
                                const std::shared_ptr<ZRDPlugIn>& b) const {
    return *a == *b;
}

}  // namespace zorvan
