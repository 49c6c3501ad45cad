// Attribute matching: the language of rules (docs/bundles.md tells it to plug-in authors).

#include <algorithm>
#include <string>
#include <string_view>

#include "Zorvan/Helpers.h"
#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/services/Types.h"
#include "zrd/PlugInContext.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

namespace {

constexpr std::string_view kConformsOperator = "?UT-CONFORMS:";
constexpr std::string_view kIsOperator = "?UT-IS:";

/// An operator of a string pattern: which outcome of the comparison it expects, and whether it
/// negates.
struct ComparisonOperator {
    std::string_view prefix;
    int expected;
    bool negated;
};

/// Tested in this order, so that the longer ones come first; the empty one takes every other
/// pattern.
constexpr ComparisonOperator kOperators[] = {
    {"<>", 0, true},  {"<=", 1, true}, {">=", -1, true}, {"=", 0, false},
    {"<", -1, false}, {">", 1, false}, {"", 0, false},
};

}  // namespace

struct ZRDPlugIn::RuleValue {
    const Value* borrowed = nullptr;
    std::optional<Value> made;
    bool failsAnyPattern = false;

    RuleValue(const Value* value) : borrowed(value) {}
    RuleValue(std::string text) : made(std::move(text)) {}
    static RuleValue neverMatching() {
        RuleValue value(nullptr);
        value.failsAnyPattern = true;
        return value;
    }

    const Value* get() const { return made ? &*made : borrowed; }
};

bool ZRDPlugIn::match(const Dictionary* rules) const {
    if (!rules) return true;
    return std::ranges::all_of(*rules, [this](const Dictionary::Entry& rule) {
        return matchKey(rule.first, rule.second);
    });
}

ZRDPlugIn::RuleValue ZRDPlugIn::valueForRule(const std::string& key) const {
    constexpr std::string_view entitlementPrefix = rule::kEntitlementPrefix;
    if (key.starts_with(entitlementPrefix)) {
        return valueForEntitlement(std::string_view(key).substr(entitlementPrefix.size()));
    }
    if (key == key::kExtensionIdentifier && !identifier().empty()) return identifier();
    if (key == rule::kUuid) return uuid().string();
    if (key == rule::kUserElection) return userElection();
    if (key == rule::kContainingApp) {
        if (!containingPath()) return RuleValue::neverMatching();
        return *containingPath();
    }
    if (key == key::kExtensionPoint) return extensionPoint_;
    return attributeOrInfoKey(key);
}

const Value* ZRDPlugIn::attributeOrInfoKey(std::string_view key) const {
    if (const Value* value = attribute(key)) return value;
    return infoKey(key);
}

std::string ZRDPlugIn::userElection() const {
    std::uint64_t election = 0;
    if (auto reader = context_->annotations.lock()) {
        if (auto annotation = reader->annotationForPlugIn(*this)) {
            const Value* stored = annotation->find(annotation::kElection);
            election = stored ? stored->numberAsBits().value_or(0) : 0;
        }
    }
    // Bits 8 to 15 are not part of the choice.
    auto bits = static_cast<std::uint32_t>(election) & ~std::uint32_t{0xFF00};
    return std::to_string(static_cast<std::int32_t>(bits));
}

bool ZRDPlugIn::matchKey(const std::string& key, const Value& pattern) const {
    RuleValue found = valueForRule(key);
    if (found.failsAnyPattern) return false;
    const Value* value = found.get();
    if (platform::equalsTrue(pattern)) return value && !platform::equalsFalse(*value);
    if (platform::equalsFalse(pattern)) return !value || platform::equalsFalse(*value);
    if (!value) return false;
    if (const Dictionary* offer = pattern.dictionary()) return matchDictionary(*value, *offer);
    if (value->string()) return matchValue(*value, pattern);
    if (const auto* elements = value->array()) {
        return std::ranges::any_of(
            *elements, [&](const Value& element) { return matchValue(element, pattern); });
    }
    return false;
}

bool ZRDPlugIn::matchValue(const Value& value, const Value& patterns) const {
    const std::string* text = value.string();
    if (!text) return false;
    if (const std::string* pattern = patterns.string()) return matchText(*text, *pattern);
    const auto* alternatives = patterns.array();
    return alternatives && std::ranges::any_of(*alternatives, [&](const Value& alternative) {
               return alternative.string() && matchText(*text, *alternative.string());
           });
}

bool ZRDPlugIn::matchText(const std::string& value, const std::string& pattern) const {
    if (pattern.starts_with('?')) {
        if (pattern.starts_with(kConformsOperator)) {
            return context_->types->conforms(value, pattern.substr(kConformsOperator.size()));
        }
        if (pattern.starts_with(kIsOperator)) {
            return context_->types->conforms(pattern.substr(kIsOperator.size()), value);
        }
        EVLOG_INFO(ops(), "unrecognized match operator:{}", pattern);
        return false;
    }
    const auto* chosen = std::ranges::find_if(kOperators, [&](const ComparisonOperator& candidate) {
        return pattern.starts_with(candidate.prefix);
    });
    std::string_view operand = std::string_view(pattern).substr(chosen->prefix.size());
    return (compareVersionString(value, operand) == chosen->expected) != chosen->negated;
}

bool ZRDPlugIn::matchDictionary(const Value& value, const Dictionary& pattern) const {
    EVLOG_DEBUG(extension(), "evaluating VXExtension filter: {} value: {}", pattern, value);
    return platform::evaluateActivationRule(value, pattern, *context_->types);
}

}  // namespace zorvan
