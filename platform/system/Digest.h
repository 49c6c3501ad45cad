#pragma once

#include <string>
#include <string_view>

namespace platform {

/// The SHA-256 of some bytes as 64 hexadecimal digits: a name that follows from them and that
/// nothing else has.
std::string sha256Text(std::string_view bytes);

}  // namespace platform
