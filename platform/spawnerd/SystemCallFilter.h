#pragma once

#include <string>

#include "platform/system/Error.h"

namespace platform::spawnerd {

/// The filter of system calls that every plug-in runs under, as the kernel loads it: what is
/// refused stands in one table in SystemCallFilter.cpp, everything else is allowed. Refused calls
/// answer an errno and never end the caller, so that programs can do without. It holds for all
/// architectures whose programs this machine runs. Compiled once; errors: the system's, EINVAL
/// among them when the library cannot express it. From any thread.
Result<std::string> systemCallFilter();

}  // namespace platform::spawnerd
