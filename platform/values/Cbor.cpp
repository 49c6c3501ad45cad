#include "platform/values/Cbor.h"

#include <cbor.h>
#include "platform/values/CborDecoder.h"
#include "platform/values/CborTags.h"
#include "platform/values/SliceList.h"

namespace platform {

namespace {

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
        if (const auto encoded = value.encoded()) return out_.appendShared(*encoded);
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
                head(cbor_encode_tag, kCborDateTag);
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
        head(cbor_encode_tag, kCborUuidTag);
        bytes({reinterpret_cast<const char*>(uuid.bytes.data()), uuid.bytes.size()});
    }

    /// The length takes four bytes always: it is known only after the value has been written.
    void packed(const Packed& packed) {
        head(cbor_encode_tag, kCborPackedTag);
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
    bytes.shrink_to_fit();
    auto owner = std::make_shared<const std::string>(std::move(bytes));
    dictionary.keepEncoded({owner, *owner});
}

Result<Value> decodeCbor(std::shared_ptr<const std::string> bytes, CborOptions options,
                         std::optional<std::size_t> maxValues) {
    std::string_view all = *bytes;
    return decodeCbor(EncodedBytes{std::move(bytes), all}, options, maxValues);
}

Result<Value> decodeCbor(const EncodedBytes& bytes, CborOptions options,
                         std::optional<std::size_t> maxValues) {
    return CborDecoder(bytes, options, maxValues).decode();
}

Result<Value> unpack(const Packed& packed) {
    constexpr auto noPropertyList = [] { return Error{"Cbor", 2, "not a property list"}; };
    if (const Value* value = packed.value()) {
        if (!isPropertyList(*value, kMaxCborDepth)) return noPropertyList();
        return *value;
    }
    CborDecoder decoder(packed.bytes(), CborOptions::Plain, kUnlimitedCborValues);
    auto value = decoder.decode();
    if (value && !decoder.hasReadPropertyList()) return noPropertyList();
    return value;
}

}  // namespace platform
