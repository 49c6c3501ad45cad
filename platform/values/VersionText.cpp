#include "platform/values/VersionText.h"

#include <algorithm>

namespace platform {

namespace {

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

/// Takes the run of digits off the front of `text`; answers it without its leading zeros.
std::string_view takeNumber(std::string_view& text) {
    std::size_t length = std::ranges::find_if_not(text, isDigit) - text.begin();
    std::string_view number = text.substr(0, length);
    text.remove_prefix(length);
    number.remove_prefix(std::min(number.find_first_not_of('0'), number.size()));
    return number;
}

int compare(std::size_t a, std::size_t b) {
    return a < b ? -1 : a > b ? 1 : 0;
}

int compareNumbers(std::string_view a, std::string_view b) {
    if (int byLength = compare(a.size(), b.size())) return byLength;
    int order = a.compare(b);
    return order < 0 ? -1 : order > 0 ? 1 : 0;
}

}  // namespace

int compareVersionString(std::string_view receiver, std::string_view other) {
    while (!receiver.empty() && !other.empty()) {
        if (isDigit(receiver.front()) && isDigit(other.front())) {
            if (int order = compareNumbers(takeNumber(receiver), takeNumber(other))) return order;
            continue;
        }
        auto a = static_cast<unsigned char>(receiver.front());
        auto b = static_cast<unsigned char>(other.front());
        if (a != b) return compare(a, b);
        receiver.remove_prefix(1);
        other.remove_prefix(1);
    }
    return compare(receiver.size(), other.size());
}

std::optional<std::string> canonicalVersionString(std::string_view text, std::size_t limit) {
    std::string form;
    while (!text.empty()) {
        if (!isDigit(text.front())) {
            form += text.front();
            text.remove_prefix(1);
        } else {
            const std::string_view number = takeNumber(text);
            form += number.empty() ? "0" : number;
        }
        if (form.size() > limit) return std::nullopt;
    }
    return form;
}

}  // namespace platform
