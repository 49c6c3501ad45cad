// The texts of values for people.

#include <fmt/format.h>

#include <limits>

#include "platform/values/Value.h"

namespace platform {

namespace {

constexpr std::size_t kMaxDescription = 64 * 1024;
constexpr std::size_t kNoLimit = std::numeric_limits<std::size_t>::max() - 1;

/// Writes until the text is full: what lies behind that is not even walked.
class Describer {
  public:
    explicit Describer(std::size_t limit = kMaxDescription) : limit_(limit) {}

    std::string text;

    void add(const Value& value, bool quoted) {
        switch (value.kind()) {
            case Value::Kind::Boolean:
                text += *value.boolean() ? "true" : "false";
                break;
            case Value::Kind::Integer:
                addInteger(value);
                break;
            case Value::Kind::Real:
                append("{}", *value.real());
                break;
            case Value::Kind::Date:
                append("date({})", value.date()->secondsSince1970);
                break;
            case Value::Kind::Data:
                append("data({} bytes)", value.data()->bytes().size());
                break;
            case Value::Kind::Uuid:
                text += value.uuid()->string();
                break;
            case Value::Kind::Packed:
                addPacked(*value.packed());
                break;
            case Value::Kind::Array:
                add(*value.array());
                break;
            case Value::Kind::Dictionary:
                add(*value.dictionary());
                break;
            case Value::Kind::String:
                addString(*value.string(), quoted ? "\"" : "");
                break;
        }
    }

    void add(const Array& array) {
        text += '[';
        const char* separator = "";
        for (const Value& element : array) {
            if (isFull()) return;
            text += std::exchange(separator, ", ");
            add(element, true);
        }
        text += ']';
    }

    void add(const Dictionary& dictionary) {
        text += '{';
        const char* separator = "";
        for (const auto& [key, value] : dictionary) {
            if (isFull()) return;
            append("{}{}: ", std::exchange(separator, ", "), upToLimit(key));
            add(value, true);
        }
        text += '}';
    }

    std::string take() {
        if (isFull()) {
            text.resize(limit_);
            text += "...";
        }
        return std::move(text);
    }

  private:
    const std::size_t limit_;

    bool isFull() const { return text.size() > limit_; }

    std::string_view upToLimit(std::string_view string) const {
        return string.substr(0, limit_ + 1);
    }

    template <class... Arguments>
    void append(fmt::format_string<Arguments...> format, Arguments&&... arguments) {
        fmt::format_to(std::back_inserter(text), format, std::forward<Arguments>(arguments)...);
    }

    void addString(std::string_view string, const char* quote) {
        append("{}{}{}", quote, upToLimit(string), quote);
    }

    void addInteger(const Value& value) {
        if (auto integer = value.signedInteger())
            append("{}", *integer);
        else
            append("{}", *value.unsignedInteger());
    }

    void addPacked(const Packed& packed) {
        if (packed.value())
            add(*packed.value(), true);
        else
            append("packed({} bytes)", packed.bytes().bytes.size());
    }
};

}  // namespace

std::string describe(const Value& value) {
    Describer describer;
    describer.add(value, false);
    return describer.take();
}

std::string describe(const Dictionary& value) {
    Describer describer;
    describer.add(value);
    return describer.take();
}

std::string describe(const Array& value) {
    Describer describer;
    describer.add(value);
    return describer.take();
}

std::string describeWhole(const Dictionary& value) {
    Describer describer(kNoLimit);
    describer.add(value);
    return describer.take();
}

}  // namespace platform
