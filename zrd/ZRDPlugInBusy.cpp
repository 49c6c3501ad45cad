// Whether a plug-in is at work.

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/services/Assertions.h"
#include "zrd/PlugInContext.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

std::optional<Dictionary> ZRDPlugIn::checkBusy() const {
    const Value* bundle = infoKey(key::kBundleIdentifier);
    if (!bundle || !bundle->string()) return std::nullopt;
    for (const Dictionary& report : context_->assertions->busyInstancesForBundleIdentifiers(
             {bundle->string()->string()}, path())) {
        const Value* reported = report.find(platform::kAssertionBundleIdentifier);
        if (reported && reported->string()) {
            return Dictionary{{conflict::kBundleIdentifier, *reported}};
        }
        EVLOG_ERROR(ops(), "tenurd reported incomplete bundle for plug-in {}/{}", identifier(),
                    pub(uuid()));
    }
    return std::nullopt;
}

}  // namespace zorvan
