#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "platform/lum/Connection.h"
#include "platform/lum/Message.h"
#include "platform/system/Error.h"
#include "platform/values/SliceList.h"

namespace platform::lum {

/// On the socket a message is a frame: the payload's length as 4 bytes, big-endian, then the
/// payload, one CBOR item: the array [kind, serial, body].
enum class FrameKind : std::uint64_t { Request = 0, Reply = 1 };

inline constexpr std::size_t kFrameHeaderSize = 4;

/// A whole frame. Error (domain "Lum"): the payload would be over `limit` bytes.
Result<SliceList> encodeFrame(FrameKind kind, const Message& message, std::size_t limit);

/// What keeps a receiver from taking a request with this body, by the limits of values: too many,
/// nested too deep, or text that no text string can be. None when it can be sent, if it is not too
/// large. Domain "Lum".
std::optional<Error> whatIsWrongWith(const Dictionary& body);

/// What a payload is to a receiver of frames of the kind `expected`: a message; a well-formed item
/// that is no such message; or, for anything else, an error that says what is wrong with it.
using DecodedPayload = std::variant<Message, UnknownObject, Error>;
DecodedPayload decodePayload(std::shared_ptr<const std::string> payload, FrameKind expected);

/// Cuts a stream of bytes into payloads. Memory is taken as bytes arrive, and for all of a payload
/// once more of it is there than every connection may have (lum/Limits.h).
class FrameReader {
  public:
    explicit FrameReader(std::size_t maxPayload) : maxPayload_(maxPayload) {}

    /// Takes bytes off the front of `input` until a frame is complete, and answers its payload;
    /// null when all of `input` is taken and the frame is not complete. Error (domain "Lum"): the
    /// frame is announced with more bytes than the limit; the stream cannot be read on.
    Result<std::shared_ptr<const std::string>> take(std::string_view& input);

    /// The size of the payload of which a part is still to come; 0 while it is not known.
    std::size_t announced() const;

    /// Whether part of a frame has been taken.
    bool insideFrame() const { return headerSize_ > 0; }

  private:
    std::size_t maxPayload_;
    std::array<unsigned char, kFrameHeaderSize> header_{};
    std::size_t headerSize_ = 0;
    std::string payload_;
};

}  // namespace platform::lum
