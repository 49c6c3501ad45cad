#include "tools/zrctl/Rules.h"

#include <fmt/core.h>

#include <optional>
#include <string_view>

#include "platform/values/Utf8.h"
#include "platform/values/Value.h"

using platform::Array;
using platform::Dictionary;
using platform::Error;
using platform::Result;
using platform::Value;

namespace zrctl {

namespace {

Error ruleError(std::string text) {
    return {"zrctl", 0, std::move(text)};
}

Value valueOf(std::string_view text) {
    if (text == "true") return true;
    if (text == "false") return false;
    return text;
}

void addPair(Dictionary& pairs, std::string_view key, Value value) {
    const Value* existing = pairs.find(key);
    if (!existing) {
        pairs.set(key, std::move(value));
        return;
    }
    Array values = existing->array() ? *existing->array() : Array{*existing};
    values.append(std::move(value));
    pairs.set(key, std::move(values));
}

/// What is wrong with KEY<=PATTERN. No key ends so: the operator's own "=" was left out, and the
/// rule would match nothing.
std::optional<Error> misplacedOperator(const std::string& text) {
    const std::size_t split = text.find('=');
    if (split == std::string::npos || split == 0) return std::nullopt;
    const std::size_t last = split - 1;
    if (text[last] != '<' && text[last] != '>') return std::nullopt;
    return ruleError(fmt::format("\"{}\": an operator follows the \"=\", as in {}={}", text,
                                 text.substr(0, last), text.substr(last)));
}

std::string textOf(const Value& pattern) {
    if (platform::equalsTrue(pattern)) return "true";
    if (platform::equalsFalse(pattern)) return "false";
    const auto* text = pattern.string();
    if (!text) return describe(pattern);
    // The words would be read as booleans; with the operator they are the same pattern.
    std::string words = text->string();
    if (*text == "true" || *text == "false") words.insert(0, 1, '=');
    return words;
}

}  // namespace

Result<Dictionary> parsePairs(const std::vector<std::string>& texts) {
    Dictionary pairs;
    for (const std::string& text : texts) {
        if (!platform::isValidUtf8(text))
            return ruleError(fmt::format("\"{}\" is not UTF-8 text", text));
        const std::size_t split = text.find('=');
        if (split == std::string::npos || split == 0)
            return ruleError(fmt::format("\"{}\" is not of the form KEY=...", text));
        if (!platform::isPropertyList(text))
            return ruleError(fmt::format("\"{}\" has control characters", text));
        addPair(pairs, text.substr(0, split), valueOf(std::string_view(text).substr(split + 1)));
    }
    return pairs;
}

Result<Dictionary> parseRules(const std::vector<std::string>& texts) {
    for (const std::string& text : texts)
        if (auto error = misplacedOperator(text)) return *error;
    return parsePairs(texts);
}

std::vector<std::string> ruleTexts(const Dictionary& rules) {
    std::vector<std::string> texts;
    for (const auto& [key, pattern] : rules) {
        const Array* alternatives = pattern.array();
        if (!alternatives || alternatives->empty()) {
            texts.push_back(key.string() + '=' + textOf(pattern));
            continue;
        }
        for (const Value& alternative : *alternatives)
            texts.push_back(key.string() + '=' + textOf(alternative));
    }
    if (texts.empty()) texts.emplace_back();
    return texts;
}

Dictionary merged(Dictionary base, const Dictionary& over) {
    for (const auto& [key, value] : over) base.set(key, value);
    return base;
}

}  // namespace zrctl
