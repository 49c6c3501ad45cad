// Attribute matching: the properties that rules speak of (docs/bundles.md tells it to plug-in
// authors). What the patterns mean is in RuleSet and TextPatterns.

#include <algorithm>
#include <string>
#include <string_view>

#include "Zorvan/Keys.h"
#include "zrd/PlugInContext.h"
#include "zrd/RuleSet.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

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

bool ZRDPlugIn::match(const RuleSet& rules) const {
    return std::ranges::all_of(rules.rules(), [this](const RuleSet::Rule& rule) {
        return matchKey(rule.key, rule.pattern);
    });
}

bool ZRDPlugIn::match(const Dictionary* rules) const {
    return !rules || match(RuleSet(*rules, context_->types));
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

bool ZRDPlugIn::matchKey(const std::string& key, const RulePattern& pattern) const {
    const RuleValue found = valueForRule(key);
    return !found.failsAnyPattern && pattern.matches(found.get());
}

bool ZRDPlugIn::matchKey(const std::string& key, const Value& pattern) const {
    return matchKey(key, RulePattern(pattern, context_->types));
}

}  // namespace zorvan
