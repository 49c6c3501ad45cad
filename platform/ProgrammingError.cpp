#include "platform/ProgrammingError.h"

#include <cstdlib>

#include "platform/Log.h"

namespace platform {

void programmingError(const std::string& text) {
    EVLOG_ERROR(Log::make("com.orbel.Zorvan", "ops"), "programming error: {}", pub(text));
    std::abort();
}

}  // namespace platform
