#include "platform/spawnerd/SpawnRequest.h"

#include <cerrno>

#include "platform/spawnerd/Protocol.h"

namespace platform::spawnerd {

const Text* SpawnRequest::text(const char* key) const {
    const Value* value = message_.find(key);
    return value ? value->string() : nullptr;
}

Result<std::vector<std::string>> SpawnRequest::arguments() const {
    std::vector<std::string> arguments;
    const Value* value = message_.find(kArguments);
    if (!value) return arguments;
    if (!value->array()) return Error::posix(EINVAL, "\"arguments\" is no array");
    std::size_t bytes = 0;
    for (const Value& element : *value->array()) {
        const auto* text = element.string();
        if (!text) return Error::posix(EINVAL, "an argument is no text");
        bytes += text->size();
        if (bytes > kMaxStringBytes || arguments.size() == kMaxStrings)
            return Error::posix(E2BIG, "arguments");
        arguments.push_back(text->string());
    }
    return arguments;
}

std::optional<std::uint64_t> SpawnRequest::instance() const {
    const Value* value = message_.find(kInstance);
    return value ? value->unsignedInteger() : std::nullopt;
}

SpawnRequest SpawnRequest::withoutTurn() const {
    return {connection_, emptyReply()};
}

void SpawnRequest::reply(const Message& message) const {
    if (auto connection = connection_.lock()) connection->send(message);
}

void SpawnRequest::replyStatus(int status) const {
    Message message = emptyReply();
    message.set(kStatus, status);
    reply(message);
}

void SpawnRequest::refuse(const Error& error) const {
    Message message = emptyReply();
    message.set(kErrorCode, error.code);
    message.set(kError, error.text);
    reply(message);
}

}  // namespace platform::spawnerd
