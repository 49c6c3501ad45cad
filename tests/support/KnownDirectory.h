#pragma once

#include <fcntl.h>

#include <string>

#include "platform/system/KnownDirectory.h"

namespace test {

/// The directory that lies at a canonical path now.
inline platform::KnownDirectory known(const std::string& path) {
    return {path, platform::FileIdentity::at(AT_FDCWD, path.c_str())};
}

}  // namespace test
