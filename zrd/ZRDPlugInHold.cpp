#include "zrd/ZRDPlugInHold.h"

#include "zrd/ZRDPlugIn.h"

namespace zorvan {

ZRDPlugInHold::ZRDPlugInHold(const std::vector<std::shared_ptr<ZRDPlugIn>>& plugIns,
                             std::weak_ptr<ZRDLumClient> client, platform::Pool::Share share,
                             platform::Launcher& launcher)
    : blocked_(plugIns.begin(), plugIns.end()),
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
