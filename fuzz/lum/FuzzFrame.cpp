// A stream is cut into the same payloads however its bytes arrive, and a message is sent again as
// what it was. What a host would not send, since it would be refused, is refused, and nothing else.
// Covers: platform/lum/Frame.cpp platform/lum/Message.cpp

#include <algorithm>

#include "fuzz/Support.h"
#include "platform/lum/Frame.h"

using namespace platform;
using namespace platform::lum;

namespace {

constexpr std::size_t kLimit = 1u << 14;
using Payloads = std::vector<std::shared_ptr<const std::string>>;

Payloads payloadsOf(std::string_view stream, std::size_t step) {
    FrameReader reader(kLimit);
    Payloads payloads;
    while (!stream.empty()) {
        std::string_view piece = stream.substr(0, step);
        stream.remove_prefix(piece.size());
        while (!piece.empty()) {
            auto payload = reader.take(piece);
            if (!payload) return payloads;
            fuzz::require(*payload || piece.empty());
            if (*payload) payloads.push_back(*payload);
            fuzz::require(!*payload || !reader.insideFrame());
            fuzz::require(reader.announced() <= kLimit);
        }
    }
    return payloads;
}

void sendAgain(const Message& message, FrameKind kind) {
    const auto frame = encodeFrame(kind, message, 2 * kLimit);
    if (!frame) return;
    const std::string bytes = frame->string();
    auto payload = std::make_shared<const std::string>(bytes.substr(kFrameHeaderSize));
    const auto again = decodePayload(payload, kind);
    const Message* same = std::get_if<Message>(&again);
    fuzz::require(same && same->serial() == message.serial());
    fuzz::require(describe(*same) == describe(message));
}

/// As a host may have made it: with texts that are any bytes, where data was, and deeper.
Value likeAHosts(const Value& value) {
    if (const Data* data = value.data()) return std::string(data->bytes());
    if (const Array* array = value.array()) {
        std::vector<Value> elements;
        for (const Value& element : *array) elements.push_back(likeAHosts(element));
        return Array(std::move(elements));
    }
    if (const Dictionary* dictionary = value.dictionary()) {
        Dictionary made;
        for (const auto& [key, element] : *dictionary) {
            const Data* name = element.data();
            made.set(name ? name->bytes() : key.view(), likeAHosts(element));
        }
        return made;
    }
    return value;
}

void sendAsHost(const Message& message) {
    Dictionary body = *likeAHosts(Value(message.contents())).dictionary();
    const Value* levels = body.find("levels");
    for (std::uint64_t i = levels ? levels->unsignedInteger().value_or(0) % 256 : 0; i > 0; --i)
        body = i % 2 ? Dictionary{{"", Array{std::move(body)}}} : Dictionary{{"", std::move(body)}};
    const auto wrong = whatIsWrongWith(body);
    const auto frame = encodeFrame(FrameKind::Request, Message(body), SIZE_MAX);
    const auto received =
        decodePayload(std::make_shared<const std::string>(frame->string().substr(kFrameHeaderSize)),
                      FrameKind::Request);
    fuzz::require(wrong ? std::holds_alternative<Error>(received)
                        : std::holds_alternative<Message>(received));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const Payloads whole = payloadsOf(fuzz::text(data, size), std::max<std::size_t>(size, 1));
    const Payloads pieces = payloadsOf(fuzz::text(data, size), 3);
    fuzz::require(std::ranges::equal(whole, pieces, [](auto& a, auto& b) { return *a == *b; }));
    for (const auto& payload : whole)
        for (const FrameKind kind : {FrameKind::Request, FrameKind::Reply}) {
            const auto decoded = decodePayload(payload, kind);
            const auto* message = std::get_if<Message>(&decoded);
            if (!message) continue;
            sendAgain(*message, kind);
            sendAsHost(*message);
            fuzz::require(Message::replyTo(*message).serial() == message->serial());
        }
    return 0;
}
