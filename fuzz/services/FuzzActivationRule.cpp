// An activation rule, and what a host offers: an array of both. Who may have more items accepts
// what was accepted before.
// Covers: platform/services/ActivationRule.cpp

#include <algorithm>

#include "fuzz/Support.h"
#include "platform/services/Types.h"
#include "platform/values/Cbor.h"

using namespace platform;

namespace {

/// Every type descends from what it begins with.
struct Prefixes final : Types {
    std::string name(const std::string& type) override { return type; }
    std::vector<std::string> lineage(const std::string& type) override {
        std::vector<std::string> names;
        for (std::size_t size = 0; size <= std::min<std::size_t>(type.size(), 32); ++size)
            names.push_back(type.substr(0, size));
        return names;
    }
};

/// The rule with room for one item more of each type.
Dictionary wider(const Dictionary& rule) {
    Dictionary wider;
    for (const auto& [type, most] : rule) {
        const std::int64_t count = most.numberAsInteger().value_or(-1);
        wider.set(type, count < INT64_MAX ? count + 1 : count);
    }
    return wider;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    Prefixes types;
    const auto value = decodeCbor(std::make_shared<const std::string>(fuzz::text(data, size)));
    const Array* both = value ? value->array() : nullptr;
    if (!both || both->size() != 2 || !(*both)[1].dictionary()) return 0;
    const Value& rule = (*both)[0];
    const ActivationOffer offer(*(*both)[1].dictionary(), types);
    const bool accepted = offer.isAcceptedBy(rule);
    if (accepted && rule.dictionary()) fuzz::require(offer.isAcceptedBy(wider(*rule.dictionary())));
    return 0;
}
