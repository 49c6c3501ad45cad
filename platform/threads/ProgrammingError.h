#pragma once

#include <string>

namespace platform {

/// A place in the source. As a default argument, `here()` is the place of the call.
struct CodePlace {
    const char* method;
    const char* file;
    int line;

    static constexpr CodePlace here(const char* method = __builtin_FUNCTION(),
                                    const char* file = __builtin_FILE(),
                                    int line = __builtin_LINE()) {
        return {method, file, line};
    }
};

/// Logs what went wrong, and where, as an error and aborts the process. For misuse by our own code
/// only; what peers and files can bring about is answered instead.
[[noreturn]] void programmingError(const std::string& text, CodePlace place = CodePlace::here());

}  // namespace platform
