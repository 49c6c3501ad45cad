#include "zrd/RuleSet.h"

#include <algorithm>

#include "Zorvan/LogHandles.h"

namespace zorvan {

using platform::Array;
using platform::Dictionary;
using platform::Value;

namespace {

/// Takes the bytes of a value's texts and data off `left`; false when there are more.
bool takeBytes(const Value& value, std::size_t& left) {
    std::size_t bytes = 0;
    if (const std::string* text = value.string()) bytes = text->size();
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
    TextPatterns texts(types);
    if (const std::string* text = pattern.string()) {
        texts.add(*text);
    } else if (const Array* alternatives = pattern.array()) {
        // What is no text matches nothing.
        for (const Value& alternative : *alternatives)
            if (alternative.string()) texts.add(*alternative.string());
    } else {
        return Never();
    }
    return texts;
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
    const auto* texts = std::get_if<TextPatterns>(&content_);
    if (!texts) return false;
    if (const std::string* text = value->string()) return texts->matches(*text);
    const Array* elements = value->array();
    if (!elements) return false;
    const Value* end = elements->begin() + std::min(elements->size(), kMaxElements);
    return std::any_of(elements->begin(), end, [&](const Value& element) {
        return element.string() && texts->matches(*element.string());
    });
}

bool RuleSet::isAffordable(const Dictionary& rules) {
    std::size_t bytes = kMaxBytes;
    return rules.size() <= kMaxRules && platform::countValues(rules, kMaxValues) <= kMaxValues &&
           takeBytes(rules, bytes);
}

RuleSet::RuleSet(const Dictionary& rules, const std::shared_ptr<platform::Types>& types) {
    rules_.reserve(rules.size());
    for (const auto& [key, pattern] : rules) rules_.push_back({key, RulePattern(pattern, types)});
}

}  // namespace zorvan
