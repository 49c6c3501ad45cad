#include "platform/values/Value.h"

#include <algorithm>
#include <cmath>

#include "platform/values/Decoded.h"
#include "platform/values/Utf8.h"

namespace platform {

namespace {

/// The years 1 to 9999, in seconds since 1970.
constexpr double kFirstStorableDate = -62135596800.0;
constexpr double kEndOfStorableDates = 253402300800.0;

std::string_view keyOf(const Dictionary::Entry& entry) {
    return entry.first.view();
}

}  // namespace

class Array::Built final : public Memory {
  public:
    explicit Built(std::vector<Value> elements)
        : Memory(Use::Changed), values(std::move(elements)) {}

    std::vector<Value> values;
};

Array::Array(std::initializer_list<Value> values) : Array(std::vector<Value>(values)) {}

Array::Array(std::vector<Value> values) {
    if (values.empty()) return;
    auto* built = new Built(std::move(values));
    *this = Array(Hold(built), built->values.data(), built->values.size());
}

void Array::append(Value value) {
    change([&](std::vector<Value>& values) { values.push_back(std::move(value)); });
}
void Array::set(std::size_t index, Value value) {
    change([&](std::vector<Value>& values) { values[index] = std::move(value); });
}
void Array::remove(std::size_t index) {
    change([&](std::vector<Value>& values) {
        values.erase(values.begin() + static_cast<std::ptrdiff_t>(index));
    });
}

template <class Change>
void Array::change(Change change) {
    // What was decoded is held by its message's memory, and never changed.
    auto* built = memory_.mayChange() ? static_cast<Built*>(memory_.get()) : nullptr;
    if (!built) {
        built = new Built(std::vector<Value>(begin(), end()));
        memory_ = Hold(built);
    }
    change(built->values);
    values_ = built->values.data();
    size_ = built->values.size();
}

bool Array::operator==(const Array& other) const {
    return values_ == other.values_ || std::ranges::equal(*this, other);
}

class Dictionary::Built final : public Memory {
  public:
    explicit Built(std::vector<Entry> sorted) : Memory(Use::Changed), entries(std::move(sorted)) {
        changed();
    }
    ~Built() override { dropEncoded(); }

    void dropEncoded() { delete encoded.exchange(nullptr); }
    void changed() { nodes = {entries.data(), entries.size(), {}}; }
    std::vector<Entry>::iterator at(std::string_view key) {
        return std::ranges::lower_bound(entries, key, {}, keyOf);
    }

    std::vector<Entry> entries;
    Nodes nodes;
    std::atomic<const EncodedBytes*> encoded{nullptr};
};

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
    for (const auto& [key, value] : entries) set(key, value);
}

std::optional<Dictionary> Dictionary::fromEntries(std::vector<Entry> entries) {
    auto strictlySorted = [&entries] {
        return std::ranges::adjacent_find(entries, std::ranges::greater_equal(), keyOf) ==
               entries.end();
    };
    // What encoders write is sorted already.
    if (!strictlySorted()) {
        std::ranges::sort(entries, {}, keyOf);
        if (!strictlySorted()) return std::nullopt;
    }
    if (entries.empty()) return Dictionary();
    auto* built = new Built(std::move(entries));
    return Dictionary(Hold(built), &built->nodes);
}

const Value* Dictionary::find(std::string_view key) const {
    const Entry* found = std::ranges::lower_bound(begin(), end(), key, {}, keyOf);
    return found != end() && found->first == key ? &found->second : nullptr;
}

void Dictionary::set(std::string_view key, Value value) {
    Built& built = unshared();
    const auto found = built.at(key);
    if (found != built.entries.end() && found->first == key) {
        found->second = std::move(value);
    } else {
        built.entries.emplace(found, key, std::move(value));
    }
    built.changed();
}

void Dictionary::remove(std::string_view key) {
    if (!contains(key)) return;
    Built& built = unshared();
    built.entries.erase(built.at(key));
    built.changed();
}

std::optional<EncodedBytes> Dictionary::encoded() const {
    if (!nodes_) return std::nullopt;
    if (!nodes_->encoded.empty())
        return EncodedBytes{static_cast<Decoded*>(memory_.get())->bytes(), nodes_->encoded};
    if (memory_.get()->use() == Memory::Use::Fixed) return std::nullopt;
    const auto* kept = static_cast<Built*>(memory_.get())->encoded.load(std::memory_order_acquire);
    return kept ? std::optional(*kept) : std::nullopt;
}

void Dictionary::keepEncoded(EncodedBytes bytes) const {
    if (empty() || memory_.get()->use() == Memory::Use::Fixed) return;
    auto* kept = new EncodedBytes(std::move(bytes));
    const EncodedBytes* none = nullptr;
    if (!static_cast<Built*>(memory_.get())
             ->encoded.compare_exchange_strong(none, kept, std::memory_order_acq_rel))
        delete kept;
}

Dictionary::Built& Dictionary::unshared() {
    auto* built = memory_.mayChange() ? static_cast<Built*>(memory_.get()) : nullptr;
    if (built) {
        built->dropEncoded();
    } else {
        built = new Built(std::vector<Entry>(begin(), end()));
        *this = Dictionary(Hold(built), &built->nodes);
    }
    return *built;
}

bool Dictionary::operator==(const Dictionary& other) const {
    return nodes_ == other.nodes_ || std::ranges::equal(*this, other);
}

class Packed::Made final : public Memory {
  public:
    explicit Made(Value made) : Memory(Use::Fixed), value(std::move(made)) {}

    const Value value;
};

Packed::Packed(Value value) : bytes_(Hold(new Made(std::move(value))), {}) {}

Packed::Packed(const EncodedBytes& bytes)
    : bytes_(Hold(new Decoded(bytes.owner)), bytes.bytes.empty() ? "" : bytes.bytes) {}

const Value* Packed::value() const {
    return bytes_.view().data() ? nullptr : &static_cast<Made*>(bytes_.memory())->value;
}

EncodedBytes Packed::bytes() const {
    if (value()) return {};
    return {static_cast<Decoded*>(bytes_.memory())->bytes(), bytes_.view()};
}

bool Packed::operator==(const Packed& other) const {
    if (value() && other.value()) return *value() == *other.value();
    return !value() && !other.value() && bytes_.view() == other.bytes_.view();
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
    return content_ == other.content_;
}

bool equalsTrue(const Value& value) {
    return value == Value(true);
}
bool equalsFalse(const Value& value) {
    return value == Value(false);
}

namespace {

bool isXmlText(std::string_view text) {
    return textFault(text) == TextFault::None;
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

namespace {

Value detachedValue(const Value& value) {
    if (const Text* text = value.string()) return text->view();
    if (const Data* data = value.data()) return Data(data->bytes());
    if (const Dictionary* dictionary = value.dictionary()) return detached(*dictionary);
    if (const Array* array = value.array()) {
        std::vector<Value> values;
        values.reserve(array->size());
        for (const Value& element : *array) values.push_back(detachedValue(element));
        return Array(std::move(values));
    }
    if (const Packed* packed = value.packed(); packed && !packed->value()) {
        auto own = std::make_shared<const std::string>(packed->bytes().bytes);
        return Packed(EncodedBytes{own, *own});
    }
    return value;
}

}  // namespace

Dictionary detached(const Dictionary& value) {
    std::vector<Dictionary::Entry> entries;
    entries.reserve(value.size());
    for (const auto& [key, element] : value)
        entries.emplace_back(Text(key.view()), detachedValue(element));
    return *Dictionary::fromEntries(std::move(entries));
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
