#include "tools/zrctl/Json.h"

#include <openssl/evp.h>
#include <time.h>

#include <cmath>
#include <nlohmann/json.hpp>

using nlohmann::json;
using platform::Value;

namespace zrctl {

namespace {

std::string base64(std::string_view bytes) {
    std::string text((bytes.size() + 2) / 3 * 4 + 1, '\0');  // the encoder adds a NUL
    const int size = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(text.data()),
                                     reinterpret_cast<const unsigned char*>(bytes.data()),
                                     static_cast<int>(bytes.size()));
    text.resize(static_cast<std::size_t>(size));
    return text;
}

json toJson(const Value& value);

json integerToJson(const Value& value) {
    if (const auto integer = value.signedInteger()) return *integer;
    return *value.unsignedInteger();
}

json arrayToJson(const platform::Array& array) {
    json result = json::array();
    for (const Value& element : array) result.push_back(toJson(element));
    return result;
}

json dictionaryToJson(const platform::Dictionary& dictionary) {
    json result = json::object();
    for (const auto& [key, value] : dictionary) result[key] = toJson(value);
    return result;
}

json toJson(const Value& value) {
    switch (value.kind()) {
        case Value::Kind::Boolean:
            return *value.boolean();
        case Value::Kind::Integer:
            return integerToJson(value);
        case Value::Kind::Real:
            return *value.real();
        case Value::Kind::Date:
            return dateText(*value.date());
        case Value::Kind::Data:
            return base64(value.data()->bytes());
        case Value::Kind::String:
            return value.string()->string();
        case Value::Kind::Uuid:
            return value.uuid()->string();
        case Value::Kind::Array:
            return arrayToJson(*value.array());
        case Value::Kind::Dictionary:
            return dictionaryToJson(*value.dictionary());
        case Value::Kind::Packed:
            return describe(value);
    }
    return nullptr;
}

}  // namespace

std::string jsonText(const Value& value) {
    return toJson(value).dump(2, ' ', false, json::error_handler_t::replace) + '\n';
}

std::string dateText(platform::Date date) {
    const double seconds = std::floor(date.secondsSince1970);
    tm calendar{};
    // Ten thousand years either way: far from overflow, and all that has an ISO 8601 text.
    constexpr double kLimit = 3.2e11;
    if (std::abs(seconds) < kLimit) {
        const auto time = static_cast<time_t>(seconds);
        char text[64];
        if (gmtime_r(&time, &calendar) &&
            strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", &calendar) > 0)
            return text;
    }
    return describe(Value(date.secondsSince1970));
}

}  // namespace zrctl
