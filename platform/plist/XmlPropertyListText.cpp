#include "platform/plist/XmlPropertyListText.h"

#include <array>
#include <charconv>
#include <chrono>
#include <cstdint>

namespace platform {

namespace {

/// Reads all of the text as a number.
template <class Number, class... Form>
std::optional<Number> numberOf(std::string_view text, Form... form) {
    Number number{};
    const char* end = text.data() + text.size();
    auto [stop, error] = std::from_chars(text.data(), end, number, form...);
    if (error != std::errc() || stop != end) return std::nullopt;
    return number;
}

}  // namespace

bool isXmlInteger(std::string_view text) {
    bool isNegative = text.starts_with('-');
    if (isNegative || text.starts_with('+')) text.remove_prefix(1);
    int base = text.starts_with("0x") || text.starts_with("0X") ? 16 : 10;
    if (base == 16) text.remove_prefix(2);
    if (base == 10 && text.size() > 1 && text.front() == '0') return false;
    auto number = numberOf<std::uint64_t>(text, base);
    return number && (!isNegative || *number <= std::uint64_t{1} << 63);
}

bool isXmlReal(std::string_view text) {
    if (text.starts_with('+')) {
        text.remove_prefix(1);
        if (text.starts_with('-')) return false;
    }
    return numberOf<double>(text).has_value();
}

bool isXmlData(std::string_view text) {
    std::size_t digits = 0;
    std::size_t padding = 0;
    for (char c : text) {
        if (c == ' ' || c == '\t' || c == '\r' || c == '\n') continue;
        bool isDigit = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') ||
                       c == '+' || c == '/';
        if (c == '=') {
            ++padding;
        } else if (isDigit && padding == 0) {
            ++digits;
        } else {
            return false;
        }
    }
    return padding <= 2 && (digits + padding) % 4 == 0;
}

std::optional<Date> dateOfXml(std::string_view text) {
    constexpr std::string_view kEnds = "--T::Z";
    constexpr std::array<unsigned, 6> kMost = {9999, 12, 31, 23, 59, 59};
    std::array<unsigned, 6> fields{};
    for (std::size_t i = 0; i < fields.size(); ++i) {
        std::size_t length = text.find(kEnds[i]);
        if (length == std::string_view::npos) return std::nullopt;
        auto field = numberOf<unsigned>(text.substr(0, length));
        if (!field || *field > kMost[i]) return std::nullopt;
        fields[i] = *field;
        text.remove_prefix(length + 1);
    }
    std::chrono::year_month_day day(std::chrono::year(static_cast<int>(fields[0])),
                                    std::chrono::month(fields[1]), std::chrono::day(fields[2]));
    if (!day.ok() || !text.empty()) return std::nullopt;
    std::chrono::sys_seconds moment = std::chrono::sys_days(day) + std::chrono::hours(fields[3]) +
                                      std::chrono::minutes(fields[4]) +
                                      std::chrono::seconds(fields[5]);
    return Date{static_cast<double>(moment.time_since_epoch().count())};
}

}  // namespace platform
