#include "tools/zrctl/Outcome.h"

#include <cerrno>
#include <cstdio>
#include <cstring>

namespace zrctl {

Outcome writeOut(const std::string& text) {
    const bool written =
        std::fwrite(text.data(), 1, text.size(), stdout) == text.size() && std::fflush(stdout) == 0;
    if (written || errno == EPIPE) return {};
    return Outcome::failure(std::string("cannot write: ") + std::strerror(errno));
}

}  // namespace zrctl
