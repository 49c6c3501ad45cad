#include "platform/lum/Connection.h"

namespace platform {

std::string describe(const ConnectionError& error) {
    const char* name = "";
    switch (error.kind) {
        case ConnectionError::Kind::Invalid:
            name = "connection invalid";
            break;
        case ConnectionError::Kind::TerminationImminent:
            name = "termination imminent";
            break;
        case ConnectionError::Kind::Interrupted:
            name = "connection interrupted";
            break;
        case ConnectionError::Kind::Refused:
            name = "request not sent";
            break;
    }
    return error.text.empty() ? name : std::string(name) + ": " + error.text;
}

std::string describe(const UnknownObject& object) {
    return object.text;
}

}  // namespace platform
