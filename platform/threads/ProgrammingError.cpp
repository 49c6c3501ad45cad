#include "platform/threads/ProgrammingError.h"

#include <cstdlib>

#include "platform/log/OpsLog.h"

namespace platform {

void programmingError(const std::string& text, CodePlace place) {
    EVLOG_ERROR(ops(), "programming error in {} ({}:{}): {}", pub(place.method), pub(place.file),
                place.line, pub(text));
    std::abort();
}

}  // namespace platform
