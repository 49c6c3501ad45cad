#include "platform/system/Error.h"

#include <fmt/format.h>

#include <cerrno>
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

bool isMissingFile(const Error& error) {
    return error.domain == "POSIX" && error.code == ENOENT;
}

bool isTransient(const Error& error) {
    return error.domain == "POSIX" &&
           (error.code == EMFILE || error.code == ENFILE || error.code == ENOMEM ||
            error.code == EIO || error.code == ETIMEDOUT);
}

}  // namespace platform
