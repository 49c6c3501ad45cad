#include "tools/zrctl/Rules.h"

#include <fmt/core.h>

#include <string_view>

#include "platform/PropertyList.h"
#include "platform/Utf8.h"

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

Value pattern(std::string_view text) {
    if (text == "true") return true;
    if (text == "false") return false;
    return text;
}

void addRule(Dictionary& rules, std::string_view key, Value value) {
    const Value* existing = rules.find(key);
    if (!existing) {
        rules.set(key, std::move(value));
        return;
    }
    Array alternatives = existing->array() ? *existing->array() : Array{*existing};
    alternatives.append(std::move(value));
    rules.set(key, std::move(alternatives));
}

}  // namespace

Result<Dictionary> parseRules(const std::vector<std::string>& texts) {
    Dictionary rules;
    for (const std::string& text : texts) {
        if (!platform::isValidUtf8(text))
            return ruleError(fmt::format("\"{}\" is not UTF-8 text", text));
        const std::size_t split = text.find('=');
        if (split == std::string::npos || split == 0)
            return ruleError(fmt::format("\"{}\" is not of the form KEY=PATTERN", text));
        const std::string_view key = std::string_view(text).substr(0, split);
        // No key ends so: this is an operator whose "=" was left out, which would match nothing.
        if (key.back() == '<' || key.back() == '>')
            return ruleError(fmt::format("\"{}\": an operator follows the \"=\", as in {}={}", text,
                                         key.substr(0, key.size() - 1),
                                         text.substr(key.size() - 1)));
        addRule(rules, key, pattern(std::string_view(text).substr(split + 1)));
    }
    if (!platform::isPropertyList(rules)) return ruleError("a rule has control characters");
    return rules;
}

Result<Dictionary> readRulesFile(const std::string& path) {
    Result<Value> value = platform::readPropertyListFile(path);
    if (!value) return value.error();
    if (const Dictionary* rules = value->dictionary()) return *rules;
    return ruleError(fmt::format("{}: not a dictionary of rules", path));
}

Dictionary mergeRules(Dictionary base, const Dictionary& over) {
    for (const auto& [key, value] : over) base.set(key, value);
    return base;
}

}  // namespace zrctl
