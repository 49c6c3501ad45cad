#include "platform/tandry/RuleIndexes.h"

#include <algorithm>
#include <numeric>

namespace platform::tandry {

namespace {

/// So many keys have an index at a time, and an index has so many texts a plug-in.
constexpr std::size_t kMaxIndexes = 16;
constexpr std::size_t kMaxTexts = 16;

/// What is asked of the rest costs less than what an index would.
constexpr std::size_t kFewPlugIns = 64;

constexpr std::string_view kEntitlement = "ENTITLEMENT:";

/// Keys that rules have for what bundles do not say, or that have an index of their own.
constexpr std::string_view kNotOfBundles[] = {"com.orbel.uuid", "VXUserElection",
                                              "VXExtensionContainingApp", "VXExtensionIdentifier",
                                              "VXExtensionPointIdentifier"};

/// Only keeps, of two, what leaves fewer.
void keepFewer(std::optional<Positions>& best, std::optional<Positions> other) {
    if (other && (!best || other->size() < best->size())) best = std::move(other);
}

void takeOverPresent(const Positions& before, const Moves& moves, Positions& present) {
    const auto fresh = static_cast<std::ptrdiff_t>(present.size());
    for (const Position position : before)
        if (moves[position] != kGone) present.push_back(moves[position]);
    std::inplace_merge(present.begin(), present.begin() + fresh, present.end());
}

}  // namespace

RuleIndex::RuleIndex(std::string key, const TDPlugInProxyList& plugIns, const Positions& positions)
    : key_(std::move(key)) {
    for (const Position position : positions) add(*plugIns[position], position);
    texts_.sort();
}

/// Rules ask an attribute first, and then the Info.plist: both count here.
void RuleIndex::add(const TDPlugInProxy& plugIn, Position position) {
    const auto addFrom = [&](const Dictionary* dictionary, std::string_view key) {
        const Value* value = dictionary ? dictionary->find(key) : nullptr;
        if (!value) return;
        if (present_.empty() || present_.back() != position) present_.push_back(position);
        if (const auto* text = value->string()) texts_.add(*text, position);
        if (!value->array()) return;
        for (const Value& element : *value->array())
            if (element.string()) texts_.add(*element.string(), position);
    };
    if (key_.starts_with(kEntitlement)) {
        plugIn.entitlements.look([&](const Dictionary& entitlements) {
            addFrom(&entitlements, std::string_view(key_).substr(kEntitlement.size()));
        });
        return;
    }
    plugIn.infoPlist.look([&](const Dictionary& info) {
        addFrom(TDPlugInProxy::attributesIn(info), key_);
        addFrom(&info, key_);
    });
}

void RuleIndex::takeOver(const RuleIndex& before, const Moves& moves) {
    takeOverPresent(before.present_, moves, present_);
    texts_.takeOver(before.texts_, moves);
}

std::optional<Positions> RuleIndex::find(const Value& pattern, std::size_t plugIns) const {
    if (equalsFalse(pattern)) return std::nullopt;
    if (texts_.size() <= kMaxTexts * plugIns)
        if (auto found = texts_.find(pattern, plugIns)) return found;
    return present_;
}

void RuleIndexes::takeOver(const RuleIndexes& before, const Moves& moves, const Positions& fresh) {
    std::scoped_lock lock(mutex_, before.mutex_);
    clock_ = before.clock_;
    for (const Entry& entry : before.entries_) {
        auto index = std::make_shared<RuleIndex>(entry.index->key(), plugIns_, fresh);
        index->takeOver(*entry.index, moves);
        entries_.push_back({std::move(index), entry.asked});
    }
}

bool RuleIndexes::isIndexed(std::string_view key) {
    return std::ranges::find(kNotOfBundles, key) == std::end(kNotOfBundles);
}

RuleIndexes::Shared RuleIndexes::known(std::string_view key) const {
    std::lock_guard lock(mutex_);
    const auto found = std::ranges::find_if(
        entries_, [key](const Entry& entry) { return entry.index->key() == key; });
    if (found == entries_.end()) return nullptr;
    found->asked = ++clock_;
    return found->index;
}

RuleIndexes::Shared RuleIndexes::make(std::string_view key) const {
    Positions all(plugIns_.size());
    std::iota(all.begin(), all.end(), Position{0});
    auto index = std::make_shared<const RuleIndex>(std::string(key), plugIns_, all);
    std::lock_guard lock(mutex_);
    if (entries_.size() >= kMaxIndexes)
        entries_.erase(std::ranges::min_element(entries_, {}, &Entry::asked));
    entries_.push_back({index, ++clock_});
    return index;
}

std::optional<Positions> RuleIndexes::find(const Dictionary& query) const {
    std::optional<Positions> best;
    std::optional<Dictionary::Entry> unknown;
    for (const auto& [key, pattern] : query) {
        if (!isIndexed(key) || equalsFalse(pattern)) continue;
        if (const Shared index = known(key)) {
            keepFewer(best, index->find(pattern, plugIns_.size()));
        } else if (!unknown) {
            unknown.emplace(key, pattern);
        }
    }
    if (unknown && plugIns_.size() > kFewPlugIns && (!best || best->size() > plugIns_.size() / 8))
        keepFewer(best, make(unknown->first)->find(unknown->second, plugIns_.size()));
    return best;
}

}  // namespace platform::tandry
