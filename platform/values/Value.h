#pragma once

#include <atomic>
#include <concepts>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/values/Memory.h"
#include "platform/values/Text.h"
#include "platform/values/Uuid.h"

namespace platform {

class Value;

/// A point in time, in seconds since 1970-01-01 00:00 UTC.
struct Date {
    double secondsSince1970 = 0;
    bool operator==(const Date&) const = default;
};

/// The encoded form (platform/values/Cbor.h) of a value, which may be a slice of a larger buffer
/// that it keeps alive. Immutable.
struct EncodedBytes {
    std::shared_ptr<const std::string> owner;
    std::string_view bytes;
};

/// An ordered list of values. A value type: copies share its memory until one of them is changed,
/// and reading shared memory from several threads is safe.
class Array {
  public:
    Array() = default;
    Array(const Array&) = default;
    Array(Array&& other) noexcept { swap(other); }
    Array& operator=(Array other) noexcept {
        swap(other);
        return *this;
    }
    ~Array() = default;
    Array(std::initializer_list<Value> values);
    explicit Array(std::vector<Value> values);
    /// Values that lie in the memory.
    Array(Hold memory, const Value* values, std::size_t size)
        : memory_(std::move(memory)), values_(values), size_(size) {}

    std::size_t size() const { return size_; }
    bool empty() const { return size_ == 0; }
    const Value& operator[](std::size_t index) const;
    const Value* begin() const { return values_; }
    const Value* end() const;

    void append(Value value);
    void remove(std::size_t index);
    /// Replaces the element at `index`, which must exist.
    void set(std::size_t index, Value value);

    bool operator==(const Array& other) const;

  private:
    class Built;

    template <class Change>
    void change(Change change);
    void swap(Array& other) noexcept {
        std::swap(memory_, other.memory_);
        std::swap(values_, other.values_);
        std::swap(size_, other.size_);
    }

    Hold memory_;
    const Value* values_ = nullptr;
    std::size_t size_ = 0;
};

/// A map from text keys to values, iterated in the byte order of its keys. A value type: copies
/// share its memory until one of them is changed, and reading shared memory from several threads is
/// safe.
///
/// It may carry its own encoded bytes, so that a dictionary that is sent often is encoded once;
/// changing a dictionary drops them for that copy.
class Dictionary {
  public:
    using Entry = std::pair<Text, Value>;
    /// What is in it, all of which lies in its memory.
    struct Nodes {
        const Entry* entries;  // sorted by key, keys unique
        std::size_t size;
        /// The bytes that it was decoded from, if it carries them; its memory is `Decoded` then.
        std::string_view encoded;
    };

    Dictionary() = default;
    Dictionary(const Dictionary&) = default;
    Dictionary(Dictionary&& other) noexcept { swap(other); }
    Dictionary& operator=(Dictionary other) noexcept {
        swap(other);
        return *this;
    }
    ~Dictionary() = default;
    /// The later of two entries of one key wins.
    Dictionary(std::initializer_list<Entry> entries);
    /// Takes entries in any order. None when two of them have the same key.
    static std::optional<Dictionary> fromEntries(std::vector<Entry> entries);
    Dictionary(Hold memory, const Nodes* nodes) : memory_(std::move(memory)), nodes_(nodes) {}

    std::size_t size() const { return nodes_ ? nodes_->size : 0; }
    bool empty() const { return size() == 0; }
    const Entry* begin() const { return nodes_ ? nodes_->entries : nullptr; }
    const Entry* end() const;

    /// The value under `key`, or null. The pointer is good until this copy is changed or goes away.
    const Value* find(std::string_view key) const;
    bool contains(std::string_view key) const { return find(key) != nullptr; }

    void set(std::string_view key, Value value);
    /// Removes the entry under `key`; does nothing, and unshares nothing, when there is none.
    void remove(std::string_view key);

    /// The encoded bytes that it carries, if it does.
    std::optional<EncodedBytes> encoded() const;
    /// Gives its memory its encoded bytes, which must be the encoding of just these entries. Safe
    /// to call while other threads read; does nothing when it carries bytes already, for an empty
    /// dictionary, and for one that was decoded.
    void keepEncoded(EncodedBytes bytes) const;

    bool operator==(const Dictionary& other) const;

  private:
    class Built;

    Built& unshared();
    void swap(Dictionary& other) noexcept {
        std::swap(memory_, other.memory_);
        std::swap(nodes_, other.nodes_);
    }

    Hold memory_;
    const Nodes* nodes_ = nullptr;
};

/// A property list in its message encoding: one opaque value of a message (platform/values/Cbor.h
/// writes it as an encoded item inside a byte string). Made from a value, which is then encoded
/// only when the message is, or from received bytes, which are decoded only when somebody unpacks
/// them.
class Packed {
  public:
    explicit Packed(Value value);
    explicit Packed(const EncodedBytes& bytes);
    /// A slice of `Decoded` memory.
    explicit Packed(Bytes slice) : bytes_(std::move(slice)) {}

    /// The value it was made from, or null when it was made from bytes.
    const Value* value() const;
    /// The bytes it was made from; empty when it was made from a value.
    EncodedBytes bytes() const;

    bool operator==(const Packed& other) const;

  private:
    class Made;

    Bytes bytes_;  // at a null pointer: of the value in its memory
};

/// The one value type of the system, which property lists and messages share. There is no null: an
/// absent value is a null pointer or an empty optional.
///
/// Numbers (booleans, integers, reals) compare by value across kinds: 1 equals true, 0 equals
/// false.
class Value {
  public:
    enum class Kind { Boolean, Integer, Real, Date, Data, String, Uuid, Array, Dictionary, Packed };

    /// Only real booleans and reals: a pointer or a character must not turn into one.
    template <std::same_as<bool> T>
    Value(T value) : content_(value) {}
    template <std::floating_point T>
    Value(T value) : content_(static_cast<double>(value)) {}
    template <std::integral T>
    requires(!std::same_as<T, bool> && !std::same_as<T, char>) Value(T value)
        : content_(integer(value)) {}
    Value(Date value) : content_(value) {}
    Value(Data value) : content_(std::move(value)) {}
    Value(Text value) : content_(std::move(value)) {}
    Value(const std::string& value) : Value(Text(value)) {}
    Value(std::string_view value) : Value(Text(value)) {}
    Value(const char* value) : Value(Text(value)) {}
    Value(Uuid value) : content_(value) {}
    Value(Array value) : content_(std::move(value)) {}
    Value(Dictionary value) : content_(std::move(value)) {}
    Value(Packed value) : content_(std::move(value)) {}

    Kind kind() const { return kKinds[content_.index()]; }

    /// Each answers null, or none, when the value is of another kind. A pointer is good as long as
    /// this value is neither changed nor destroyed.
    const Text* string() const { return std::get_if<Text>(&content_); }
    const Array* array() const { return std::get_if<Array>(&content_); }
    const Dictionary* dictionary() const { return std::get_if<Dictionary>(&content_); }
    const Data* data() const { return std::get_if<Data>(&content_); }
    const Packed* packed() const { return std::get_if<Packed>(&content_); }
    std::optional<bool> boolean() const;
    std::optional<double> real() const;
    std::optional<Date> date() const;
    std::optional<Uuid> uuid() const;
    /// An integer that is not negative; none for every other kind and for negative integers.
    std::optional<std::uint64_t> unsignedInteger() const;
    /// An integer that fits; none for every other kind and for integers above 2^63-1.
    std::optional<std::int64_t> signedInteger() const;

    bool isNumber() const;
    /// The value of a number of any kind as a 64-bit integer: true is 1, reals lose their fraction,
    /// and what does not fit becomes the nearest end of the range (NaN becomes 0). None for other
    /// kinds.
    std::optional<std::int64_t> numberAsInteger() const;
    /// The same in two's complement, for who wants some of its bits: integers above 2^63-1 keep
    /// theirs.
    std::optional<std::uint64_t> numberAsBits() const;

    bool operator==(const Value& other) const;

  private:
    using Content = std::variant<bool, std::int64_t, std::uint64_t, double, Date, Data, Text, Uuid,
                                 Array, Dictionary, Packed>;
    static constexpr Kind kKinds[] = {Kind::Boolean, Kind::Integer,    Kind::Integer, Kind::Real,
                                      Kind::Date,    Kind::Data,       Kind::String,  Kind::Uuid,
                                      Kind::Array,   Kind::Dictionary, Kind::Packed};

    /// Integers are held as int64 when they fit, so that each has one form only.
    template <std::integral T>
    static Content integer(T value) {
        if constexpr (std::signed_integral<T>) {
            return std::int64_t{value};
        } else {
            if (value > static_cast<std::uint64_t>(INT64_MAX)) return std::uint64_t{value};
            return static_cast<std::int64_t>(value);
        }
    }

    Content content_;
};

/// Whether the value is a number equal to the boolean true (false), that is, to 1 (0).
bool equalsTrue(const Value& value);
bool equalsFalse(const Value& value);

/// Texts of a value for people: compact, strings quoted inside containers, cut after 64 KiB.
std::string describe(const Value& value);
std::string describe(const Dictionary& value);
std::string describe(const Array& value);
/// The same, however long it is.
std::string describeWhole(const Dictionary& value);

/// Whether the value could be stored in a property-list file and read back: no UUID and no packed
/// value at any depth, no text (keys included) with characters that XML 1.0 forbids, no date
/// outside the years 1 to 9999, at most `levels` levels of containers. What comes in messages is
/// held to the narrow limit, so that it can stand deeper in our files and replies.
inline constexpr int kMessagePropertyListLevels = 64;
bool isPropertyList(const Value& value, int levels = kMessagePropertyListLevels);

/// The number of values in `value`, itself and dictionary keys' values included; counting stops
/// above `limit`.
std::size_t countValues(const Value& value, std::size_t limit);

/// A copy with memory of its own: what is kept for long must not keep all of a message.
Dictionary detached(const Dictionary& value);

inline const Value& Array::operator[](std::size_t index) const {
    return values_[index];
}
inline const Value* Array::end() const {
    return values_ + size_;
}
inline const Dictionary::Entry* Dictionary::end() const {
    return begin() + size();
}

}  // namespace platform
