#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/system/Error.h"
#include "platform/values/Value.h"

namespace platform {

class SliceList;

/// The encoding of values in messages and in the catalogue: CBOR (RFC 8949), a subset of it.
///
/// | value | item |
/// |---|---|
/// | boolean | true, false |
/// | integer | unsigned or negative integer |
/// | real | float (every width is read, 64 bits are written) |
/// | string | text string: UTF-8 without NUL |
/// | data | byte string |
/// | date | tag 1, then an integer or a float: seconds since 1970 |
/// | UUID | tag 37, then a byte string of 16 bytes |
/// | packed property list | tag 24, then a byte string that holds one encoded item |
/// | array | array |
/// | dictionary | map whose keys are text strings, each once; written in the byte order of the keys
/// |
///
/// Lengths are definite. Everything else (null, undefined, other tags, other simple values,
/// indefinite lengths) is refused.

/// Deepest nesting of arrays and maps that is read: what stands at the top has depth 1.
inline constexpr int kMaxCborDepth = 128;

/// Most values that are read from one item unless the caller says otherwise: this many, and one
/// more for every eight of its bytes. A value in memory is larger than the byte that is enough to
/// encode it.
inline constexpr std::size_t kMaxCborValues = 1u << 20;
/// No such limit, for whoever has to read everything that `encodeCbor` can write: since each value
/// takes a byte at least, the length of the bytes is one.
inline constexpr std::size_t kUnlimitedCborValues = SIZE_MAX;

/// Appends the encoding of `value` to `out`. A dictionary that carries its encoded bytes is copied,
/// not walked. Never fails.
void encodeCbor(const Value& value, std::string& out);
void encodeCbor(const Dictionary& value, std::string& out);
/// The same into slices: what carries its encoded bytes is shared, not copied.
void encodeCbor(const Dictionary& value, SliceList& out);
/// Appends the heads of an array or map, an unsigned integer and a text string, for callers that
/// write the parts of an item one by one.
void encodeCborArrayHead(std::size_t count, std::string& out);
void encodeCborUnsigned(std::uint64_t value, std::string& out);
/// A number as four bytes, the highest first.
std::string bigEndian32(std::size_t number);

/// Gives a dictionary its encoded bytes, unless it carries them already. Safe on shared
/// dictionaries.
void keepCborEncoded(const Dictionary& dictionary);

enum class CborOptions {
    Plain,
    /// Every dictionary made carries its slice of the bytes as its encoded form, and keeps all of
    /// the bytes alive. For bytes that came from `encodeCbor` (the catalogue), not for a peer's.
    KeepEncoded,
};

/// Reads the one item that `bytes` holds. Checks counts and lengths against what is left of the
/// bytes before it allocates, the depth, the number of values (`maxValues`; none means
/// `kMaxCborValues`), UTF-8 and duplicate keys; nothing may follow the item. The error says what is
/// wrong and at which offset (domain "Cbor").
Result<Value> decodeCbor(std::shared_ptr<const std::string> bytes,
                         CborOptions options = CborOptions::Plain,
                         std::optional<std::size_t> maxValues = std::nullopt);
Result<Value> decodeCbor(const EncodedBytes& bytes, CborOptions options = CborOptions::Plain,
                         std::optional<std::size_t> maxValues = std::nullopt);

/// The value of a packed property list: the one it was made from, or its bytes decoded. Errors: as
/// `decodeCbor`; a value that is no property list.
Result<Value> unpack(const Packed& packed);

}  // namespace platform
