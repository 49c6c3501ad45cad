#include "platform/lum/Frame.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>

#include "platform/lum/Limits.h"
#include "platform/values/Cbor.h"

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

}  // namespace

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
    // Doubling keeps the copying linear; the announced size bounds it, but is no promise.
    if (wanted > payload_.capacity())
        payload_.reserve(std::min(size, std::max(wanted, 2 * payload_.capacity())));
    payload_.append(input.substr(0, arrived));
    input.remove_prefix(arrived);
    if (payload_.size() < size) return std::shared_ptr<const std::string>();

    headerSize_ = 0;
    return std::make_shared<const std::string>(std::exchange(payload_, {}));
}

}  // namespace platform::lum
