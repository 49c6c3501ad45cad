#include "Zorvan/ZRDaemonClient.h"

#include <algorithm>
#include <limits>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/lum/Limits.h"
#include "platform/system/Directories.h"
#include "platform/values/Cbor.h"

namespace zorvan {

using platform::ConnectionError;
using platform::Dictionary;
using platform::Message;
using platform::Uuid;
using platform::Value;

std::shared_ptr<ZRDaemonClient> ZRDaemonClient::initWithServiceName(const char* serviceName) {
    return std::shared_ptr<ZRDaemonClient>(new ZRDaemonClient(serviceName), destroy);
}

/// A queue cannot join its own thread, so a client whose last reference goes in a callback is
/// destroyed on a thread kept for that.
void ZRDaemonClient::destroy(ZRDaemonClient* client) {
    if (client->replyQueue_.isCurrent()) {
        static platform::SerialQueue reaper("zrd_client end");
        reaper.async([client] { delete client; });
    } else {
        delete client;
    }
}

ZRDaemonClient::ZRDaemonClient(const char* serviceName)
    : replyQueue_("zrd_client"),
      zrd_(std::make_unique<platform::ClientConnection>(
          platform::Directories::fromEnvironment(), serviceName ? serviceName : kDefaultServiceName,
          replyQueue_)),
      protocolVersion_(kProtocolVersion) {
    zrd_->setEventHandler([this](const ConnectionError& event) {
        EVLOG_ERROR(ops(), "Communications error: {}", pub(event));
        hasEnded_ = true;
        if (auto handler = std::exchange(endHandler_, nullptr)) handler();
    });
    zrd_->resume();
}

ZRDaemonClient::~ZRDaemonClient() = default;

void ZRDaemonClient::setEndHandler(std::function<void()> handler) {
    replyQueue_.async([this, handler = std::move(handler)]() mutable {
        if (!hasEnded_)
            endHandler_ = std::move(handler);
        else if (handler)
            handler();
    });
}

namespace {

platform::Array arrayOf(const std::vector<std::string>& texts) {
    return platform::Array(std::vector<Value>(texts.begin(), texts.end()));
}

/// Whether one of the lists that the daemon bounds is longer than it takes.
bool hasTooLongList(const Message& message) {
    const auto isTooLong = [&](const char* key) {
        const Value* list = message.find(key);
        return list && list->array() && list->array()->size() > platform::lum::kMaxListed;
    };
    const Value* type = message.find(message::kRequest);
    const Value* all = message.find(message::kAnnotations);
    const bool isBulk = type && type->string() && *type->string() == request::kBulkAnnotate;
    const bool isLock = type && type->string() && *type->string() == request::kLock;
    return (!isLock && isTooLong(message::kUuids)) || isTooLong(message::kPaths) ||
           (isBulk && all && all->dictionary() &&
            all->dictionary()->size() > platform::lum::kMaxListed);
}

std::string describeReply(const ZRDaemonClient::Reply& reply) {
    return std::visit([](const auto& received) { return describe(received); }, reply);
}

}  // namespace

Message ZRDaemonClient::request(const char* type) const {
    Message message;
    message.set(message::kRequest, type);
    message.set(message::kVersion, protocolVersion());
    return message;
}

Message ZRDaemonClient::request(const char* type, const std::vector<std::string>& paths) const {
    Message message = request(type);
    message.set(message::kPaths, arrayOf(paths));
    return message;
}

void ZRDaemonClient::setUuids(Message& message, const std::vector<Uuid>& uuids) {
    message.set(message::kUuids, platform::Array(std::vector<Value>(uuids.begin(), uuids.end())));
}

void ZRDaemonClient::send(Message message, ReplyCallback reply) {
    EVLOG_DEBUG(traffic(), "request: {}", message);
    auto receive = [reply = std::move(reply)](const Reply& received) {
        EVLOG_DEBUG(traffic(), "reply: {}", describeReply(received));
        if (reply) reply(received);
    };
    if (!hasTooLongList(message))
        return zrd_->sendWithReply(std::move(message), std::move(receive));
    const ConnectionError refused{ConnectionError::Kind::Refused, "it has too long a list"};
    replyQueue_.async([receive = std::move(receive), refused] { receive(Reply(refused)); });
}

std::optional<ZRError> ZRDaemonClient::errorInReply(const Reply& reply) {
    if (const auto* event = std::get_if<ConnectionError>(&reply))
        return ZRErrorWithCode(kZRErrorInvalidRequest, describe(*event));
    const auto& message = std::get<Message>(reply);
    const Value* codeValue = message.find(message::kErrorCode);
    const Value* textValue = message.find(message::kError);
    std::uint64_t code = codeValue ? codeValue->unsignedInteger().value_or(0) : 0;
    const auto* text = textValue ? textValue->string() : nullptr;
    if (code == 0) {
        if (text) ZR_INTERNAL_INCONSISTENCY("zrd reported error without a code: " + text->string());
        return std::nullopt;
    }
    constexpr std::uint64_t largest = std::numeric_limits<int>::max();
    return ZRErrorWithCode(static_cast<int>(std::min(code, largest)),
                           text ? text->string() : "unknown error returned by Zorvan subsystem");
}

std::optional<Value> ZRDaemonClient::convertToLum(Value value, std::int64_t version) {
    if (version != kProtocolVersion) return std::nullopt;
    return platform::Packed(std::move(value));
}

std::optional<Value> ZRDaemonClient::convertFromLum(const Value& value) const {
    if (protocolVersion() != kProtocolVersion || !value.packed()) return std::nullopt;
    auto unpacked = platform::unpack(*value.packed());
    if (!unpacked) return std::nullopt;
    return std::move(*unpacked);
}

void ZRDaemonClient::addPlugIns(const std::vector<std::string>& paths, ReplyCallback reply) {
    send(request(request::kAdd, paths), std::move(reply));
}

void ZRDaemonClient::removePlugIns(const std::vector<std::string>& paths, ReplyCallback reply) {
    send(request(request::kRemove, paths), std::move(reply));
}

void ZRDaemonClient::bulkPlugins(std::uint64_t flags, ReplyCallback reply) {
    Message message = request(request::kBulk);
    message.set(message::kFlags, flags);
    send(std::move(message), std::move(reply));
}

void ZRDaemonClient::readyPlugIns(const std::vector<Uuid>& uuids, std::uint64_t flags,
                                  ReplyCallback reply) {
    Message message = request(request::kReady);
    message.set(message::kFlags, flags);
    setUuids(message, uuids);
    send(std::move(message), std::move(reply));
}

void ZRDaemonClient::accessPlugIns(const std::vector<Uuid>& uuids, std::uint64_t flags,
                                   ReplyCallback reply) {
    Message message = request(request::kAccess);
    message.set(message::kFlags, flags);
    setUuids(message, uuids);
    send(std::move(message), std::move(reply));
}

void ZRDaemonClient::matchPlugIns(const Dictionary& rules, std::uint64_t flags,
                                  ReplyCallback reply) {
    Message message = request(request::kMatch);
    message.set(message::kRules, rules);
    message.set(message::kFlags, flags);
    send(std::move(message), std::move(reply));
}

void ZRDaemonClient::setPluginAnnotations(const std::vector<Uuid>& uuids,
                                          const Dictionary& annotations, ReplyCallback reply) {
    Message message = request(request::kAnnotate);
    setUuids(message, uuids);
    message.set(message::kAnnotations, annotations);
    send(std::move(message), std::move(reply));
}

void ZRDaemonClient::bulkSetPluginAnnotations(const Dictionary& annotations, ReplyCallback reply) {
    Message message = request(request::kBulkAnnotate);
    message.set(message::kAnnotations, annotations);
    send(std::move(message), std::move(reply));
}

void ZRDaemonClient::holdPlugins(const std::vector<std::string>& paths, std::uint64_t flags,
                                 ReplyCallback reply) {
    Message message = request(request::kLock, paths);
    message.set(message::kFlags, flags);
    send(std::move(message), std::move(reply));
}

void ZRDaemonClient::releaseHold(const Uuid& token, ReplyCallback reply) {
    Message message = request(request::kLock);
    setUuids(message, {token});
    send(std::move(message), std::move(reply));
}

}  // namespace zorvan
