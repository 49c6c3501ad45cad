#include "zrd/RuleSet.h"

#include <algorithm>

#include "Zorvan/LogHandles.h"

namespace zorvan {

using platform::Array;
using platform::Dictionary;
using platform::Value;

namespace {

/// Lines about operators that do not exist, of one pattern: everybody waits for each.
constexpr std::size_t kMostTold = 256;

/// Takes the bytes of a value's texts and data off `left`; false when there are more.
bool takeBytes(const Value& value, std::size_t& left) {
    std::size_t bytes = 0;
    if (const auto* text = value.string()) bytes = text->size();
    if (const platform::Data* data = value.data()) bytes = data->bytes().size();
    if (bytes > left) return false;
    left -= bytes;
    const auto takeElement = [&](const Value& element) { return takeBytes(element, left); };
    if (const Array* array = value.array()) return std::ranges::all_of(*array, takeElement);
    const Dictionary* dictionary = value.dictionary();
    return !dictionary || std::ranges::all_of(*dictionary, [&](const Dictionary::Entry& entry) {
        if (entry.first.size() > left) return false;
        left -= entry.first.size();
        return takeElement(entry.second);
    });
}

}  // namespace

RulePattern::RulePattern(const Value& pattern, const std::shared_ptr<platform::Types>& types)
    : content_(read(pattern, types)) {}

RulePattern::Content RulePattern::read(const Value& pattern,
                                       const std::shared_ptr<platform::Types>& types) {
    if (platform::equalsTrue(pattern)) return Present();
    if (platform::equalsFalse(pattern)) return Absent();
    if (const Dictionary* offer = pattern.dictionary())
        return Offer{*offer, std::make_shared<platform::ActivationOffer>(*offer, *types)};
    if (!pattern.string() && !pattern.array()) return Never();
    Texts texts{TextPatterns(types), std::nullopt};
    std::vector<std::string> given;
    bool areKnown = true;
    const Array alternatives = pattern.array() ? *pattern.array() : Array{pattern};
    for (const Value& alternative : alternatives) {
        // What is no text matches nothing.
        if (!alternative.string()) continue;
        areKnown = texts.patterns.add(alternative.string()->string()) && areKnown;
        given.push_back(alternative.string()->string());
    }
    if (!areKnown) {
        const std::size_t walks = std::max<std::size_t>(kMostTold / given.size(), 1);
        texts.told = Told{std::move(given), types, walks};
    }
    return texts;
}

bool RulePattern::holds(const Texts& texts, std::string_view text) {
    if (!texts.told || texts.told->walks == 0) return texts.patterns.matches(text);
    --texts.told->walks;
    return std::ranges::any_of(texts.told->patterns, [&](const std::string& pattern) {
        TextPatterns alone(texts.told->types);
        if (alone.add(pattern)) return alone.matches(text);
        EVLOG_INFO(ops(), "unrecognized match operator:{}", pattern);
        return false;
    });
}

bool RulePattern::matches(const Value* value) const {
    if (std::holds_alternative<Present>(content_)) return value && !platform::equalsFalse(*value);
    if (std::holds_alternative<Absent>(content_)) return !value || platform::equalsFalse(*value);
    if (!value) return false;
    if (const auto* offer = std::get_if<Offer>(&content_)) {
        EVLOG_DEBUG(extension(), "evaluating VXExtension filter: {} value: {}", offer->dictionary,
                    *value);
        return offer->offer->isAcceptedBy(*value);
    }
    const auto* texts = std::get_if<Texts>(&content_);
    if (!texts) return false;
    if (const auto* text = value->string()) return holds(*texts, *text);
    const Array* elements = value->array();
    if (!elements) return false;
    return std::ranges::any_of(*elements, [&](const Value& element) {
        return element.string() && holds(*texts, *element.string());
    });
}

bool RuleSet::isAffordable(const Dictionary& rules, std::size_t times) {
    std::size_t bytes = times * kMaxBytes;
    const std::size_t values = times * kMaxValues;
    return rules.size() <= times * kMaxRules && platform::countValues(rules, values) <= values &&
           takeBytes(rules, bytes);
}

RuleSet::RuleSet(const Dictionary& rules, const std::shared_ptr<platform::Types>& types) {
    rules_.reserve(rules.size());
    for (const auto& [key, pattern] : rules)
        rules_.push_back({key.string(), RulePattern(pattern, types)});
}

}  // namespace zorvan
