#pragma once

#include <fmt/core.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>
#include <string>
#include <string_view>
#include <utility>

namespace bench {

/// Why no figures can be given. Thrown inside this program only; `main` prints the text and exits
/// with a failure, after every process and directory that was made has been cleaned up.
struct Failure : std::runtime_error {
    using std::runtime_error::runtime_error;
};

template <class... Args>
[[noreturn]] void fail(fmt::format_string<Args...> text, Args&&... args) {
    throw Failure(fmt::format(text, std::forward<Args>(args)...));
}

/// A failed system call, with the system's text for the errno.
[[noreturn]] inline void failErrno(std::string_view what) {
    const int number = errno;
    fail("{}: {}", what, std::strerror(number));
}

}  // namespace bench
