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

#include "platform/values/Uuid.h"

namespace platform {

class Value;

/// A point in time, in seconds since 1970-01-01 00:00 UTC.
struct Date {
    double secondsSince1970 = 0;
    bool operator==(const Date&) const = default;
};

/// An immutable string of bytes; copies share it.
class Data {
  public:
    Data() : bytes_(std::make_shared<const std::string>()) {}
    explicit Data(std::string bytes)
        : bytes_(std::make_shared<const std::string>(std::move(bytes))) {}

    std::string_view bytes() const { return *bytes_; }
    bool operator==(const Data& other) const { return bytes() == other.bytes(); }

  private:
    std::shared_ptr<const std::string> bytes_;
};

/// The encoded form (platform/values/Cbor.h) of a value, which may be a slice of a larger buffer
/// that it keeps alive. Immutable.
struct EncodedBytes {
    std::shared_ptr<const std::string> owner;
    std::string_view bytes;
};

/// An ordered list of values. A value type: copies share their storage until one of them is
/// changed, and reading shared storage from several threads is safe.
class Array {
  public:
    Array();
    Array(std::initializer_list<Value> values);
    explicit Array(std::vector<Value> values);

    std::size_t size() const;
    bool empty() const { return size() == 0; }
    const Value& operator[](std::size_t index) const;
    const Value* begin() const;
    const Value* end() const;

    void append(Value value);
    void remove(std::size_t index);
    /// Replaces the element at `index`, which must exist.
    void set(std::size_t index, Value value);

    bool operator==(const Array& other) const;

  private:
    std::vector<Value>& unshared();

    std::shared_ptr<std::vector<Value>> values_;
};

/// A map from text keys to values, iterated in the byte order of its keys. A value type: copies
/// share their storage until one of them is changed, and reading shared storage from several
/// threads is safe.
///
/// Shared storage may carry its own encoded bytes (`keepEncoded`), so that a dictionary that is
/// sent often is encoded once; changing a dictionary drops them for that copy.
class Dictionary {
  public:
    using Entry = std::pair<std::string, Value>;

    Dictionary();
    /// The later of two entries of one key wins.
    Dictionary(std::initializer_list<Entry> entries);
    /// Takes entries in any order. None when two of them have the same key.
    static std::optional<Dictionary> fromEntries(std::vector<Entry> entries);

    std::size_t size() const;
    bool empty() const { return size() == 0; }
    const Entry* begin() const;
    const Entry* end() const;

    /// The value under `key`, or null. The pointer is good until this copy is changed or goes away.
    const Value* find(std::string_view key) const;
    bool contains(std::string_view key) const { return find(key) != nullptr; }

    void set(std::string_view key, Value value);
    /// Removes the entry under `key`; does nothing, and unshares nothing, when there is none.
    void remove(std::string_view key);

    /// The encoded bytes that this storage carries, or null.
    const EncodedBytes* encoded() const;
    /// Gives this storage its encoded bytes, which must be the encoding of just these entries. Safe
    /// to call while other threads read; does nothing when the storage carries bytes already, and
    /// nothing for an empty dictionary.
    void keepEncoded(EncodedBytes bytes) const;

    bool operator==(const Dictionary& other) const;

  private:
    struct Storage;

    Storage& unshared();

    std::shared_ptr<Storage> storage_;
};

/// A property list in its message encoding: one opaque value of a message (platform/values/Cbor.h
/// writes it as an encoded item inside a byte string). Made from a value, which is then encoded
/// only when the message is, or from received bytes, which are decoded only when somebody unpacks
/// them.
class Packed {
  public:
    explicit Packed(Value value);
    explicit Packed(EncodedBytes bytes);

    /// The value it was made from, or null when it was made from bytes.
    const Value* value() const;
    /// The bytes it was made from; empty when it was made from a value.
    const EncodedBytes& bytes() const;

    bool operator==(const Packed& other) const;

  private:
    struct Content;

    std::shared_ptr<const Content> content_;
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
    Value(std::string value) : content_(std::make_shared<const std::string>(std::move(value))) {}
    Value(std::string_view value) : Value(std::string(value)) {}
    Value(const char* value) : Value(std::string(value)) {}
    Value(Uuid value) : content_(value) {}
    Value(Array value) : content_(std::move(value)) {}
    Value(Dictionary value) : content_(std::move(value)) {}
    Value(Packed value) : content_(std::move(value)) {}

    Kind kind() const;

    /// Each answers null, or none, when the value is of another kind. A pointer is good as long as
    /// this value is neither changed nor destroyed.
    const std::string* string() const;
    const Array* array() const;
    const Dictionary* dictionary() const;
    const Data* data() const;
    const Packed* packed() const;
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
    using String = std::shared_ptr<const std::string>;
    using Content = std::variant<bool, std::int64_t, std::uint64_t, double, Date, Data, String,
                                 Uuid, Array, Dictionary, Packed>;

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

}  // namespace platform
