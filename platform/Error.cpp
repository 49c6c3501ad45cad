#include "platform/Error.h"

#include <fmt/format.h>

#include <cstring>

namespace platform {

Error Error::posix(int errnum, std::string_view what) {
    char buffer[256];
    return {"POSIX", errnum,
            fmt::format("{}: {}", what, strerror_r(errnum, buffer, sizeof buffer))};
}

std::string describe(const Error& error) {
    return fmt::format("{} ({} {})", error.text, error.domain, error.code);
}

}  // namespace platform
