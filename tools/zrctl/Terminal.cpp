#include "tools/zrctl/Terminal.h"

#include <fmt/core.h>
#include <wchar.h>

#include <clocale>
#include <cwchar>

namespace zrctl::terminal {

namespace {

struct Character {
    wchar_t code;
    std::size_t size;  // bytes
    bool valid;
};

/// The first character of a text that is not empty.
Character firstCharacter(std::string_view text) {
    std::mbstate_t state{};
    wchar_t code = 0;
    const std::size_t size = std::mbrtowc(&code, text.data(), text.size(), &state);
    if (size == 0) return {L'\0', 1, true};
    if (size > text.size()) return {static_cast<unsigned char>(text[0]), 1, false};
    return {code, size, true};
}

bool isHarmless(wchar_t code) {
    const bool control = code < 0x20 || (code >= 0x7F && code <= 0x9F);
    const bool separator = code == 0x2028 || code == 0x2029;
    const bool directional = code == 0x061C || code == 0x200E || code == 0x200F ||
                             (code >= 0x202A && code <= 0x202E) ||
                             (code >= 0x2066 && code <= 0x2069);
    return !control && !separator && !directional && wcwidth(code) >= 0;
}

}  // namespace

void useUtf8() {
    std::setlocale(LC_CTYPE, "C.UTF-8");
}

std::string safe(std::string_view text) {
    std::string result;
    while (!text.empty()) {
        const Character character = firstCharacter(text);
        if (!character.valid)
            result += fmt::format("\\x{{{:x}}}", static_cast<unsigned>(character.code));
        else if (!isHarmless(character.code))
            result += fmt::format("\\u{{{:x}}}", static_cast<unsigned>(character.code));
        else
            result += text.substr(0, character.size);
        text.remove_prefix(character.size);
    }
    return result;
}

std::size_t width(const std::string& text) {
    std::size_t columns = 0;
    for (std::string_view rest = text; !rest.empty();) {
        const Character character = firstCharacter(rest);
        const int wide = wcwidth(character.code);
        columns += wide > 0 ? static_cast<std::size_t>(wide) : 0;
        rest.remove_prefix(character.size);
    }
    return columns;
}

}  // namespace zrctl::terminal
