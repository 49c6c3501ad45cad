#include "platform/lum/Frame.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>

#include "platform/lum/Limits.h"
#include "platform/values/Cbor.h"
#include "platform/values/Utf8.h"

namespace platform::lum {

namespace {

constexpr const char* kDomain = "Lum";

/// [kind, serial, body] with the expected kind.
std::optional<Message> asMessage(const Value& item, FrameKind expected) {
    const Array* parts = item.array();
    if (!parts || parts->size() != 3) return std::nullopt;
    const auto kind = (*parts)[0].unsignedInteger();
    const auto serial = (*parts)[1].unsignedInteger();
    const Dictionary* body = (*parts)[2].dictionary();
    if (kind != static_cast<std::uint64_t>(expected) || !serial || !body) return std::nullopt;
    Message message(*body);
    message.setSerial(*serial);
    return message;
}

/// Counts and looks at values as their receiver will. Answers what is wrong, or null.
class BodyCheck {
  public:
    const char* check(const Dictionary& dictionary, int depth) {
        if (depth > kMaxCborDepth) return kTooDeep;
        for (const auto& [key, value] : dictionary) {
            if (const char* wrong = check(key.view())) return wrong;
            if (const char* wrong = check(value, depth)) return wrong;
        }
        return nullptr;
    }

  private:
    static constexpr const char* kTooDeep = "it is nested too deep";
    /// The array around the body, its kind and serial, and the body.
    static constexpr std::size_t kValuesAround = 4;

    const char* check(const Value& value, int depth) {
        if (++count_ > kMaxRequestValues) return "it has too many values";
        if (const auto* text = value.string()) return check(text->view());
        if (const Dictionary* dictionary = value.dictionary()) return check(*dictionary, depth + 1);
        const Array* array = value.array();
        if (!array) return nullptr;
        if (depth >= kMaxCborDepth) return kTooDeep;
        for (const Value& element : *array)
            if (const char* wrong = check(element, depth + 1)) return wrong;
        return nullptr;
    }

    static const char* check(std::string_view text) {
        if (!isValidUtf8(text)) return "it has text that is not UTF-8";
        return text.find('\0') == std::string_view::npos ? nullptr : "it has text with a NUL";
    }

    std::size_t count_ = kValuesAround;
};

}  // namespace

std::optional<Error> whatIsWrongWith(const Dictionary& body) {
    constexpr int kDepthOfBody = 2;
    const char* wrong = BodyCheck().check(body, kDepthOfBody);
    return wrong ? std::optional(Error{kDomain, 0, wrong}) : std::nullopt;
}

Result<SliceList> encodeFrame(FrameKind kind, const Message& message, std::size_t limit) {
    std::string start;
    encodeCborArrayHead(3, start);
    encodeCborUnsigned(static_cast<std::uint64_t>(kind), start);
    encodeCborUnsigned(message.serial(), start);

    SliceList frame;
    const auto length = frame.appendGap(kFrameHeaderSize);
    frame.append(start);
    encodeCbor(message.contents(), frame);
    const std::size_t size = frame.size() - kFrameHeaderSize;
    if (size > limit)
        return Error{kDomain, 0,
                     fmt::format("a message of {} bytes is over the limit of {}", size, limit)};
    frame.fill(length, bigEndian32(size));
    return frame;
}

DecodedPayload decodePayload(std::shared_ptr<const std::string> payload, FrameKind expected) {
    // Requests are a stranger's; of the daemon's replies, whatever it could write is read.
    const std::size_t maxValues =
        expected == FrameKind::Request ? kMaxRequestValues : kUnlimitedCborValues;
    Result<Value> item = decodeCbor(std::move(payload), CborOptions::Plain, maxValues);
    if (!item) return item.error();
    if (auto message = asMessage(*item, expected)) return std::move(*message);
    return UnknownObject{describe(*item)};
}

std::size_t FrameReader::announced() const {
    if (headerSize_ < kFrameHeaderSize) return 0;
    std::size_t size = 0;
    for (unsigned char byte : header_) size = size << 8 | byte;
    return size;
}

Result<std::shared_ptr<const std::string>> FrameReader::take(std::string_view& input) {
    while (headerSize_ < kFrameHeaderSize && !input.empty()) {
        header_[headerSize_++] = static_cast<unsigned char>(input.front());
        input.remove_prefix(1);
    }
    if (headerSize_ < kFrameHeaderSize) return std::shared_ptr<const std::string>();

    const std::size_t size = announced();
    if (size > maxPayload_)
        return Error{kDomain, 0,
                     fmt::format("a frame of {} bytes is over the limit of {}", size, maxPayload_)};

    const std::size_t arrived = std::min(input.size(), size - payload_.size());
    const std::size_t wanted = payload_.size() + arrived;
    // The announced size is no promise. But who was let send more than is free to everybody counts
    // with all of it already, and moving megabytes again and again would hold up others.
    if (wanted > payload_.capacity())
        payload_.reserve(wanted > kFreeReceived
                             ? size
                             : std::min(size, std::max(wanted, 2 * payload_.capacity())));
    payload_.append(input.substr(0, arrived));
    input.remove_prefix(arrived);
    if (payload_.size() < size) return std::shared_ptr<const std::string>();

    headerSize_ = 0;
    return std::make_shared<const std::string>(std::exchange(payload_, {}));
}

}  // namespace platform::lum
