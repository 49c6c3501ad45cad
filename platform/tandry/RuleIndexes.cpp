#include "platform/tandry/RuleIndexes.h"

#include <algorithm>
#include <numeric>

namespace platform::tandry {

namespace {

/// So many keys have an index at a time, and an index has so many texts a plug-in, and so many
/// bytes of them where order counts.
constexpr std::size_t kMaxIndexes = 16;
constexpr std::size_t kMaxTexts = 16;
constexpr std::size_t kMaxTextBytes = 64;

/// What is asked of the rest costs less than what an index would.
constexpr std::size_t kFewPlugIns = 64;

constexpr std::string_view kEntitlement = "ENTITLEMENT:";

/// Keys that rules have for what bundles do not say, or that have an index of their own.
constexpr std::string_view kNotOfBundles[] = {"com.orbel.uuid", "VXUserElection",
                                              "VXExtensionContainingApp", "VXExtensionIdentifier",
                                              "VXExtensionPointIdentifier"};

/// Only keeps, of two, what leaves fewer.
void keepFewer(std::optional<Positions>& best, Positions other) {
    if (!best || other.size() < best->size()) best = std::move(other);
}

void takeOverPositions(const Positions& before, const Moves& moves, Positions& positions) {
    const auto fresh = static_cast<std::ptrdiff_t>(positions.size());
    for (const Position position : before)
        if (moves[position] != kGone) positions.push_back(moves[position]);
    std::inplace_merge(positions.begin(), positions.begin() + fresh, positions.end());
}

void append(Positions& positions, Position position) {
    if (positions.empty() || positions.back() != position) positions.push_back(position);
}

}  // namespace

RuleIndex::RuleIndex(std::string key, const TDPlugInProxyList& plugIns, const Positions& positions,
                     bool isOrdered)
    : key_(std::move(key)),
      isOrdered_(isOrdered),
      plugIns_(plugIns.size()),
      hasTextList_(isOrdered) {
    for (const Position position : positions) {
        add(*plugIns[position], position);
        dropExcess();
    }
    texts_.sort();
}

/// What is not used is not kept.
void RuleIndex::dropExcess() {
    if (texts_.size() > kMaxTexts * plugIns_) hasTexts_ = false;
    if (textList_.bytes() > kMaxTextBytes * plugIns_) hasTextList_ = false;
    if (!hasTexts_) texts_ = TextIndex();
    if (!hasTexts_ || !hasTextList_) textList_ = TextList();
}

void RuleIndex::addText(std::string_view text, Position position) {
    if (hasTexts_) texts_.add(text, position);
    if (hasTexts_ && hasTextList_) textList_.add(text, position);
}

/// Rules ask an attribute first, and then the Info.plist: both count here.
void RuleIndex::add(const TDPlugInProxy& plugIn, Position position) {
    const auto addFrom = [&](const Dictionary* dictionary, std::string_view key) {
        const Value* value = dictionary ? dictionary->find(key) : nullptr;
        if (!value) return;
        append(present_, position);
        if (equalsFalse(*value)) append(false_, position);
        if (const auto* text = value->string()) addText(*text, position);
        if (!value->array()) return;
        for (const Value& element : *value->array())
            if (element.string()) addText(*element.string(), position);
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
    takeOverPositions(before.present_, moves, present_);
    takeOverPositions(before.false_, moves, false_);
    hasTexts_ = hasTexts_ && before.hasTexts_;
    hasTextList_ = hasTextList_ && before.hasTextList_;
    if (hasTexts_) texts_.takeOver(before.texts_, moves);
    if (hasTexts_ && hasTextList_) textList_.takeOver(before.textList_, moves);
    dropExcess();
}

/// Who has nothing there, and who has what equals false.
Positions RuleIndex::withoutTruth() const {
    Positions positions;
    auto present = present_.begin();
    auto untrue = false_.begin();
    for (Position position = 0; position < plugIns_; ++position) {
        const bool isPresent = present != present_.end() && *present == position;
        const bool isFalse = untrue != false_.end() && *untrue == position;
        present += isPresent;
        untrue += isFalse;
        if (!isPresent || isFalse) positions.push_back(position);
    }
    return positions;
}

Positions RuleIndex::find(const Value& pattern) const {
    if (equalsFalse(pattern)) return withoutTruth();
    std::optional<Positions> found;
    if (hasTexts_) found = texts_.find(pattern, plugIns_);
    if (!found && hasTexts_ && hasTextList_) found = textList_.find(pattern);
    return found ? *std::move(found) : present_;
}

void RuleIndexes::takeOver(const RuleIndexes& before, const Moves& moves, const Positions& fresh) {
    std::scoped_lock lock(mutex_, before.mutex_);
    clock_ = before.clock_;
    for (const Entry& entry : before.entries_) {
        auto index = std::make_shared<RuleIndex>(entry.index->key(), plugIns_, fresh,
                                                 entry.index->isOrdered());
        index->takeOver(*entry.index, moves);
        entries_.push_back({std::move(index), entry.asked});
    }
}

bool RuleIndexes::isIndexed(std::string_view key) {
    return std::ranges::find(kNotOfBundles, key) == std::end(kNotOfBundles);
}

/// Null when there is none for such a pattern.
RuleIndexes::Shared RuleIndexes::known(std::string_view key, const Value& pattern) const {
    std::lock_guard lock(mutex_);
    const auto found = std::ranges::find_if(
        entries_, [key](const Entry& entry) { return entry.index->key() == key; });
    if (found == entries_.end()) return nullptr;
    if (!found->index->isOrdered() && TextList::isFor(pattern)) return nullptr;
    found->asked = ++clock_;
    return found->index;
}

RuleIndexes::Shared RuleIndexes::make(std::string_view key, const Value& pattern) const {
    Positions all(plugIns_.size());
    std::iota(all.begin(), all.end(), Position{0});
    auto index = std::make_shared<const RuleIndex>(std::string(key), plugIns_, all,
                                                   TextList::isFor(pattern));
    std::lock_guard lock(mutex_);
    std::erase_if(entries_, [key](const Entry& entry) { return entry.index->key() == key; });
    if (entries_.size() >= kMaxIndexes)
        entries_.erase(std::ranges::min_element(entries_, {}, &Entry::asked));
    entries_.push_back({index, ++clock_});
    return index;
}

std::optional<Positions> RuleIndexes::find(const Dictionary& query) const {
    std::optional<Positions> best;
    std::optional<Dictionary::Entry> unknown;
    for (const auto& [key, pattern] : query) {
        if (!isIndexed(key)) continue;
        if (const Shared index = known(key, pattern)) {
            keepFewer(best, index->find(pattern));
        } else if (!unknown) {
            unknown.emplace(key, pattern);
        }
    }
    if (unknown && plugIns_.size() > kFewPlugIns && (!best || best->size() > plugIns_.size() / 8))
        keepFewer(best, make(unknown->first, unknown->second)->find(unknown->second));
    return best;
}

}  // namespace platform::tandry
