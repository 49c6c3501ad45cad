#pragma once

#include "platform/log/Log.h"

namespace platform {

/// The log handle of all platform code: the category "ops" of the daemon's subsystem.
const Log& ops();

}  // namespace platform
