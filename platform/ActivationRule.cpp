#include <cstdint>
#include <optional>
#include <vector>

#include "platform/Types.h"

namespace platform {

namespace {

/// An item with more types than this is not an offer that anybody means.
constexpr std::size_t kMaxTypesOfItem = 256;

struct Limit {
    const std::string& type;
    std::int64_t most;
    std::int64_t items = 0;
};

/// None when the rule has another shape.
std::optional<std::vector<Limit>> limitsOf(const Dictionary& rule) {
    std::vector<Limit> limits;
    limits.reserve(rule.size());
    for (const auto& [type, most] : rule) {
        const std::optional<std::int64_t> count = most.numberAsInteger();
        if (!count || *count < 0) return std::nullopt;
        limits.push_back({type, *count});
    }
    return limits;
}

/// The types of an offered item; null when it has another shape.
const Array* typesOf(const Value& item) {
    const Dictionary* dictionary = item.dictionary();
    const Value* value = dictionary ? dictionary->find("types") : nullptr;
    const Array* types = value ? value->array() : nullptr;
    if (!types || types->size() > kMaxTypesOfItem) return nullptr;
    for (const Value& type : *types)
        if (!type.string()) return nullptr;
    return types;
}

/// Counts an item for every limit that one of its types falls under. False when there is none, or
/// when a limit is exceeded: the count of the items looked at is bounded by the rule's, whatever
/// the size of the offer.
bool countItem(const Array& itemTypes, std::vector<Limit>& limits, Types& types) {
    bool counted = false;
    for (Limit& limit : limits) {
        for (const Value& type : itemTypes) {
            if (!types.conforms(*type.string(), limit.type)) continue;
            if (++limit.items > limit.most) return false;
            counted = true;
            break;
        }
    }
    return counted;
}

}  // namespace

bool evaluateActivationRule(const Value& rule, const Dictionary& offer, Types& types) {
    if (equalsTrue(rule)) return true;
    const Dictionary* dictionary = rule.dictionary();
    if (!dictionary) return false;
    std::optional<std::vector<Limit>> limits = limitsOf(*dictionary);
    const Value* list = offer.find("items");
    const Array* items = list ? list->array() : nullptr;
    if (!limits || !items || items->empty()) return false;
    for (const Value& item : *items) {
        const Array* itemTypes = typesOf(item);
        if (!itemTypes || !countItem(*itemTypes, *limits, types)) return false;
    }
    return true;
}

}  // namespace platform
