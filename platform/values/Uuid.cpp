#include "platform/values/Uuid.h"

#include <uuid/uuid.h>

namespace platform {

Uuid Uuid::random() {
    Uuid uuid;
    uuid_generate_random(uuid.bytes.data());
    return uuid;
}

std::optional<Uuid> Uuid::parse(std::string_view text) {
    Uuid uuid;
    if (text.size() != UUID_STR_LEN - 1 ||
        uuid_parse_range(text.data(), text.data() + text.size(), uuid.bytes.data()) != 0) {
        return std::nullopt;
    }
    return uuid;
}

std::string Uuid::string() const {
    char text[UUID_STR_LEN];
    uuid_unparse_upper(bytes.data(), text);
    return text;
}

std::string describe(const Uuid& uuid) {
    return uuid.string();
}

}  // namespace platform
