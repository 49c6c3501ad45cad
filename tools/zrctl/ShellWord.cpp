#include "tools/zrctl/ShellWord.h"

#include <fmt/core.h>

#include <string_view>

#include "tools/zrctl/Terminal.h"

namespace zrctl {

namespace {

constexpr std::string_view kPlain =
    "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789=./_:,@%+-";

std::string byBytes(const std::string& text) {
    std::string word = "$'";
    for (const char character : text) {
        const auto byte = static_cast<unsigned char>(character);
        const bool isHarmless =
            byte >= ' ' && byte < 0x7F && character != '\'' && character != '\\';
        word += isHarmless ? std::string(1, character) : fmt::format("\\{:03o}", byte);
    }
    return word + "'";
}

}  // namespace

std::string shellWord(const std::string& text) {
    if (terminal::safe(text) != text) return byBytes(text);
    if (!text.empty() && text.find_first_not_of(kPlain) == std::string::npos) return text;
    std::string word = "'";
    for (const char character : text)
        word += character == '\'' ? "'\\''" : std::string(1, character);
    return word + "'";
}

}  // namespace zrctl
