// An activation rule, and what a host offers: an array of both. Who may have more items accepts
// what was accepted before.
// Covers: platform/services/ActivationRule.cpp

#include "fuzz/Support.h"
#include "platform/services/Types.h"
#include "platform/values/Cbor.h"

using namespace platform;

namespace {

struct Prefixes final : Types {
    bool conforms(const std::string& type, const std::string& ancestor) override {
        return type.starts_with(ancestor);
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
    const Dictionary& offer = *(*both)[1].dictionary();
    const bool accepted = evaluateActivationRule(rule, offer, types);
    if (accepted && rule.dictionary())
        fuzz::require(evaluateActivationRule(wider(*rule.dictionary()), offer, types));
    return 0;
}
