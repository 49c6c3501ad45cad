#include "platform/log/OpsLog.h"

namespace platform {

const Log& ops() {
    static const Log& handle = Log::make("com.orbel.Zorvan", "ops");
    return handle;
}

}  // namespace platform
