#pragma once

#include <string>

namespace platform {

/// Logs what went wrong as an error and aborts the process. For misuse by our own code only; what
/// peers and files can bring about is answered instead.
[[noreturn]] void programmingError(const std::string& text);

}  // namespace platform
