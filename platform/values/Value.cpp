#include "platform/values/Value.h"

#include <algorithm>
#include <cmath>

#include "platform/values/Utf8.h"

namespace platform {

namespace {

/// The years 1 to 9999, in seconds since 1970.
constexpr double kFirstStorableDate = -62135596800.0;
constexpr double kEndOfStorableDates = 253402300800.0;

/// Whether no other copy shares the storage, which its holder may then change.
template <class T>
bool isUnshared(const std::shared_ptr<T>& storage) {
    if (storage.use_count() != 1) return false;
    // The count alone orders nothing. Taking a reference and dropping it does: what another thread
    // read before it dropped the last other copy happens before what we write now.
    std::shared_ptr<T>(storage).reset();
    return true;
}

const std::shared_ptr<std::vector<Value>>& emptyArray() {
    static const auto empty = std::make_shared<std::vector<Value>>();
    return empty;
}

}  // namespace

Array::Array() : values_(emptyArray()) {}

Array::Array(std::initializer_list<Value> values)
    : values_(std::make_shared<std::vector<Value>>(values)) {}

Array::Array(std::vector<Value> values)
    : values_(std::make_shared<std::vector<Value>>(std::move(values))) {}

std::size_t Array::size() const {
    return values_->size();
}
const Value& Array::operator[](std::size_t index) const {
    return (*values_)[index];
}
const Value* Array::begin() const {
    return values_->data();
}
const Value* Array::end() const {
    return values_->data() + values_->size();
}
void Array::append(Value value) {
    unshared().push_back(std::move(value));
}
void Array::set(std::size_t index, Value value) {
    unshared()[index] = std::move(value);
}

void Array::remove(std::size_t index) {
    auto& values = unshared();
    values.erase(values.begin() + static_cast<std::ptrdiff_t>(index));
}

std::vector<Value>& Array::unshared() {
    if (!isUnshared(values_)) values_ = std::make_shared<std::vector<Value>>(*values_);
    return *values_;
}

bool Array::operator==(const Array& other) const {
    return values_ == other.values_ || *values_ == *other.values_;
}

struct Dictionary::Storage {
    std::vector<Entry> entries;  // sorted by key, keys unique
    std::atomic<const EncodedBytes*> encoded{nullptr};

    Storage() = default;
    explicit Storage(std::vector<Entry> sorted) : entries(std::move(sorted)) {}
    Storage(const Storage& other) : entries(other.entries) {}
    Storage& operator=(const Storage&) = delete;
    ~Storage() { dropEncoded(); }

    void dropEncoded() { delete encoded.exchange(nullptr); }

    std::vector<Entry>::iterator at(std::string_view key) {
        return std::ranges::lower_bound(entries, key, {}, &Entry::first);
    }
};

Dictionary::Dictionary() {
    static const auto empty = std::make_shared<Storage>();
    storage_ = empty;
}

Dictionary::Dictionary(std::initializer_list<Entry> entries)
    : storage_(std::make_shared<Storage>()) {
    for (const auto& [key, value] : entries) set(key, value);
}

std::optional<Dictionary> Dictionary::fromEntries(std::vector<Entry> entries) {
    auto strictlySorted = [&entries] {
        return std::ranges::adjacent_find(entries, std::ranges::greater_equal(), &Entry::first) ==
               entries.end();
    };
    // What encoders write is sorted already.
    if (!strictlySorted()) {
        std::ranges::sort(entries, {}, &Entry::first);
        if (!strictlySorted()) return std::nullopt;
    }
    Dictionary dictionary;
    if (!entries.empty()) dictionary.storage_ = std::make_shared<Storage>(std::move(entries));
    return dictionary;
}

std::size_t Dictionary::size() const {
    return storage_->entries.size();
}
const Dictionary::Entry* Dictionary::begin() const {
    return storage_->entries.data();
}
const Dictionary::Entry* Dictionary::end() const {
    return begin() + size();
}

const Value* Dictionary::find(std::string_view key) const {
    auto found = storage_->at(key);
    if (found == storage_->entries.end() || found->first != key) return nullptr;
    return &found->second;
}

void Dictionary::set(std::string_view key, Value value) {
    Storage& storage = unshared();
    auto found = storage.at(key);
    if (found != storage.entries.end() && found->first == key) {
        found->second = std::move(value);
    } else {
        storage.entries.emplace(found, key, std::move(value));
    }
}

void Dictionary::remove(std::string_view key) {
    if (!contains(key)) return;
    Storage& storage = unshared();
    storage.entries.erase(storage.at(key));
}

const EncodedBytes* Dictionary::encoded() const {
    return storage_->encoded.load(std::memory_order_acquire);
}

void Dictionary::keepEncoded(EncodedBytes bytes) const {
    // All empty dictionaries share their storage, which would keep the bytes' owner for ever.
    if (empty()) return;
    auto* kept = new EncodedBytes(std::move(bytes));
    const EncodedBytes* none = nullptr;
    if (!storage_->encoded.compare_exchange_strong(none, kept, std::memory_order_acq_rel))
        delete kept;
}

Dictionary::Storage& Dictionary::unshared() {
    if (isUnshared(storage_)) {
        storage_->dropEncoded();
    } else {
        storage_ = std::make_shared<Storage>(*storage_);
    }
    return *storage_;
}

bool Dictionary::operator==(const Dictionary& other) const {
    return storage_ == other.storage_ || storage_->entries == other.storage_->entries;
}

/// Either the value or the bytes.
struct Packed::Content {
    std::optional<Value> value;
    EncodedBytes bytes;
};

Packed::Packed(Value value)
    : content_(std::make_shared<const Content>(Content{std::move(value), {}})) {}
Packed::Packed(EncodedBytes bytes)
    : content_(std::make_shared<const Content>(Content{std::nullopt, std::move(bytes)})) {}

const Value* Packed::value() const {
    return content_->value ? &*content_->value : nullptr;
}
const EncodedBytes& Packed::bytes() const {
    return content_->bytes;
}

bool Packed::operator==(const Packed& other) const {
    return content_ == other.content_ ||
           (content_->value == other.content_->value && bytes().bytes == other.bytes().bytes);
}

Value::Kind Value::kind() const {
    static constexpr Kind kinds[] = {Kind::Boolean, Kind::Integer,    Kind::Integer, Kind::Real,
                                     Kind::Date,    Kind::Data,       Kind::String,  Kind::Uuid,
                                     Kind::Array,   Kind::Dictionary, Kind::Packed};
    return kinds[content_.index()];
}

const std::string* Value::string() const {
    const auto* shared = std::get_if<String>(&content_);
    return shared ? shared->get() : nullptr;
}

const Array* Value::array() const {
    return std::get_if<Array>(&content_);
}
const Dictionary* Value::dictionary() const {
    return std::get_if<Dictionary>(&content_);
}
const Data* Value::data() const {
    return std::get_if<Data>(&content_);
}
const Packed* Value::packed() const {
    return std::get_if<Packed>(&content_);
}

namespace {

template <class T, class Content>
std::optional<T> copied(const Content& content) {
    const T* held = std::get_if<T>(&content);
    return held ? std::optional<T>(*held) : std::nullopt;
}

}  // namespace

std::optional<bool> Value::boolean() const {
    return copied<bool>(content_);
}
std::optional<double> Value::real() const {
    return copied<double>(content_);
}
std::optional<Date> Value::date() const {
    return copied<Date>(content_);
}
std::optional<Uuid> Value::uuid() const {
    return copied<Uuid>(content_);
}
std::optional<std::int64_t> Value::signedInteger() const {
    return copied<std::int64_t>(content_);
}

std::optional<std::uint64_t> Value::unsignedInteger() const {
    if (auto large = copied<std::uint64_t>(content_)) return large;
    auto small = signedInteger();
    if (!small || *small < 0) return std::nullopt;
    return static_cast<std::uint64_t>(*small);
}

bool Value::isNumber() const {
    Kind k = kind();
    return k == Kind::Boolean || k == Kind::Integer || k == Kind::Real;
}

std::optional<std::int64_t> Value::numberAsInteger() const {
    if (auto value = boolean()) return *value ? 1 : 0;
    if (auto value = signedInteger()) return value;
    if (std::holds_alternative<std::uint64_t>(content_)) return INT64_MAX;
    auto value = real();
    if (!value) return std::nullopt;
    if (std::isnan(*value)) return 0;
    if (*value >= 0x1p63) return INT64_MAX;
    if (*value <= -0x1p63) return INT64_MIN;
    return static_cast<std::int64_t>(*value);
}

std::optional<std::uint64_t> Value::numberAsBits() const {
    if (auto large = copied<std::uint64_t>(content_)) return large;
    auto value = numberAsInteger();
    return value ? std::optional(static_cast<std::uint64_t>(*value)) : std::nullopt;
}

namespace {

/// Whether a real and an integer are the same number, without rounding the integer.
template <class Integer>
bool sameNumber(double real, Integer integer) {
    constexpr double limit = std::is_signed_v<Integer> ? 0x1p63 : 0x1p64;
    constexpr double least = std::is_signed_v<Integer> ? -0x1p63 : 0.0;
    return real >= least && real < limit && std::trunc(real) == real &&
           static_cast<Integer>(real) == integer;
}

struct NumberEquality {
    template <class A, class B>
    bool operator()(const A& a, const B& b) const {
        if constexpr (!std::is_arithmetic_v<A> || !std::is_arithmetic_v<B>) {
            return false;
        } else if constexpr (std::same_as<A, B>) {
            return a == b;
        } else if constexpr (std::same_as<A, bool>) {
            return (*this)(std::int64_t{a}, b);
        } else if constexpr (std::same_as<B, bool>) {
            return (*this)(a, std::int64_t{b});
        } else if constexpr (std::same_as<A, double>) {
            return sameNumber(a, b);
        } else if constexpr (std::same_as<B, double>) {
            return sameNumber(b, a);
        } else {
            return std::cmp_equal(a, b);
        }
    }
};

}  // namespace

bool Value::operator==(const Value& other) const {
    if (isNumber() || other.isNumber())
        return std::visit(NumberEquality{}, content_, other.content_);
    if (const auto* text = string()) return other.string() && *text == *other.string();
    return content_ == other.content_;
}

bool equalsTrue(const Value& value) {
    return value == Value(true);
}
bool equalsFalse(const Value& value) {
    return value == Value(false);
}

namespace {

/// Whether text holds only characters of XML 1.0: no control character but tab, line feed and
/// carriage return, not U+FFFE or U+FFFF, and nothing that is not UTF-8.
bool isXmlText(std::string_view text) {
    for (std::size_t i = 0; i < text.size(); ++i) {
        auto byte = static_cast<unsigned char>(text[i]);
        if (byte < 0x20 && byte != '\t' && byte != '\n' && byte != '\r') return false;
        if (byte == 0xEF && text.substr(i + 1, 1) == "\xBF") {
            auto last = text.substr(i + 2, 1);
            if (last == "\xBE" || last == "\xBF") return false;
        }
    }
    return isValidUtf8(text);
}

bool isPropertyListWithin(const Value& value, int levels) {
    switch (value.kind()) {
        case Value::Kind::Uuid:
        case Value::Kind::Packed:
            return false;
        case Value::Kind::String:
            return isXmlText(*value.string());
        case Value::Kind::Date: {
            double seconds = value.date()->secondsSince1970;
            return seconds >= kFirstStorableDate && seconds < kEndOfStorableDates;
        }
        case Value::Kind::Array:
            return levels > 0 &&
                   std::ranges::all_of(*value.array(), [levels](const Value& element) {
                       return isPropertyListWithin(element, levels - 1);
                   });
        case Value::Kind::Dictionary:
            return levels > 0 && std::ranges::all_of(
                                     *value.dictionary(), [levels](const Dictionary::Entry& entry) {
                                         return isXmlText(entry.first) &&
                                                isPropertyListWithin(entry.second, levels - 1);
                                     });
        default:
            return true;
    }
}

}  // namespace

bool isPropertyList(const Value& value, int levels) {
    return isPropertyListWithin(value, levels);
}

std::size_t countValues(const Value& value, std::size_t limit) {
    std::size_t count = 1;
    auto add = [&](const Value& element) {
        if (count <= limit) count += countValues(element, limit - count);
    };
    if (const Array* array = value.array()) {
        for (const Value& element : *array) add(element);
    } else if (const Dictionary* dictionary = value.dictionary()) {
        for (const auto& [key, element] : *dictionary) add(element);
    }
    return count;
}

}  // namespace platform
