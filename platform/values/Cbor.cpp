#include "platform/values/Cbor.h"

#include <cbor.h>
#include <fmt/format.h>

#include <algorithm>
#include <cstring>
#include <vector>

#include "platform/values/SliceList.h"
#include "platform/values/Utf8.h"

namespace platform {

namespace {

constexpr std::uint64_t kDateTag = 1;
constexpr std::uint64_t kPackedTag = 24;
constexpr std::uint64_t kUuidTag = 37;
/// Room is made for at most so many elements before they have been seen: nested containers that
/// claim many must not multiply.
constexpr std::size_t kMaxReserved = 256;

/// Writes into a string: everything is copied.
class StringOutput {
  public:
    explicit StringOutput(std::string& bytes) : bytes_(bytes) {}

    void append(std::string_view bytes) { bytes_ += bytes; }
    void appendShared(const EncodedBytes& bytes) { bytes_ += bytes.bytes; }
    std::size_t appendGap(std::size_t size) {
        bytes_.append(size, '\0');
        return bytes_.size() - size;
    }
    void fill(std::size_t gap, std::string_view bytes) { bytes_.replace(gap, bytes.size(), bytes); }
    std::size_t size() const { return bytes_.size(); }

  private:
    std::string& bytes_;
};

template <class Output>
class Encoder {
  public:
    explicit Encoder(Output& out) : out_(out) {}

    template <class Encode, class Argument>
    void head(Encode encode, Argument argument) {
        unsigned char bytes[9];
        std::size_t size = encode(argument, bytes, sizeof bytes);
        out_.append({reinterpret_cast<const char*>(bytes), size});
    }

    void dictionary(const Dictionary& value) {
        if (const EncodedBytes* encoded = value.encoded()) return out_.appendShared(*encoded);
        head(cbor_encode_map_start, value.size());
        for (const auto& [key, element] : value) {
            text(key);
            this->value(element);
        }
    }

    void value(const Value& value) {
        switch (value.kind()) {
            case Value::Kind::Boolean:
                return head(cbor_encode_bool, *value.boolean());
            case Value::Kind::Integer:
                return integer(value);
            case Value::Kind::Real:
                return head(cbor_encode_double, *value.real());
            case Value::Kind::Date:
                head(cbor_encode_tag, kDateTag);
                return head(cbor_encode_double, value.date()->secondsSince1970);
            case Value::Kind::Data:
                return bytes(value.data()->bytes());
            case Value::Kind::String:
                return text(*value.string());
            case Value::Kind::Uuid:
                return uuid(*value.uuid());
            case Value::Kind::Array:
                head(cbor_encode_array_start, value.array()->size());
                for (const Value& element : *value.array()) this->value(element);
                return;
            case Value::Kind::Dictionary:
                return dictionary(*value.dictionary());
            case Value::Kind::Packed:
                return packed(*value.packed());
        }
    }

  private:
    void text(std::string_view text) {
        head(cbor_encode_string_start, text.size());
        out_.append(text);
    }

    void bytes(std::string_view bytes) {
        head(cbor_encode_bytestring_start, bytes.size());
        out_.append(bytes);
    }

    void integer(const Value& value) {
        auto small = value.signedInteger();
        if (small && *small < 0) {
            head(cbor_encode_negint, static_cast<std::uint64_t>(-1 - *small));
        } else {
            head(cbor_encode_uint, *value.unsignedInteger());
        }
    }

    void uuid(const Uuid& uuid) {
        head(cbor_encode_tag, kUuidTag);
        bytes({reinterpret_cast<const char*>(uuid.bytes.data()), uuid.bytes.size()});
    }

    /// The length takes four bytes always: it is known only after the value has been written.
    void packed(const Packed& packed) {
        head(cbor_encode_tag, kPackedTag);
        out_.append("\x5A");
        auto gap = out_.appendGap(4);
        std::size_t start = out_.size();
        if (packed.value()) {
            value(*packed.value());
        } else {
            out_.appendShared(packed.bytes());
        }
        out_.fill(gap, bigEndian32(out_.size() - start));
    }

    Output& out_;
};

}  // namespace

std::string bigEndian32(std::size_t number) {
    std::string bytes(4, '\0');
    for (std::size_t i = 4; i-- > 0; number >>= 8) bytes[i] = static_cast<char>(number);
    return bytes;
}

void encodeCborArrayHead(std::size_t count, std::string& out) {
    StringOutput output(out);
    Encoder(output).head(cbor_encode_array_start, count);
}

void encodeCborUnsigned(std::uint64_t value, std::string& out) {
    StringOutput output(out);
    Encoder(output).head(cbor_encode_uint, value);
}

void encodeCbor(const Dictionary& value, std::string& out) {
    StringOutput output(out);
    Encoder(output).dictionary(value);
}

void encodeCbor(const Value& value, std::string& out) {
    StringOutput output(out);
    Encoder(output).value(value);
}

void encodeCbor(const Dictionary& value, SliceList& out) {
    Encoder(out).dictionary(value);
}

void keepCborEncoded(const Dictionary& dictionary) {
    if (dictionary.encoded()) return;
    std::string bytes;
    encodeCbor(dictionary, bytes);
    auto owner = std::make_shared<const std::string>(std::move(bytes));
    dictionary.keepEncoded({owner, *owner});
}

namespace {

/// One item's head, as the streaming decoder reports it, with the bytes of a string.
struct Head {
    enum class Kind { Unsigned, Negative, Bytes, Text, Array, Map, Tag, Real, Boolean, Refused };

    Kind kind = Kind::Refused;
    std::uint64_t number = 0;  // integer, count, tag or truth
    double real = 0;
    std::string_view string;
};

template <Head::Kind kind, class Number>
void reportNumber(void* context, Number number) {
    *static_cast<Head*>(context) = {kind, number, 0, {}};
}
template <Head::Kind kind>
void reportString(void* context, cbor_data bytes, std::size_t size) {
    *static_cast<Head*>(context) = {kind, 0, 0, {reinterpret_cast<const char*>(bytes), size}};
}
template <class Real>
void reportReal(void* context, Real real) {
    *static_cast<Head*>(context) = {Head::Kind::Real, 0, real, {}};
}

/// Null, undefined and indefinite lengths are left to the callbacks that do nothing: the head stays
/// refused.
cbor_callbacks makeCallbacks() {
    using Kind = Head::Kind;
    cbor_callbacks callbacks = cbor_empty_callbacks;
    callbacks.uint8 = reportNumber<Kind::Unsigned, std::uint8_t>;
    callbacks.uint16 = reportNumber<Kind::Unsigned, std::uint16_t>;
    callbacks.uint32 = reportNumber<Kind::Unsigned, std::uint32_t>;
    callbacks.uint64 = reportNumber<Kind::Unsigned, std::uint64_t>;
    callbacks.negint8 = reportNumber<Kind::Negative, std::uint8_t>;
    callbacks.negint16 = reportNumber<Kind::Negative, std::uint16_t>;
    callbacks.negint32 = reportNumber<Kind::Negative, std::uint32_t>;
    callbacks.negint64 = reportNumber<Kind::Negative, std::uint64_t>;
    callbacks.byte_string = reportString<Kind::Bytes>;
    callbacks.string = reportString<Kind::Text>;
    callbacks.array_start = reportNumber<Kind::Array, std::size_t>;
    callbacks.map_start = reportNumber<Kind::Map, std::size_t>;
    callbacks.tag = reportNumber<Kind::Tag, std::uint64_t>;
    callbacks.float2 = reportReal<float>;
    callbacks.float4 = reportReal<float>;
    callbacks.float8 = reportReal<double>;
    callbacks.boolean = reportNumber<Kind::Boolean, bool>;
    return callbacks;
}

/// Reads one item by recursive descent. Each step answers nothing after it has noted what is wrong.
class Decoder {
  public:
    Decoder(const EncodedBytes& bytes, CborOptions options, std::optional<std::size_t> maxValues)
        : source_(bytes),
          keepEncoded_(options == CborOptions::KeepEncoded),
          valuesLeft_(maxValues.value_or(kMaxCborValues + bytes.bytes.size() / 8)) {}

    Result<Value> decode() {
        auto value = readValue(1);
        if (value && position_ != source_.bytes.size()) value = fail("more bytes after the item");
        if (value) return std::move(*value);
        return Error{"Cbor", 1, fmt::format("{} at offset {}", wrong_, start_)};
    }

  private:
    std::nullopt_t fail(const char* wrong) {
        wrong_ = wrong;
        return std::nullopt;
    }

    std::size_t left() const { return source_.bytes.size() - position_; }

    bool readHead(Head& head) {
        static const cbor_callbacks callbacks = makeCallbacks();
        start_ = position_;
        const auto* bytes = reinterpret_cast<const unsigned char*>(source_.bytes.data());
        auto result = cbor_stream_decode(bytes + position_, left(), &callbacks, &head);
        position_ += result.read;
        if (result.status == CBOR_DECODER_NEDATA) {
            fail("truncated");
            return false;
        }
        if (result.status != CBOR_DECODER_FINISHED || head.kind == Head::Kind::Refused) {
            fail("an item that messages do not have");
            return false;
        }
        return true;
    }

    std::optional<Value> readValue(int depth) {
        if (valuesLeft_-- == 0) return fail("too many values");
        Head head;
        if (!readHead(head)) return std::nullopt;
        switch (head.kind) {
            case Head::Kind::Unsigned:
                return Value(head.number);
            case Head::Kind::Negative:
                if (head.number > INT64_MAX) return fail("an integer below -2^63");
                return Value(-1 - static_cast<std::int64_t>(head.number));
            case Head::Kind::Bytes:
                return Value(Data(std::string(head.string)));
            case Head::Kind::Text:
                if (!isText(head.string)) return std::nullopt;
                return Value(head.string);
            case Head::Kind::Array:
                return readArray(head.number, depth);
            case Head::Kind::Map:
                return readMap(head.number, depth);
            case Head::Kind::Tag:
                return readTagged(head.number);
            case Head::Kind::Real:
                return Value(head.real);
            case Head::Kind::Boolean:
                return Value(head.number != 0);
            case Head::Kind::Refused:
                break;
        }
        return std::nullopt;
    }

    bool isText(std::string_view text) {
        if (!isValidUtf8(text)) fail("a text string that is not UTF-8");
        if (std::memchr(text.data(), 0, text.size())) fail("a text string with a NUL");
        return wrong_ == nullptr;
    }

    std::optional<Value> readArray(std::uint64_t count, int depth) {
        if (depth > kMaxCborDepth) return fail("nested too deep");
        if (count > left()) return fail("truncated");
        std::vector<Value> values;
        values.reserve(std::min<std::size_t>(count, kMaxReserved));
        for (; count > 0; --count) {
            auto value = readValue(depth + 1);
            if (!value) return std::nullopt;
            values.push_back(std::move(*value));
        }
        return Value(values.empty() ? Array() : Array(std::move(values)));
    }

    std::optional<Value> readMap(std::uint64_t count, int depth) {
        std::size_t start = start_;
        if (depth > kMaxCborDepth) return fail("nested too deep");
        if (count > left() / 2) return fail("truncated");
        std::vector<Dictionary::Entry> entries;
        entries.reserve(std::min<std::size_t>(count, kMaxReserved));
        for (; count > 0; --count) {
            Head key;
            if (!readHead(key)) return std::nullopt;
            if (key.kind != Head::Kind::Text) return fail("a key that is no text string");
            if (!isText(key.string)) return std::nullopt;
            auto value = readValue(depth + 1);
            if (!value) return std::nullopt;
            entries.emplace_back(key.string, std::move(*value));
        }
        auto dictionary = Dictionary::fromEntries(std::move(entries));
        if (!dictionary) {
            start_ = start;
            return fail("a map with the same key twice");
        }
        if (keepEncoded_) {
            dictionary->keepEncoded(
                {source_.owner, source_.bytes.substr(start, position_ - start)});
        }
        return Value(std::move(*dictionary));
    }

    std::optional<Value> readTagged(std::uint64_t tag) {
        if (tag != kDateTag && tag != kPackedTag && tag != kUuidTag) return fail("an unknown tag");
        Head content;
        if (!readHead(content)) return std::nullopt;
        if (tag == kDateTag) return readDate(content);
        if (content.kind != Head::Kind::Bytes) return fail("a tag on the wrong kind of item");
        if (tag == kPackedTag) return Value(Packed(EncodedBytes{source_.owner, content.string}));
        Uuid uuid;
        if (content.string.size() != uuid.bytes.size()) return fail("a UUID of the wrong length");
        std::ranges::copy(content.string, uuid.bytes.begin());
        return Value(uuid);
    }

    std::optional<Value> readDate(const Head& content) {
        auto number = static_cast<double>(content.number);
        if (content.kind == Head::Kind::Unsigned) return Value(Date{number});
        if (content.kind == Head::Kind::Negative) return Value(Date{-1 - number});
        if (content.kind == Head::Kind::Real) return Value(Date{content.real});
        return fail("a tag on the wrong kind of item");
    }

    const EncodedBytes& source_;
    const bool keepEncoded_;
    std::size_t valuesLeft_;
    std::size_t position_ = 0;
    std::size_t start_ = 0;  // of the item read last, for the error
    const char* wrong_ = nullptr;
};

}  // namespace

Result<Value> decodeCbor(std::shared_ptr<const std::string> bytes, CborOptions options,
                         std::optional<std::size_t> maxValues) {
    std::string_view all = *bytes;
    return decodeCbor(EncodedBytes{std::move(bytes), all}, options, maxValues);
}

Result<Value> decodeCbor(const EncodedBytes& bytes, CborOptions options,
                         std::optional<std::size_t> maxValues) {
    return Decoder(bytes, options, maxValues).decode();
}

Result<Value> unpack(const Packed& packed) {
    auto value = packed.value()
                     ? Result<Value>(*packed.value())
                     : decodeCbor(packed.bytes(), CborOptions::Plain, kUnlimitedCborValues);
    if (value && !isPropertyList(*value, kMaxCborDepth))
        return Error{"Cbor", 2, "not a property list"};
    return value;
}

}  // namespace platform
