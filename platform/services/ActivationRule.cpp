#include <cstdint>
#include <optional>
#include <vector>

#include "platform/services/Types.h"

namespace platform {

namespace {

// Nobody means a rule or an offer beyond these. Each type of the offer is compared with each one of
// the rule at most once, so that an evaluation costs at most their product in questions.
constexpr std::size_t kMaxTypesOfRule = 256;
constexpr std::size_t kMaxItems = 4096;
constexpr std::size_t kMaxTypesOfItem = 256;
constexpr std::size_t kMaxTypesOfOffer = 16384;

struct Limit {
    const std::string& type;
    std::int64_t most;
    std::int64_t items = 0;
};

/// None when the rule has another shape, or lists too many types.
std::optional<std::vector<Limit>> limitsOf(const Dictionary& rule) {
    if (rule.size() > kMaxTypesOfRule) return std::nullopt;
    std::vector<Limit> limits;
    limits.reserve(rule.size());
    for (const auto& [type, most] : rule) {
        const std::optional<std::int64_t> count = most.numberAsInteger();
        if (!count || *count < 0) return std::nullopt;
        limits.push_back({type, *count});
    }
    return limits;
}

/// The types of an offered item; null when it has another shape, or too many of them.
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
/// when a limit is exceeded.
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
    if (!limits || !items || items->empty() || items->size() > kMaxItems) return false;
    std::size_t offered = 0;
    for (const Value& item : *items) {
        const Array* itemTypes = typesOf(item);
        if (!itemTypes || (offered += itemTypes->size()) > kMaxTypesOfOffer) return false;
        if (!countItem(*itemTypes, *limits, types)) return false;
    }
    return true;
}

}  // namespace platform
