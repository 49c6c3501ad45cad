#include "platform/plist/PropertyList.h"

#include <fmt/format.h>
#include <locale.h>
#include <plist/plist.h>

#include <algorithm>
#include <bit>
#include <cmath>
#include <cstdlib>
#include <memory>
#include <vector>

#include "platform/plist/BinaryPropertyListCheck.h"
#include "platform/plist/PropertyListCost.h"
#include "platform/plist/XmlPropertyListCheck.h"
#include "platform/system/Files.h"
#include "platform/values/Utf8.h"

namespace platform {

namespace {

struct PlistFree {
    void operator()(plist_t node) const { ::plist_free(node); }
};
struct Free {
    void operator()(void* memory) const { std::free(memory); }
};
using OwnedNode = std::unique_ptr<std::remove_pointer_t<plist_t>, PlistFree>;
template <class T>
using Allocated = std::unique_ptr<T, Free>;

Error failure(std::string_view what) {
    return {"PropertyList", 1, fmt::format("invalid property list: {}", what)};
}

/// libplist reads and writes reals by the locale of the program, which may not be ours.
class NumbersInC {
  public:
    NumbersInC() : before_(::uselocale(locale())) {}
    NumbersInC(const NumbersInC&) = delete;
    ~NumbersInC() { ::uselocale(before_); }

  private:
    static locale_t locale() {
        static const locale_t c = ::newlocale(LC_ALL_MASK, "C", nullptr);
        return c;
    }
    locale_t before_;
};

/// A scalar for which libplist has no maker that keeps all its bits.
plist_t nodeOfBinary(unsigned char marker, std::size_t payloadSize, std::uint64_t payload) {
    std::string bytes = "bplist00";
    bytes += static_cast<char>(marker);
    bytes.append(payloadSize - 8, '\0');
    for (int shift = 56; shift >= 0; shift -= 8) bytes += static_cast<char>(payload >> shift);
    std::size_t table = bytes.size();
    bytes += static_cast<char>(8);  // where the scalar is
    bytes.append(32, '\0');
    std::size_t trailer = bytes.size() - 32;
    bytes[trailer + 6] = 1;   // size of an offset
    bytes[trailer + 7] = 1;   // size of a reference
    bytes[trailer + 15] = 1;  // number of objects
    bytes[trailer + 31] = static_cast<char>(table);
    plist_t node = nullptr;
    ::plist_from_bin(bytes.data(), static_cast<std::uint32_t>(bytes.size()), &node);
    return node;
}

/// Builds a Value from libplist's nodes. Each step answers nothing after it has noted what is
/// wrong.
class Reader {
  public:
    explicit Reader(const PropertyListCheck& check) : check_(check) {}

    std::optional<Value> readRoot(plist_t root) {
        auto value = read(root, 1);
        if (value && entries_ != check_.entries) return fail("a key twice in a dictionary");
        return value;
    }

    const char* problem() const { return problem_; }

  private:
    std::optional<Value> read(plist_t node, int depth) {
        switch (::plist_get_node_type(node)) {
            case PLIST_BOOLEAN: {
                std::uint8_t truth = 0;
                ::plist_get_bool_val(node, &truth);
                return Value(truth != 0);
            }
            case PLIST_UINT:
                return readInteger(node);
            case PLIST_REAL: {
                double real = 0;
                ::plist_get_real_val(node, &real);
                return Value(real);
            }
            case PLIST_DATE:
                return readDate();
            case PLIST_STRING: {
                std::uint64_t length = 0;
                const char* text = ::plist_get_string_ptr(node, &length);
                return readText(text ? std::string_view(text, length) : std::string_view());
            }
            case PLIST_DATA: {
                std::uint64_t length = 0;
                const char* data = ::plist_get_data_ptr(node, &length);
                return Value(Data(data ? std::string(data, length) : std::string()));
            }
            case PLIST_ARRAY:
                return readArray(node, depth);
            case PLIST_DICT:
                return readDictionary(node, depth);
            default:
                return fail("an object of an unsupported kind");
        }
    }

    std::nullopt_t fail(const char* problem) {
        problem_ = problem;
        return std::nullopt;
    }

    std::optional<Value> readInteger(plist_t node) {
        std::uint64_t number = 0;
        ::plist_get_uint_val(node, &number);
        if (number <= INT64_MAX) return Value(number);
        // Negative, or too large to be: no accessor tells, but the two are not the same.
        OwnedNode negative(::plist_new_uint(number));
        if (::plist_compare_node_value(node, negative.get()))
            return Value(static_cast<std::int64_t>(number));
        return Value(number);
    }

    std::optional<Value> readDate() {
        if (nextDate_ == check_.dates.size()) return fail("an unreadable date");
        Value date(check_.dates[nextDate_++]);
        if (!isPropertyList(date)) return fail("a date out of range");
        return date;
    }

    std::optional<Value> readText(std::string_view text) {
        if (!isText(text)) return std::nullopt;
        return Value(text);
    }

    bool isText(std::string_view text) {
        if (!isValidUtf8(text)) fail("a string that is not UTF-8");
        if (text.find('\0') != std::string_view::npos) fail("a string with a NUL");
        return problem_ == nullptr;
    }

    std::optional<Value> readArray(plist_t node, int depth) {
        if (depth > kMaxPropertyListFileDepth) return fail("nested too deep");
        plist_array_iter raw = nullptr;
        ::plist_array_new_iter(node, &raw);
        Allocated<void> iterator(raw);
        std::vector<Value> values;
        values.reserve(::plist_array_get_size(node));
        for (;;) {
            plist_t element = nullptr;
            ::plist_array_next_item(node, raw, &element);
            if (!element) break;
            auto value = read(element, depth + 1);
            if (!value) return std::nullopt;
            values.push_back(std::move(*value));
        }
        return Value(Array(std::move(values)));
    }

    std::optional<Value> readDictionary(plist_t node, int depth) {
        if (depth > kMaxPropertyListFileDepth) return fail("nested too deep");
        plist_dict_iter raw = nullptr;
        ::plist_dict_new_iter(node, &raw);
        Allocated<void> iterator(raw);
        std::vector<Dictionary::Entry> entries;
        entries.reserve(::plist_dict_get_size(node));
        for (;;) {
            char* rawKey = nullptr;
            plist_t element = nullptr;
            ::plist_dict_next_item(node, raw, &rawKey, &element);
            Allocated<char> key(rawKey);
            if (!element || !rawKey) break;
            if (!isText(rawKey)) return std::nullopt;
            auto value = read(element, depth + 1);
            if (!value) return std::nullopt;
            entries.emplace_back(rawKey, std::move(*value));
        }
        entries_ += entries.size();
        auto dictionary = Dictionary::fromEntries(std::move(entries));
        if (!dictionary) return fail("a dictionary with the same key twice");
        return Value(std::move(*dictionary));
    }

    const PropertyListCheck& check_;
    std::size_t nextDate_ = 0;
    std::size_t entries_ = 0;
    const char* problem_ = nullptr;
};

plist_t nodeOf(const Value& value);

plist_t nodeOfInteger(const Value& value) {
    if (auto small = value.signedInteger())
        return ::plist_new_uint(static_cast<std::uint64_t>(*small));
    return nodeOfBinary(0x14, 16, *value.unsignedInteger());
}

plist_t nodeOfDate(Date date) {
    double seconds = std::floor(date.secondsSince1970) - kPropertyListReferenceDate;
    return nodeOfBinary(0x33, 8, std::bit_cast<std::uint64_t>(seconds));
}

plist_t nodeOfArray(const Array& array) {
    plist_t node = ::plist_new_array();
    for (const Value& element : array) ::plist_array_append_item(node, nodeOf(element));
    return node;
}

plist_t nodeOfDictionary(const Dictionary& dictionary) {
    plist_t node = ::plist_new_dict();
    for (const auto& [key, value] : dictionary)
        ::plist_dict_set_item(node, key.string().c_str(), nodeOf(value));
    return node;
}

/// libplist's node of a value that is a property list.
plist_t nodeOf(const Value& value) {
    switch (value.kind()) {
        case Value::Kind::Boolean:
            return ::plist_new_bool(*value.boolean());
        case Value::Kind::Integer:
            return nodeOfInteger(value);
        case Value::Kind::Real:
            return ::plist_new_real(*value.real());
        case Value::Kind::Date:
            return nodeOfDate(*value.date());
        case Value::Kind::Data:
            return ::plist_new_data(value.data()->bytes().data(), value.data()->bytes().size());
        case Value::Kind::String:
            return ::plist_new_string(value.string()->string().c_str());
        case Value::Kind::Array:
            return nodeOfArray(*value.array());
        case Value::Kind::Dictionary:
            return nodeOfDictionary(*value.dictionary());
        case Value::Kind::Uuid:
        case Value::Kind::Packed:
            break;
    }
    return nullptr;
}

/// What the bytes of a file hold.
Result<Value> parsed(const Result<std::string>& bytes, const std::string& file) {
    if (!bytes) return bytes.error();
    auto value = parsePropertyList(*bytes);
    if (value) return value;
    Error error = value.error();
    error.text = fmt::format("{}: {}", file, error.text);
    return error;
}

}  // namespace

Result<Value> parsePropertyList(std::string_view bytes) {
    if (bytes.starts_with("\xEF\xBB\xBF")) bytes.remove_prefix(3);
    if (bytes.empty()) return failure("empty");
    if (bytes.size() > UINT32_MAX) return failure("too large");
    bool isBinary = bytes.starts_with("bplist");
    const PropertyListCheck check =
        isBinary ? checkBinaryPropertyList(bytes) : checkXmlPropertyList(bytes);
    if (check.problem) return failure(check.problem);

    NumbersInC numbers;
    plist_t raw = nullptr;
    auto size = static_cast<std::uint32_t>(bytes.size());
    (isBinary ? ::plist_from_bin : ::plist_from_xml)(bytes.data(), size, &raw);
    OwnedNode root(raw);
    if (!root) return failure("malformed");
    Reader reader(check);
    auto value = reader.readRoot(root.get());
    if (!value) return failure(reader.problem());
    return std::move(*value);
}

Result<Value> readPropertyListFile(const std::string& path, std::size_t limit) {
    return parsed(readFile(path, limit), path);
}

Result<Value> readPropertyListBeneath(int dirfd, const std::string& name, std::size_t limit) {
    return parsed(readFileBeneath(dirfd, name, limit), name);
}

Result<std::string> writeXmlPropertyList(const Value& value, std::size_t limit) {
    if (!isPropertyList(value, kMaxPropertyListFileDepth))
        return Error{"PropertyList", 2, "not a property list"};
    // Before anything is built: objects, and texts, which may grow fivefold. What tags and
    // indentation add to them is bounded and only known in the end.
    const Error tooLarge{"PropertyList", 3, "too large for a property list"};
    const PropertyListCost cost = costOfPropertyList(value);
    if (!cost.isReadable() || cost.bytes > limit) return tooLarge;
    OwnedNode root(nodeOf(value));
    NumbersInC numbers;
    char* text = nullptr;
    std::uint32_t length = 0;
    ::plist_to_xml(root.get(), &text, &length);
    Allocated<char> owned(text);
    if (!text) return Error{"PropertyList", 4, "could not be written as a property list"};
    if (length > limit) return tooLarge;
    return std::string(text, length);
}

}  // namespace platform
