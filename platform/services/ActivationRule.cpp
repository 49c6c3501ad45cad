#include <algorithm>
#include <bit>
#include <cstdint>

#include "platform/services/Types.h"

namespace platform {

namespace {

// Nobody means a rule or an offer beyond these.
constexpr std::size_t kMaxTypesOfRule = 256;
constexpr std::size_t kMaxItems = 4096;
constexpr std::size_t kMaxTypesOfItem = 256;
constexpr std::size_t kMaxTypesOfOffer = 16384;
constexpr std::size_t kBits = 64;

}  // namespace

ActivationOffer::ActivationOffer(const Dictionary& offer, Types& types) : types_(types) {
    const Value* list = offer.find("items");
    const Array* items = list ? list->array() : nullptr;
    if (!items || items->size() > kMaxItems) return;
    std::size_t typesLeft = kMaxTypesOfOffer;
    count_ = items->size();
    for (std::size_t i = 0; i < items->size(); ++i) {
        if (addItem((*items)[i], i, typesLeft)) continue;
        count_ = 0;
        return;
    }
}

/// False for an item of another shape, or with too many types.
bool ActivationOffer::addItem(const Value& item, std::size_t number, std::size_t& typesLeft) {
    const Dictionary* dictionary = item.dictionary();
    const Value* value = dictionary ? dictionary->find("types") : nullptr;
    const Array* types = value ? value->array() : nullptr;
    if (!types || types->size() > std::min(kMaxTypesOfItem, typesLeft)) return false;
    typesLeft -= types->size();
    for (const Value& type : *types) {
        if (!type.string()) return false;
        for (std::string& name : types_.lineage(type.string()->string())) {
            Items& items = conforming_[std::move(name)];
            items.resize((count_ + kBits - 1) / kBits);
            items[number / kBits] |= std::uint64_t{1} << number % kBits;
        }
    }
    return true;
}

bool ActivationOffer::isAcceptedBy(const Value& rule) const {
    if (equalsTrue(rule)) return true;
    const Dictionary* limits = rule.dictionary();
    if (!limits || limits->size() > kMaxTypesOfRule || count_ == 0) return false;
    const auto countOf = [](const Items& items) {
        std::int64_t count = 0;
        for (std::uint64_t bits : items) count += std::popcount(bits);
        return count;
    };
    Items listed((count_ + kBits - 1) / kBits);
    for (const auto& [type, value] : *limits) {
        const std::optional<std::int64_t> most = value.numberAsInteger();
        if (!most || *most < 0) return false;
        const auto found = conforming_.find(types_.name(type.string()));
        if (found == conforming_.end()) continue;
        if (countOf(found->second) > *most) return false;
        for (std::size_t i = 0; i < listed.size(); ++i) listed[i] |= found->second[i];
    }
    return countOf(listed) == static_cast<std::int64_t>(count_);
}

}  // namespace platform
